#include "examples/webdav-provider/ItemStates.h"

#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <cerrno>
#include <utility>

#include "examples/webdav-provider/ContentHash.h"
#include "examples/webdav-provider/KeyedValues.h"

namespace storix::example {

namespace {

constexpr std::size_t fileAtMost = 64 * 1024;

std::string textOf(const std::string &path, const ItemState &state) {
  rapidjson::StringBuffer buffer;
  rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
  const auto string = [&writer](const char *key, const std::string &value) {
    writer.Key(key);
    writer.String(value.data(), static_cast<rapidjson::SizeType>(value.size()));
  };
  const auto number = [&writer](const char *key, std::int64_t value) {
    writer.Key(key);
    writer.Int64(value);
  };
  writer.StartObject();
  string("etag", state.etag);
  string("hash", state.hash);
  number("inode", state.stamp.inode);
  number("nanoseconds", state.stamp.nanoseconds);
  string("partialETag", state.partialETag);
  number("partialLength", state.partialLength);
  string("path", path);
  number("seconds", state.stamp.seconds);
  number("size", state.stamp.size);
  string("version", state.version);
  writer.EndObject();
  return std::string(buffer.GetString(), buffer.GetSize()) + "\n";
}

}  // namespace

FileStamp FileStamp::of(const struct stat &status) {
  return {static_cast<std::int64_t>(status.st_ino), status.st_size, status.st_mtim.tv_sec, status.st_mtim.tv_nsec};
}

Result<ItemStates> ItemStates::open(const std::string &groupContainer) {
  const std::string directory = groupContainer + "/WebDAV State";
  if (::mkdir(directory.c_str(), 0700) != 0 && errno != EEXIST) {
    return posixError(errno, "making the directory " + directory);
  }
  auto tree = FolderTree::open(directory);
  if (!tree) return tree.error();
  return ItemStates(std::move(tree.value()));
}

std::optional<ItemState> ItemStates::read(const std::string &path) const { return readByKey(key(path)); }

std::optional<ItemState> ItemStates::readByKey(const std::string &key) const {
  const auto file = directory_.openFile(key);
  if (!file) return std::nullopt;
  const auto text = readWhole(file.value().get(), fileAtMost);
  if (!text) return std::nullopt;
  const auto values = KeyedValues::parse(text.value());
  if (!values) return std::nullopt;
  const auto string = [&values](const char *name) { return values->string(name).value_or(""); };
  const auto number = [&values](const char *name) { return values->integer(name).value_or(0); };
  ItemState state;
  state.etag = string("etag");
  state.version = string("version");
  state.hash = string("hash");
  state.stamp = {number("inode"), number("size"), number("seconds"), number("nanoseconds")};
  state.partialETag = string("partialETag");
  state.partialLength = number("partialLength");
  return state;
}

std::optional<SXError> ItemStates::write(const std::string &path, const ItemState &state) const {
  return directory_.putText(key(path), textOf(path, state));
}

std::optional<SXError> ItemStates::remove(const std::string &path) const { return directory_.remove(key(path)); }

std::string ItemStates::key(const std::string &path) { return ContentHash::of(path); }

}  // namespace storix::example
