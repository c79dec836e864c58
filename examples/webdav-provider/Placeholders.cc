#include "examples/webdav-provider/Placeholders.h"

#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <cerrno>

#include "examples/webdav-provider/DavPath.h"
#include "examples/webdav-provider/KeyedValues.h"

namespace storix::example {

namespace {

bool isPlaceholder(std::string_view text) {
  const auto values = KeyedValues::parse(text);
  return values && values->string("name") && (values->integer("size") || values->integer("modificationTime"));
}

}  // namespace

std::optional<std::string> placeholderText(const std::string &name, const DavEntry &entry,
                                           std::optional<std::int64_t> received) {
  if (!isUTF8(name)) return std::nullopt;
  rapidjson::StringBuffer buffer;
  rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
  const auto string = [&writer](const char *key, const std::string &value) {
    writer.Key(key);
    writer.String(value.data(), static_cast<rapidjson::SizeType>(value.size()));
  };
  const auto number = [&writer](const char *key, std::optional<std::int64_t> value) {
    if (!value) return;
    writer.Key(key);
    writer.Int64(*value);
  };
  writer.StartObject();
  if (!entry.etag.empty()) string("etag", entry.etag);
  number("modificationTime", entry.modificationTime);
  string("name", name);
  number("received", received);
  number("size", entry.size);
  writer.EndObject();
  return std::string(buffer.GetString(), buffer.GetSize()) + "\n";
}

Result<std::string> writePlaceholder(const LocalCopies &copies, const std::string &path, const DavEntry &entry,
                                     std::optional<std::int64_t> received) {
  const auto text = placeholderText(path.substr(path.rfind('/') + 1), entry, received);
  if (!text) return posixError(EILSEQ, "writing the placeholder of \"" + path + "\"");
  const auto there = copies.readCompanion(path);
  if (!there) return there.error();
  if (there.value() && !isPlaceholder(*there.value())) {
    return posixError(EEXIST, "writing the placeholder of \"" + path + "\" (an application has a file in its place)");
  }
  return copies.putCompanion(path, *text);
}

ProgressInPlaceholder::~ProgressInPlaceholder() {
  if (told_) static_cast<void>(writePlaceholder(copies_, path_, entry_));
}

void ProgressInPlaceholder::arrived(std::int64_t received) {
  const Clock::time_point now = Clock::now();
  if (now - last_ < interval_) return;
  last_ = now;
  told_ = writePlaceholder(copies_, path_, entry_, received).ok() || told_;
}

}  // namespace storix::example
