#pragma once

#include <cstddef>

namespace storix {

/// How often the calling thread has allocated memory, in a test program that contains
/// TestAllocations.cc.
std::size_t allocationsOfThisThread();

}  // namespace storix
