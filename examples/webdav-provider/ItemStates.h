#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <string>

#include "examples/folder-provider/FolderTree.h"
#include "platform/Result.h"

namespace storix::example {

/// By which a local file is known again without reading it.
struct FileStamp {
  std::int64_t inode = 0;
  std::int64_t size = 0;
  std::int64_t seconds = 0;
  std::int64_t nanoseconds = 0;

  static FileStamp of(const struct stat &status);
  friend bool operator==(const FileStamp &, const FileStamp &) = default;
};

/// What is remembered of an item. A local file with another content than `hash` has changes that the
/// server does not have.
struct ItemState {
  /// Of the server's version that the local file was equal to the last time; empty when unknown.
  std::string etag;
  /// DavEntry::version of it; empty when unknown.
  std::string version;
  /// ContentHash of that content, and the local file that had it. Empty: there was none yet.
  std::string hash;
  FileStamp stamp;
  /// The version of which a download has begun, and how much of it is safely on disk.
  std::string partialETag;
  std::int64_t partialLength = 0;
};

/// The remembered states, one small keyed-value file each in a directory of the group container beside
/// the provided items. A file is written completely or not at all; one that cannot be read counts as
/// missing, which costs a comparison with the server and never content. Thread-safe for different items.
class ItemStates {
 public:
  /// Makes the directory.
  static Result<ItemStates> open(const std::string &groupContainer);

  [[nodiscard]] std::optional<ItemState> read(const std::string &path) const;
  std::optional<SXError> write(const std::string &path, const ItemState &state) const;
  std::optional<SXError> remove(const std::string &path) const;

  /// The name under which an item's files are kept.
  static std::string key(const std::string &path);
  /// By that name.
  [[nodiscard]] std::optional<ItemState> readByKey(const std::string &key) const;

 private:
  explicit ItemStates(FolderTree directory) : directory_(std::move(directory)) {}

  FolderTree directory_;
};

}  // namespace storix::example
