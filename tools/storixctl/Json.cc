#include "tools/storixctl/Json.h"

#include <rapidjson/memorystream.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/stringbuffer.h>
#include <sodium.h>

#include <algorithm>
#include <cmath>

namespace storix::ctl {

namespace {

using Writer = rapidjson::PrettyWriter<rapidjson::StringBuffer>;

constexpr int base64Variant = sodium_base64_VARIANT_ORIGINAL;

bool isUTF8(std::string_view text) {
  rapidjson::MemoryStream bytes(text.data(), text.size());
  rapidjson::StringBuffer ignored;
  while (bytes.Tell() < text.size()) {
    if (!rapidjson::UTF8<>::Validate(bytes, ignored)) return false;
  }
  return true;
}

std::string textForJson(std::string_view text) {
  std::string shown(text);
  if (!isUTF8(text))
    std::replace_if(
        shown.begin(), shown.end(), [](char c) { return (c & 0x80) != 0; }, '?');
  return shown;
}

void writeText(Writer &writer, std::string_view text) {
  const std::string shown = textForJson(text);
  writer.String(shown.data(), static_cast<rapidjson::SizeType>(shown.size()));
}

void writeDictionary(Writer &writer, const Dictionary &dictionary);

void writeValue(Writer &writer, const Value &value) {
  switch (value.kind()) {
    case ValueKind::boolean:
      writer.Bool(*value.boolean());
      return;
    case ValueKind::number:
      if (const auto *integer = value.integer()) {
        writer.Int64(*integer);
      } else if (std::isfinite(*value.real())) {
        writer.Double(*value.real());
      } else {
        writer.Null();
      }
      return;
    case ValueKind::string:
      return writeText(writer, *value.string());
    case ValueKind::URL:
      return writeText(writer, value.url()->absoluteString());
    case ValueKind::data:
      return writeText(writer, base64(*value.data()));
    case ValueKind::list:
      writer.StartArray();
      for (const Value &element : *value.list()) writeValue(writer, element);
      writer.EndArray();
      return;
    case ValueKind::dictionary:
      return writeDictionary(writer, *value.dictionary());
    case ValueKind::error: {
      const SXError &error = *value.error();
      return writeDictionary(writer, {{"domain", error.domain()},
                                      {"code", error.code()},
                                      {"message", error.message()},
                                      {"details", error.details()}});
    }
  }
}

void writeDictionary(Writer &writer, const Dictionary &dictionary) {
  writer.StartObject();
  for (const auto &[key, value] : dictionary) {
    const std::string shown = textForJson(key);
    writer.Key(shown.data(), static_cast<rapidjson::SizeType>(shown.size()));
    writeValue(writer, value);
  }
  writer.EndObject();
}

}  // namespace

std::string jsonText(const Dictionary &dictionary) {
  rapidjson::StringBuffer buffer;
  Writer writer(buffer);
  writer.SetIndent(' ', 2);
  writeDictionary(writer, dictionary);
  return std::string(buffer.GetString(), buffer.GetSize()) + "\n";
}

std::string base64(const Data &data) {
  std::string text(sodium_base64_encoded_len(data.bytes.size(), base64Variant), '\0');
  sodium_bin2base64(text.data(), text.size(), reinterpret_cast<const unsigned char *>(data.bytes.data()),
                    data.bytes.size(), base64Variant);
  text.pop_back();  // the terminating zero
  return text;
}

std::optional<Data> fromBase64(std::string_view text) {
  Data data{std::string(text.size(), '\0')};
  std::size_t size = 0;
  const char *end = nullptr;
  const int failed = sodium_base642bin(reinterpret_cast<unsigned char *>(data.bytes.data()), data.bytes.size(),
                                       text.data(), text.size(), nullptr, &size, &end, base64Variant);
  if (failed != 0 || end != text.data() + text.size() || size == 0) return std::nullopt;
  data.bytes.resize(size);
  return data;
}

}  // namespace storix::ctl
