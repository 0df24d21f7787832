// Counts what operator new allocates.
//
// A sanitizer of clang brings an operator new of its own, in the program and not in a library, and
// a program has only one. There the sanitizer tells of each allocation, by its malloc() too.

#include "filter/testing/CountedAllocations.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace {
std::atomic<size_t> allocations{0};
}

#if defined(__has_feature)
#if __has_feature(thread_sanitizer) || __has_feature(address_sanitizer)
#define TESSEL_SANITIZER_ALLOCATES
#endif
#endif

#ifdef TESSEL_SANITIZER_ALLOCATES
// NOLINTNEXTLINE(bugprone-reserved-identifier): the sanitizer chose the name
extern "C" void __sanitizer_malloc_hook(const volatile void*, size_t) {
  allocations.fetch_add(1, std::memory_order_relaxed);
}
#else
void* operator new(size_t size, const std::nothrow_t&) noexcept {
  allocations.fetch_add(1, std::memory_order_relaxed);
  return std::malloc(size == 0 ? 1 : size);
}
void* operator new(size_t size) {
  if (void* memory = operator new(size, std::nothrow)) return memory;
  throw std::bad_alloc();
}
void operator delete(void* memory) noexcept { std::free(memory); }
void operator delete(void* memory, size_t) noexcept { std::free(memory); }
#endif

namespace tessel::testing {

size_t allocationsSoFar() { return allocations.load(std::memory_order_relaxed); }

}  // namespace tessel::testing
