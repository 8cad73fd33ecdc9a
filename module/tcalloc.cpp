#include "tcalloc.h"

#include <stdlib.h>

#include <atomic>

namespace tcalloc {
namespace {
std::atomic<int> gFailAfter{-1};

bool ShouldFail() {
  int left = gFailAfter.load(std::memory_order_relaxed);
  if (left < 0) return false;
  gFailAfter.store(left - 1, std::memory_order_relaxed);
  return left == 0;
}
}  // namespace

void* Malloc(size_t size) { return ShouldFail() ? nullptr : malloc(size); }
void* Realloc(void* ptr, size_t size) { return ShouldFail() ? nullptr : realloc(ptr, size); }
void FailAfter(int skip) { gFailAfter.store(skip, std::memory_order_relaxed); }

}  // namespace tcalloc
