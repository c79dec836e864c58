#include "platform/Value.h"

#include "platform/SXError.h"

namespace storix {

std::string_view valueKindName(ValueKind kind) {
  switch (kind) {
    case ValueKind::boolean:
      return "boolean";
    case ValueKind::number:
      return "number";
    case ValueKind::string:
      return "string";
    case ValueKind::URL:
      return "URL";
    case ValueKind::data:
      return "data";
    case ValueKind::list:
      return "list";
    case ValueKind::dictionary:
      return "dictionary";
    case ValueKind::error:
      return "error";
  }
  return "unknown kind";
}

Value::Value(SXError value) : content_(std::make_shared<const SXError>(std::move(value))) {}

ValueKind Value::kind() const {
  struct KindOf {
    ValueKind operator()(bool) const { return ValueKind::boolean; }
    ValueKind operator()(std::int64_t) const { return ValueKind::number; }
    ValueKind operator()(double) const { return ValueKind::number; }
    ValueKind operator()(const std::string &) const { return ValueKind::string; }
    ValueKind operator()(const URL &) const { return ValueKind::URL; }
    ValueKind operator()(const Data &) const { return ValueKind::data; }
    ValueKind operator()(const List &) const { return ValueKind::list; }
    ValueKind operator()(const Dictionary &) const { return ValueKind::dictionary; }
    ValueKind operator()(const std::shared_ptr<const SXError> &) const { return ValueKind::error; }
  };
  return std::visit(KindOf(), content_);
}

const SXError *Value::error() const {
  const auto *held = std::get_if<std::shared_ptr<const SXError>>(&content_);
  return held ? held->get() : nullptr;
}

bool Value::isTrueNumber() const {
  if (const bool *flag = boolean()) return *flag;
  if (const std::int64_t *whole = integer()) return *whole != 0;
  if (const double *number = real()) return *number != 0;
  return false;
}

bool operator==(const Value &a, const Value &b) {
  if (const SXError *error = a.error()) return b.error() && *error == *b.error();
  return a.content_ == b.content_;
}

}  // namespace storix
