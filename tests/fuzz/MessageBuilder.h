#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

#include "wire/SdBus.h"
#include "wire/UniqueFd.h"

namespace storix::fuzz {

/// Makes D-Bus messages of arbitrary bytes: they say which values stand in the message, mostly those that
/// the signature asks for and now and then others. So the inventions of a fuzzer get past the framing, to
/// what is made of a well-formed message.
class MessageBuilder {
 public:
  MessageBuilder(const std::uint8_t *bytes, std::size_t size) : bytes_(bytes), left_(size) {}

  /// A sealed message of that signature, or of another one; null where the bytes made none.
  wire::OwnedMessage message(std::string_view signature);
  /// An empty one.
  static wire::OwnedMessage emptyMessage();

  std::uint8_t nextByte();

 private:
  bool append(sd_bus_message *message, std::string_view type, int depth);
  bool appendBasic(sd_bus_message *message, char type);
  bool appendVariant(sd_bus_message *message, int depth);
  std::string nextText();

  const std::uint8_t *bytes_;
  std::size_t left_;
};

}  // namespace storix::fuzz
