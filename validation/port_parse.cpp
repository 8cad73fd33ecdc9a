// The port keys of a rule: type, direction and the "SYS"/"SELF" port lists,
// checked and rewritten in place.
#include <stdio.h>
#include <string.h>

#include <string>

#include "ORVI.Core.Network.TrafficControl.h"
#include "json_util.h"
#include "tclog.h"

namespace {

const size_t kPortsBufSize = 1024;

// Replaces "port_num" by its normal form. On success `normal` owns the text
// now stored in the rule; on failure "port_num" is unchanged.
int NormalizePortNum(TCHandler& handler, Json::Value& rule, tcjson::CBuffer& normal) {
  const Json::Value* num = tcjson::Member(rule, "port_num");
  if (num == nullptr || !num->isString()) {
    TC_LOG_ERR("ports -> port_num must be of type string");
    return -1;
  }
  // Only what fits the fixed buffer is used; a longer list is cut.
  char copy[kPortsBufSize] = {0};
  snprintf(copy, sizeof copy, "%s", num->asCString());

  char* raw = nullptr;
  int size = 0;
  int rc = handler.PortsFormatNormalize(copy, &raw, &size);
  normal.reset(raw);
  if (rc < 0) {
    TC_LOG_ERR("Failed to PortsFormatNormalize() (%s)", copy);
    return -1;
  }
  rule["port_num"] = Json::Value(normal.get());
  return 0;
}

}  // namespace

int TCHandler::PortsParseSet(Json::Value& rule) {
  const Json::Value* type = tcjson::Member(rule, "port_type");
  if (type == nullptr || !type->isString()) {
    TC_LOG_ERR("ports -> port_type must be of type string");
    return -1;
  }
  const std::string portType = type->asString();

  const Json::Value* direction = tcjson::Member(rule, "port_direction");
  if (direction == nullptr) {
    rule["port_direction"] = "src";
  } else if (!direction->isString() ||
             (direction->asString() != "src" && direction->asString() != "dest")) {
    TC_LOG_ERR("port direction(%s) is error must be dest or src",
               tcjson::Shown(*direction).c_str());
    return -1;
  }

  if (portType == "ALL") return 0;
  if (portType == "SYS") {
    if (ParseSYS(rule) < 0) {
      TC_LOG_ERR("Failed to parse type SYS");
      return -1;
    }
    return 0;
  }
  if (portType == "SELF") {
    if (ParseSELF(rule) < 0) {
      TC_LOG_ERR("Failed to parse type SELF");
      return -1;
    }
    return 0;
  }
  TC_LOG_ERR("port -> port_type must be ALL/SYS/SELF");
  return -1;
}

int TCHandler::ParseSYS(Json::Value& rule) {
  tcjson::CBuffer normal;
  return NormalizePortNum(*this, rule, normal);
}

int TCHandler::ParseSELF(Json::Value& rule) {
  tcjson::CBuffer normal;
  if (NormalizePortNum(*this, rule, normal) < 0) return -1;
  if (PortsSELFCheck(normal.get()) < 0) {
    TC_LOG_ERR("Failed to PortsSELFCheck() (%s)", normal.get());
    return -1;
  }
  return 0;
}
