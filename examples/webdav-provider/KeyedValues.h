#pragma once

#include <rapidjson/document.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Result.h"

namespace storix::example {

/// The dictionary of a keyed-value file, with the few kinds of values that the provider's files hold.
class KeyedValues {
 public:
  /// None where the text is no dictionary; then the reason says what is wrong.
  static std::optional<KeyedValues> parse(std::string_view text, std::string *outReason = nullptr);

  /// Absent where the key is missing, or its value of another kind.
  [[nodiscard]] std::optional<std::string> string(const char *key) const;
  [[nodiscard]] std::optional<std::int64_t> integer(const char *key) const;
  [[nodiscard]] std::optional<bool> boolean(const char *key) const;
  [[nodiscard]] bool has(const char *key) const { return document_.HasMember(key); }

 private:
  rapidjson::Document document_;
};

/// Everything in an opened file of at most `limit` bytes.
Result<std::string> readWhole(int file, std::size_t limit);

}  // namespace storix::example
