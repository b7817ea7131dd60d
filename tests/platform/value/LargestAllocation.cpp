#include "tests/platform/value/LargestAllocation.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace {

std::atomic<size_t> gLargest{0};

void* trackedAllocation(size_t size) noexcept {
  size_t seen = gLargest.load(std::memory_order_relaxed);
  while (size > seen && !gLargest.compare_exchange_weak(seen, size)) {
  }
  return std::malloc(size == 0 ? 1 : size);
}

}  // namespace

namespace tn::test {

void resetLargestAllocation() { gLargest = 0; }
size_t largestAllocation() { return gLargest; }

}  // namespace tn::test

// Every unaligned form is replaced so that each allocation and its release
// meet in malloc/free, whichever form made them. This file holds nothing
// else, so no caller sees new and free side by side.
void* operator new(size_t size) {
  if (void* p = trackedAllocation(size)) return p;
  throw std::bad_alloc();
}
void* operator new[](size_t size) {
  if (void* p = trackedAllocation(size)) return p;
  throw std::bad_alloc();
}
void* operator new(size_t size, const std::nothrow_t&) noexcept { return trackedAllocation(size); }
void* operator new[](size_t size, const std::nothrow_t&) noexcept { return trackedAllocation(size); }
void operator delete(void* p) noexcept { std::free(p); }
void operator delete[](void* p) noexcept { std::free(p); }
void operator delete(void* p, size_t) noexcept { std::free(p); }
void operator delete[](void* p, size_t) noexcept { std::free(p); }
void operator delete(void* p, const std::nothrow_t&) noexcept { std::free(p); }
void operator delete[](void* p, const std::nothrow_t&) noexcept { std::free(p); }
