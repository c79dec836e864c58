#include "platform/TestAllocations.h"

#include <cstdlib>
#include <new>

namespace {
thread_local std::size_t count = 0;
}

std::size_t storix::allocationsOfThisThread() { return count; }

// In a file of their own, where the compiler cannot inline one into what calls the other.
void *operator new(std::size_t size) {
  ++count;
  if (void *memory = std::malloc(size)) return memory;
  throw std::bad_alloc();
}
void operator delete(void *memory) noexcept { std::free(memory); }
void operator delete(void *memory, std::size_t) noexcept { std::free(memory); }
