// Port lists as users type them: normalisation of "SELF" and "SYS" lists and
// the check of a normalised "SELF" list.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "olibc.h"
#include "orvi_service_conf.h"
#include "tcalloc.h"
#include "tclog.h"

namespace {

const int kScratchListSize = 1024;
const int kPortsBufSize = 1024;
const char kPortsSep[] = ",";

// The scratch list of one call, released on every path. OLIBCStrTok may move
// the list, so it is handed the address of the pointer held here.
class ScratchList {
 public:
  ScratchList() : list_(OLIBCSzListAlloc(kScratchListSize)) {}
  ~ScratchList() { OLIBCSzListFree(list_); }
  ScratchList(const ScratchList&) = delete;
  ScratchList& operator=(const ScratchList&) = delete;

  SzList* get() const { return list_; }
  SzList** addr() { return &list_; }

 private:
  SzList* list_;
};

// Splits text at the commas into the scratch list; false after logging why.
bool SplitPorts(const char* text, ScratchList& list) {
  if (list.get() == nullptr) {
    TC_LOG_ERR("Failed to allocate list");
    return false;
  }
  if (OLIBCStrTok(text, kPortsSep, list.addr()) < 0) {
    TC_LOG_ERR("Failed to strtok ports (%s)", text);
    return false;
  }
  return true;
}

bool IsPort(const char* text) { return ORVIServiceConfPortsCheck(text) == 1; }

}  // namespace

int TCHandler::PortsFormatNormalize(char const* ports, char** out, int* size) {
  if (ports == nullptr || out == nullptr || size == nullptr) {
    TC_LOG_ERR("szPorts should not be NULL");
    return -1;
  }
  ScratchList list;
  if (!SplitPorts(ports, list)) return -1;
  for (int i = 0; i < list.get()->count; ++i) {
    char* item = OLIBCSzListGet(list.get(), i);
    if (item == nullptr) continue;
    if (OLIBCStrTrimSpace(item, 0) < 0) {
      TC_LOG_ERR("Failed to OLIBCStrTrimSpace (%s)", item);
      return -1;
    }
  }
  *size = kPortsBufSize;
  *out = static_cast<char*>(tcalloc::Malloc(kPortsBufSize));
  if (*out == nullptr) {
    TC_LOG_ERR("Failed to alloc memory");
    TC_ERR_SET(OLIBC_ERR_NOMEM);
    return -1;
  }
  // An empty list joins to nothing; the text must still be terminated.
  (*out)[0] = '\0';
  if (OLIBCSzListJoin(list.get(), kPortsSep, out, size) < 0) {
    TC_LOG_ERR("Failed to OLIBCSzListJoin()");
    return -1;
  }
  return 0;
}

int TCHandler::PortsSELFCheck(char const* szPorts) {
  if (szPorts == nullptr) {
    TC_LOG_ERR("szPorts should not be NULL");
    return -1;
  }
  ScratchList list;
  if (!SplitPorts(szPorts, list)) return -1;
  const int count = list.get()->count;
  for (int i = 0; i < count; ++i) {
    const char* stored = OLIBCSzListGet(list.get(), i);
    if (stored == nullptr) continue;
    char item[kPortsBufSize];
    snprintf(item, sizeof item, "%s", stored);

    char* dash = strchr(item, '-');
    if (dash == nullptr) {
      if (!IsPort(item)) {
        TC_LOG_ERR("Format error! (%s) 0 <= port number < 65536 ", item);
        return -1;
      }
      continue;
    }
    // A range stands alone: it is the whole selection.
    if (count > 1) {
      TC_LOG_ERR("Format error! (%s) You can input just one port range setting without other ports",
                 item);
      return -1;
    }
    *dash = '\0';
    const char* low = item;
    const char* high = dash + 1;
    if (!IsPort(high)) {
      TC_LOG_ERR("Format error! (%s) 0 <= port number < 65536 ", high);
      return -1;
    }
    const long highNum = strtol(high, nullptr, 10);
    if (!IsPort(low)) {
      TC_LOG_ERR("Format error! (%s) 0 <= port number < 65536 ", low);
      return -1;
    }
    const long lowNum = strtol(low, nullptr, 10);
    if (highNum < lowNum) {
      TC_LOG_ERR("Format error! (%s) must <= (%s)", low, high);
      return -1;
    }
  }
  return 0;
}
