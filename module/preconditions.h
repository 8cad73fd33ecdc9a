// Checks shared by the RouterRules operations of the listing and saving parts.
// Hidden inside the module like everything but the entry table.
#ifndef TC_PRECONDITIONS_H
#define TC_PRECONDITIONS_H

#include "olibc.h"

// True when the key file says router mode; logs why not otherwise.
bool IsRouterMode();
// Fills the caller's allocated, empty list with the bridges except the first
// "gbr" (any case): 0, or -1 when enumeration or removal fails.
int BridgeListGet(SzList** list);

// Fixed paths of the appliance.
extern const char* const kKeyFile;     // "/etc/orviinfo.conf"
extern const char* const kLiveDir;     // "/etc/tc"
extern const char* const kStagingDir;  // "/etc/tc_tmp"

#endif
