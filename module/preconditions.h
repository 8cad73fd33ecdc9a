// Checks shared by the RouterRules operations of the listing and saving parts.
// Hidden inside the module like everything but the entry table.
#ifndef TC_PRECONDITIONS_H
#define TC_PRECONDITIONS_H

#include "olibc.h"

class TCHandler;

// True when the key file says router mode; logs why not otherwise.
bool IsRouterMode();
// Fills the caller's allocated, empty list with the bridges except the first
// "gbr" (any case): 0, or -1 when enumeration or removal fails.
int BridgeListGet(SzList** list);

// Owner of an adapter name list. Pushes and the bridge enumeration may move
// the list, so they get the address of the held pointer.
class SzListHolder {
 public:
  explicit SzListHolder(SzList* list = nullptr) : list_(list) {}
  ~SzListHolder() { Release(); }
  SzListHolder(const SzListHolder&) = delete;
  SzListHolder& operator=(const SzListHolder&) = delete;

  SzList* Get() const { return list_; }
  SzList** Out() { return &list_; }
  void Release() {
    if (list_ != nullptr) OLIBCSzListFree(list_);
    list_ = nullptr;
  }

 private:
  SzList* list_;
};

// The adapters of a RouterRules request, from its "direction": "upload"
// alone, or every bridge but "gbr". Allocates names with listSize. false when
// the request must end with the code the handler holds (1200 for an unknown
// direction or no bridge list, 1201 when the list itself fails).
bool RouterAdaptersSelect(TCHandler& h, int listSize, SzListHolder& names);

// Fixed paths of the appliance.
extern const char* const kKeyFile;     // "/etc/orviinfo.conf"
extern const char* const kLiveDir;     // "/etc/tc"
extern const char* const kStagingDir;  // "/etc/tc_tmp"

#endif
