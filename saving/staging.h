// Internals shared by the saving sources.
#ifndef TC_SAVING_STAGING_H
#define TC_SAVING_STAGING_H

#include "ORVI.Core.Network.TrafficControl.h"

namespace staging {

// ConfMove as the handler runs it, telling in addition whether the removal of
// the destination had begun when the move failed: then the destination may be
// gone or incomplete, and the source is the only sure copy of the rules.
bool MoveReplacing(TCHandler& handler, const char* src, const char* dst, bool* dstTouched);

}  // namespace staging

#endif
