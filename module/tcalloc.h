// The module's C allocations for buffers that the platform frees or
// reallocates. They go through here so that tests can make one fail; the
// production path is a plain call to malloc/realloc.
#ifndef TC_ALLOC_H
#define TC_ALLOC_H

#include <stddef.h>

namespace tcalloc {

void* Malloc(size_t size);
void* Realloc(void* ptr, size_t size);

// Test seam: after `skip` more successful allocations, the next one fails.
// A negative skip switches failure injection off (the default).
void FailAfter(int skip);

}  // namespace tcalloc

#endif
