#pragma once

#include <utility>
#include <variant>

#include "platform/SXError.h"

namespace storix {

/// A value, or the error that stands in its place.
template <class T>
class [[nodiscard]] Result {
 public:
  Result(T value) : content_(std::in_place_index<0>, std::move(value)) {}
  Result(SXError error) : content_(std::in_place_index<1>, std::move(error)) {}

  [[nodiscard]] bool ok() const { return content_.index() == 0; }
  explicit operator bool() const { return ok(); }

  /// Only where `ok`.
  T &value() { return *std::get_if<0>(&content_); }
  const T &value() const { return *std::get_if<0>(&content_); }
  /// Only where not `ok`.
  [[nodiscard]] const SXError &error() const { return *std::get_if<1>(&content_); }

 private:
  std::variant<T, SXError> content_;
};

}  // namespace storix
