#pragma once

#include <ctime>
#include <optional>
#include <string>
#include <vector>

#include "examples/folder-provider/FolderTree.h"
#include "examples/webdav-provider/ItemStates.h"

namespace storix::example {

/// The provided-items directory, as the provider works on it: local files under the items' names, and
/// downloads that are not complete yet, hidden below ".incoming" under the items' keys. Thread-safe for
/// different items.
class LocalCopies {
 public:
  /// The directory must exist.
  static Result<LocalCopies> open(const std::string &directory);

  struct File {
    UniqueFd descriptor;
    FileStamp stamp;
  };
  /// The item's local file; absent when there is none. An error for what is no ordinary file.
  Result<std::optional<File>> find(const std::string &path) const;

  /// The item's download, of which the first `good` bytes are kept (none, where it is shorter).
  Result<UniqueFd> openPartial(const std::string &path, std::int64_t good) const;
  void discardPartial(const std::string &path) const;
  /// Discards the downloads that nothing is remembered of. Only before work begins.
  void discardForgotten(const ItemStates &states) const;

  enum class Replacing { no, yes };
  /// Gives the complete download the item's name, and the permissions of what it replaces (0600 for a new
  /// file). EEXIST where there is a file and none is to be replaced.
  /// The stamp is that of the file then.
  Result<FileStamp> place(const std::string &path, int partial, std::optional<time_t> modificationTime,
                          Replacing replacing) const;

  /// Gives the item's local file a second name, the first of its conflict names that is free.
  Result<std::string> keepUnderConflictName(const std::string &path) const;

  std::optional<SXError> remove(const std::string &path) const { return tree_.remove(path); }
  /// Makes the directory of a collection.
  std::optional<SXError> makeDirectory(const std::string &path) const;
  /// What is in the place of the item's companion; absent when nothing is. EEXIST for what is no text of
  /// ordinary length in an ordinary file.
  Result<std::optional<std::string>> readCompanion(const std::string &path) const;
  Result<std::string> putCompanion(const std::string &path, std::string_view text) const {
    return tree_.putCompanion(path, text);
  }

  /// The items that have a local file.
  [[nodiscard]] std::vector<std::string> items() const;

 private:
  LocalCopies(std::string directory, FolderTree tree) : directory_(std::move(directory)), tree_(std::move(tree)) {}

  std::string directory_;
  FolderTree tree_;
};

/// "a/report (conflict).txt" for "a/report.txt", "(conflict 2)" after it, and so on: the nth after the
/// one that the path itself may be.
std::string conflictName(const std::string &path, int n);

}  // namespace storix::example
