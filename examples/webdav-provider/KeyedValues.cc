#include "examples/webdav-provider/KeyedValues.h"

#include <rapidjson/error/en.h>
#include <unistd.h>

#include <array>
#include <cerrno>

namespace storix::example {

std::optional<KeyedValues> KeyedValues::parse(std::string_view text, std::string *outReason) {
  KeyedValues values;
  values.document_.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseIterativeFlag>(text.data(),
                                                                                                 text.size());
  if (!values.document_.HasParseError() && values.document_.IsObject()) return values;
  if (outReason && values.document_.HasParseError()) {
    *outReason = "at byte " + std::to_string(values.document_.GetErrorOffset()) + ": " +
                 rapidjson::GetParseError_En(values.document_.GetParseError());
  } else if (outReason) {
    *outReason = "it is not a dictionary";
  }
  return std::nullopt;
}

std::optional<std::string> KeyedValues::string(const char *key) const {
  const auto member = document_.FindMember(key);
  if (member == document_.MemberEnd() || !member->value.IsString()) return std::nullopt;
  return std::string(member->value.GetString(), member->value.GetStringLength());
}

std::optional<std::int64_t> KeyedValues::integer(const char *key) const {
  const auto member = document_.FindMember(key);
  if (member == document_.MemberEnd() || !member->value.IsInt64()) return std::nullopt;
  return member->value.GetInt64();
}

std::optional<bool> KeyedValues::boolean(const char *key) const {
  const auto member = document_.FindMember(key);
  if (member == document_.MemberEnd() || !member->value.IsBool()) return std::nullopt;
  return member->value.GetBool();
}

Result<std::string> readWhole(int file, std::size_t limit) {
  std::string text;
  std::array<char, 4096> buffer{};
  for (;;) {
    const ssize_t count = ::read(file, buffer.data(), buffer.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return posixError(errno, "reading");
    if (count == 0) return text;
    text.append(buffer.data(), static_cast<std::size_t>(count));
    if (text.size() > limit) return posixError(EFBIG, "reading");
  }
}

}  // namespace storix::example
