#include "tests/fuzz/Target.h"

#include <cstdio>
#include <cstdlib>

namespace storix::fuzz {

void require(bool holds, std::string_view what) {
  if (holds) return;
  std::fprintf(stderr, "%.*s\n", static_cast<int>(what.size()), what.data());
  std::abort();
}

}  // namespace storix::fuzz
