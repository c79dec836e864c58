#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/URL.h"

namespace storix {

class SXError;
class Value;

/// A byte buffer: token data, for instance.
struct Data {
  std::string bytes;
  friend bool operator==(const Data &, const Data &) = default;
};

using List = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;

enum class ValueKind { boolean, number, string, URL, data, list, dictionary, error };

/// The name of a kind for messages to people: "string", "URL", "dictionary", ...
std::string_view valueKindName(ValueKind kind);

/// Any value that crosses the platform interface: a string, URL, byte buffer, number, boolean,
/// error value, or a list or dictionary of these. A value type, deep-copied, usable on any thread.
///
/// Strings are UTF-8. Numbers are 64-bit integers or doubles; both are the kind `number`.
class Value {
 public:
  Value(bool value) : content_(value) {}
  Value(int value) : content_(static_cast<std::int64_t>(value)) {}
  Value(std::int64_t value) : content_(value) {}
  Value(double value) : content_(value) {}
  Value(const char *value) : content_(std::string(value)) {}
  Value(std::string_view value) : content_(std::string(value)) {}
  Value(std::string value) : content_(std::move(value)) {}
  Value(URL value) : content_(std::move(value)) {}
  Value(Data value) : content_(std::move(value)) {}
  Value(List value) : content_(std::move(value)) {}
  Value(Dictionary value) : content_(std::move(value)) {}
  Value(SXError value);

  [[nodiscard]] ValueKind kind() const;

  /// Each gives a pointer into this value when it is of that kind, else null. The pointer is good
  /// until the value is changed or destroyed.
  [[nodiscard]] const bool *boolean() const { return std::get_if<bool>(&content_); }
  [[nodiscard]] const std::int64_t *integer() const { return std::get_if<std::int64_t>(&content_); }
  [[nodiscard]] const double *real() const { return std::get_if<double>(&content_); }
  [[nodiscard]] const std::string *string() const { return std::get_if<std::string>(&content_); }
  [[nodiscard]] const URL *url() const { return std::get_if<URL>(&content_); }
  [[nodiscard]] const Data *data() const { return std::get_if<Data>(&content_); }
  [[nodiscard]] const List *list() const { return std::get_if<List>(&content_); }
  [[nodiscard]] List *list() { return std::get_if<List>(&content_); }
  [[nodiscard]] const Dictionary *dictionary() const { return std::get_if<Dictionary>(&content_); }
  [[nodiscard]] Dictionary *dictionary() { return std::get_if<Dictionary>(&content_); }
  [[nodiscard]] const SXError *error() const;

  /// True for a number or boolean that is not zero or false; false for every other kind.
  [[nodiscard]] bool isTrueNumber() const;

  friend bool operator==(const Value &a, const Value &b);

 private:
  std::variant<bool, std::int64_t, double, std::string, URL, Data, List, Dictionary, std::shared_ptr<const SXError>>
      content_;
};

/// One argument of an operation or of its reply: absent, or a value.
using Argument = std::optional<Value>;
using Arguments = std::vector<Argument>;

}  // namespace storix
