// Internals shared by the saving sources.
#ifndef TC_SAVING_STAGING_H
#define TC_SAVING_STAGING_H

#include "ORVI.Core.Network.TrafficControl.h"

namespace staging {

// ConfMove as the handler runs it, telling in addition whether the
// destination had already been removed when the move program failed: then
// the source is the only copy left of what the destination held.
bool MoveReplacing(TCHandler& handler, const char* src, const char* dst, bool* dstRemoved);

}  // namespace staging

#endif
