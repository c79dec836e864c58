#include "wire/DescriptorCall.h"

#include <systemd/sd-bus.h>

#include <cstdint>

#include "wire/Framing.h"

namespace storix::wire {

namespace {

enum Field : std::uint8_t { pathField = 1, interfaceField = 2, memberField = 3, signatureField = 8, countField = 9 };

constexpr std::size_t typePosition = 1;

struct Fields {
  BusTarget target;
  std::string_view signature;
  std::uint32_t descriptors = 0;
};

std::size_t aligned(std::size_t position, std::size_t boundary) {
  return (position + boundary - 1) / boundary * boundary;
}

/// Reads the fields of a header, front to back; nothing beyond them.
class FieldReader {
 public:
  FieldReader(std::string_view header, bool littleEndian)
      : header_(header), position_(FixedHeader::size), littleEndian_(littleEndian) {}

  /// None when what stands there are no fields.
  std::optional<Fields> read() {
    Fields fields;
    while (position_ < header_.size()) {
      if (!readField(fields)) return std::nullopt;
    }
    return fields;
  }

 private:
  bool readField(Fields &fields) {
    position_ = aligned(position_, 8);
    const std::optional<std::string_view> begin = take(4);
    // A code, and the type of one value as a signature.
    if (!begin || (*begin)[1] != 1 || (*begin)[3] != '\0') return false;
    const auto code = static_cast<std::uint8_t>((*begin)[0]);
    const char type = (*begin)[2];
    if (type == 'u') {
      const std::optional<std::uint32_t> number = readNumber();
      if (number && code == countField) fields.descriptors = *number;
      return number.has_value() && code == countField;
    }
    if (type != 's' && type != 'o' && type != 'g') return false;
    const std::optional<std::string_view> text = readText(type == 'g');
    if (!text) return false;
    if (code == pathField) fields.target.path = *text;
    if (code == interfaceField) fields.target.interface = *text;
    if (code == memberField) fields.target.member = *text;
    if (code == signatureField) fields.signature = *text;
    return true;
  }

  std::optional<std::string_view> take(std::size_t count) {
    if (position_ > header_.size() || header_.size() - position_ < count) return std::nullopt;
    const std::string_view taken = header_.substr(position_, count);
    position_ += count;
    return taken;
  }

  std::optional<std::uint32_t> readNumber() {
    position_ = aligned(position_, 4);
    const std::optional<std::string_view> bytes = take(4);
    if (!bytes) return std::nullopt;
    std::uint32_t number = 0;
    for (std::size_t i = 0; i < 4; ++i) {
      number = number << 8 | static_cast<std::uint8_t>((*bytes)[littleEndian_ ? 3 - i : i]);
    }
    return number;
  }

  std::optional<std::string_view> readText(bool isSignature) {
    std::size_t length = 0;
    if (isSignature) {
      const std::optional<std::string_view> byte = take(1);
      if (!byte) return std::nullopt;
      length = static_cast<std::uint8_t>(byte->front());
    } else {
      const std::optional<std::uint32_t> number = readNumber();
      if (!number) return std::nullopt;
      length = *number;
    }
    const std::optional<std::string_view> text = take(length);
    return text && take(1) ? text : std::nullopt;
  }

  const std::string_view header_;
  std::size_t position_;
  const bool littleEndian_;
};

class FieldWriter {
 public:
  explicit FieldWriter(bool littleEndian) : littleEndian_(littleEndian) {}

  void text(Field code, char type, std::string_view value) {
    begin(code, type);
    if (type == 'g') {
      bytes_ += static_cast<char>(value.size());
    } else {
      append(value.size());
    }
    bytes_ += value;
    bytes_ += '\0';
  }
  void number(Field code, std::size_t value) {
    begin(code, 'u');
    append(value);
  }

  /// Four bytes.
  void append(std::size_t value) {
    for (unsigned i = 0; i < 4; ++i) bytes_ += static_cast<char>(value >> 8 * (littleEndian_ ? i : 3 - i) & 0xff);
  }
  void pad() { bytes_.resize(aligned(bytes_.size(), 8)); }

  [[nodiscard]] const std::string &bytes() const { return bytes_; }

 private:
  void begin(Field code, char type) {
    pad();
    bytes_ += {static_cast<char>(code), 1, type, '\0'};
  }

  const bool littleEndian_;
  std::string bytes_;
};

}  // namespace

std::optional<std::string> rewrittenDescriptorCall(
    std::string_view message,
    const std::function<bool(const BusTarget &target, std::string_view signature)> &takesDescriptor) {
  const FixedHeader header = FixedHeader::of(message);
  if (header.bytes[typePosition] != SD_BUS_MESSAGE_METHOD_CALL || header.serial() == 0) return std::nullopt;
  const bool littleEndian = header.isLittleEndian();
  const auto read = FieldReader(message.substr(0, FixedHeader::size + header.fieldsSize()), littleEndian).read();
  if (!read || read->descriptors != 1 || !takesDescriptor(read->target, read->signature)) return std::nullopt;

  FieldWriter fields(littleEndian);
  fields.text(pathField, 'o', read->target.path);
  if (!read->target.interface.empty()) fields.text(interfaceField, 's', read->target.interface);
  fields.text(memberField, 's', read->target.member);
  fields.text(signatureField, 'g', read->signature);
  fields.number(countField, read->descriptors);
  const std::size_t fieldsSize = fields.bytes().size();
  fields.pad();

  const std::string_view body = message.substr(header.bodyBegin());
  FieldWriter sizes(littleEndian);
  sizes.append(body.size());
  sizes.append(header.serial());
  sizes.append(fieldsSize);
  std::string written(message.substr(0, 4));
  return written + sizes.bytes() + fields.bytes() + std::string(body);
}

}  // namespace storix::wire
