#include "tests/e2e/hostile/WireBytes.h"

namespace storix::e2e {

Body &Body::align(std::size_t boundary) {
  bytes_.resize((bytes_.size() + boundary - 1) / boundary * boundary);
  return *this;
}

Body &Body::byte(std::uint8_t value) {
  bytes_ += static_cast<char>(value);
  return *this;
}

Body &Body::number(std::uint32_t value) {
  align(4);
  for (int shift = 0; shift < 32; shift += 8) byte(static_cast<std::uint8_t>(value >> shift));
  return *this;
}

Body &Body::longNumber(std::uint64_t value) {
  align(8);
  number(static_cast<std::uint32_t>(value));
  return number(static_cast<std::uint32_t>(value >> 32));
}

Body &Body::string(std::string_view text) {
  number(static_cast<std::uint32_t>(text.size()));
  bytes_ += text;
  return byte(0);
}

Body &Body::signature(std::string_view text) {
  byte(static_cast<std::uint8_t>(text.size()));
  bytes_ += text;
  return byte(0);
}

Body &Body::optionalString(std::optional<std::string_view> text) {
  if (!text) return number(0);
  number(static_cast<std::uint32_t>(4 + text->size() + 1));
  return string(*text);
}

Body &Body::raw(std::string_view bytes) {
  bytes_ += bytes;
  return *this;
}

std::string Message::bytes() const {
  Body header;
  for (const auto &[code, content] : fields) {
    const auto &[kind, text] = content;
    header.align(8).byte(code).signature(std::string(1, kind));
    if (kind == 'g') {
      header.signature(text);
    } else if (kind == 'u') {
      header.number(static_cast<std::uint32_t>(std::stoul(text)));
    } else {
      header.string(text);
    }
  }
  Body whole;
  whole.byte(static_cast<std::uint8_t>(endianness)).byte(type).byte(flags).byte(version);
  whole.number(bodyLength.value_or(static_cast<std::uint32_t>(body.size()))).number(serial);
  whole.number(fieldsLength.value_or(static_cast<std::uint32_t>(header.bytes().size())));
  whole.raw(header.bytes()).align(8).raw(body);
  return whole.bytes();
}

Message Message::call(std::string_view path, std::string_view interface, std::string_view member,
                      std::string_view signature, const Body &body) {
  Message message;
  message.fields.push_back({1, {'o', std::string(path)}});
  message.fields.push_back({2, {'s', std::string(interface)}});
  message.fields.push_back({3, {'s', std::string(member)}});
  if (!signature.empty()) message.fields.push_back({8, {'g', std::string(signature)}});
  message.body = body.bytes();
  return message;
}

Message Message::service(std::string_view member, std::string_view signature, const Body &body) {
  return call(servicePath, serviceInterface, member, signature, body);
}

Message Message::platform(std::string_view interface, std::string_view member, std::string_view signature,
                          const Body &body) {
  return call(platformPath, "com.tessel.Platform." + std::string(interface), member, signature, body);
}

Body itemArguments(std::string_view url, std::string_view provider, std::string_view consumer) {
  return Body().optionalString(url).align(4).optionalString(provider).align(4).optionalString(consumer);
}

}  // namespace storix::e2e
