#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

/// One program per parser defines this. libFuzzer calls it with its inventions, ReplayCorpus.cc with what
/// is kept in corpus/; whatever it finds broken ends the process.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size);

namespace storix::fuzz {

/// Ends the process, with a sentence, when what must hold for every input does not.
void require(bool holds, std::string_view what);

inline std::string_view textOf(const std::uint8_t *bytes, std::size_t size) {
  return {reinterpret_cast<const char *>(bytes), size};
}

}  // namespace storix::fuzz
