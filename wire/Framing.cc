#include "wire/Framing.h"

#include <algorithm>

namespace storix::wire {

namespace {
constexpr char protocolVersion = 1;
}  // namespace

FixedHeader FixedHeader::of(std::string_view message) {
  FixedHeader header;
  std::copy_n(message.begin(), std::min(size, message.size()), header.bytes.begin());
  return header;
}

std::size_t FixedHeader::numberAt(std::size_t offset) const {
  std::size_t number = 0;
  for (std::size_t i = 0; i < 4; ++i) {
    const std::size_t position = isLittleEndian() ? offset + 3 - i : offset + i;
    number = number << 8 | static_cast<std::uint8_t>(bytes[position]);
  }
  return number;
}

Framing::Verdict FixedHeader::verdict() const {
  if (bytes[0] != 'l' && bytes[0] != 'B') return Framing::Verdict::noMessage;
  // sd-bus would read a later version in its own way, and wait for what never comes.
  if (bytes[3] != protocolVersion) return Framing::Verdict::otherVersion;
  return messageSize() > maximumMessageSize ? Framing::Verdict::tooLarge : Framing::Verdict::read;
}

}  // namespace storix::wire
