// Reading a stored ports field ("ALL::src", "SELF:777:src", "SYS:cifs")
// back into the three port members of a rule object.
#include <string.h>
#include <strings.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "tclog.h"

// A literal so that it can serve as a log format.
#define TC_PORT_FORMAT_HINT \
  "port format should be one of ALL/SELF/SYS, ex: ALL::src, SELF:777:src, SYS:cifs"

// The stored text is only read, never copied or cut: the pieces go straight
// into JSON strings, which own their text, so there is no working copy whose
// allocation could fail.
int TCHandler::PortsParseGet(char const* ports, Json::Value& out) {
  if (ports == nullptr || ports[0] == '\0') {
    TC_LOG_ERR("Ports format error");
    return -1;
  }

  const char* rest = nullptr;
  if (strncasecmp(ports, "ALL", 3) == 0) {
    out["port_type"] = "ALL";
    // The bare three-letter form carries no port list at all.
    if (ports[3] == '\0') {
      out["port_direction"] = "src";
      return 0;
    }
    // The fourth character is a separator whatever it is.
    rest = ports + 4;
  } else if (strncasecmp(ports, "SELF:", 5) == 0) {
    out["port_type"] = "SELF";
    rest = ports + 5;
  } else if (strncasecmp(ports, "SYS:", 4) == 0) {
    out["port_type"] = "SYS";
    rest = ports + 4;
  } else {
    TC_LOG_ERR(TC_PORT_FORMAT_HINT);
    return -1;
  }

  const char* colon = strchr(rest, ':');
  if (colon == nullptr) {
    out["port_direction"] = "src";
    out["port_num"] = rest;
    return 0;
  }
  if (colon[1] == '\0') {
    TC_LOG_ERR(TC_PORT_FORMAT_HINT);
    return -1;
  }
  // Everything after the first colon is the direction, further colons included.
  out["port_direction"] = strcasecmp(colon + 1, "src") == 0 ? "src" : "dest";
  out["port_num"] = Json::Value(rest, colon);
  return 0;
}
