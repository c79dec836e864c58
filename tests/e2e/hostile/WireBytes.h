#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace storix::e2e {

/// The body of a D-Bus message, written by hand: nobody keeps it from being wrong.
class Body {
 public:
  Body &align(std::size_t boundary);
  Body &byte(std::uint8_t value);
  Body &number(std::uint32_t value);
  Body &longNumber(std::uint64_t value);
  Body &string(std::string_view text);
  Body &signature(std::string_view text);
  /// "as" with one text or none.
  Body &optionalString(std::optional<std::string_view> text);
  Body &raw(std::string_view bytes);

  [[nodiscard]] const std::string &bytes() const { return bytes_; }

 private:
  std::string bytes_;
};

/// A D-Bus message, byte for byte. The members that stand in its header may be anything.
struct Message {
  char endianness = 'l';
  std::uint8_t type = 1;
  std::uint8_t flags = 0;
  std::uint8_t version = 1;
  std::uint32_t serial = 1;
  /// A field of the header: its code, its type and its text or number.
  using Field = std::pair<std::uint8_t, std::pair<char, std::string>>;
  std::vector<Field> fields;
  std::string body;
  std::optional<std::uint32_t> bodyLength;
  std::optional<std::uint32_t> fieldsLength;

  [[nodiscard]] std::string bytes() const;

  static constexpr std::uint8_t noReplyExpected = 1;
  static constexpr const char *servicePath = "/com/tessel/Storix";
  static constexpr const char *serviceInterface = "com.tessel.Storix.Daemon";
  static constexpr const char *platformPath = "/com/tessel/Platform";

  static Message call(std::string_view path, std::string_view interface, std::string_view member,
                      std::string_view signature = {}, const Body &body = {});
  /// A call of the service's interface.
  static Message service(std::string_view member, std::string_view signature = {}, const Body &body = {});
  /// A call of com.tessel.Platform.INTERFACE.
  static Message platform(std::string_view interface, std::string_view member, std::string_view signature = {},
                          const Body &body = {});
  Message &numbered(std::uint32_t wanted) {
    serial = wanted;
    return *this;
  }
};

/// "asasas" with a URL, a provider and a consumer: what the requests about an item take.
Body itemArguments(std::string_view url, std::string_view provider, std::string_view consumer);

}  // namespace storix::e2e
