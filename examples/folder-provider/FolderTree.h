#pragma once

#include <sys/types.h>

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "platform/SXError.h"
#include "wire/UniqueFd.h"

namespace storix::example {

/// What the provider compares and remembers of a file.
struct FileState {
  off_t size = 0;
  timespec modificationTime{};
  mode_t permissions = 0;

  [[nodiscard]] bool sameContentAs(const FileState &other) const;
  [[nodiscard]] bool newerThan(const FileState &other) const;
};

/// A directory whose files are known by their path relative to it ("reports/may.txt"). Both the
/// provider's source and its provided-items directory are one.
///
/// No path leads out of it: a name that is absolute or has an empty component, or one that begins
/// with a dot ("..", hidden files, companions), is refused before the disk is looked at; the kernel
/// then resolves beneath the directory and follows no symbolic link. Every file appears under its
/// name complete or not at all: it is written below ".incoming", a name that no item can have, and
/// renamed. Thread-safe. Errors are of the domain "posix", or EINVAL with the reason for a name that
/// is refused.
class FolderTree {
 public:
  /// The directory must exist.
  static Result<FolderTree> open(const std::string &directory);

  /// Why a relative path cannot name a file here; none when it can.
  static std::optional<SXError> checkPath(std::string_view path);

  Result<FileState> stateOf(const std::string &path) const;

  /// A regular file, for reading. Missing, a directory, a device, a symbolic link: an error.
  Result<UniqueFd> openFile(const std::string &path) const;

  /// Puts a copy of everything in `file` under that name, replacing what is there; makes the
  /// directories above it. The copy keeps the modification time of `file`, and the permissions of
  /// what it replaces (0600 for a new file).
  std::optional<SXError> put(const std::string &path, int file) const;

  /// Puts a text beside the file of that name, as its companion: the same directory, the last
  /// component with a dot in front. Gives the companion's path, relative as well.
  Result<std::string> putCompanion(const std::string &path, std::string_view text) const;

  /// Puts a text under that name, replacing what is there.
  std::optional<SXError> putText(const std::string &path, std::string_view text) const;

  /// Removes the file. One that is not there is no error.
  std::optional<SXError> remove(const std::string &path) const;

  /// Removes what an ended process has left half written. Only before work begins.
  void discardIncoming() const;

  /// For who writes files in pieces: the directory that holds the file of that name, made where it is
  /// missing; and ".incoming", from which the file is then renamed. `path` must have been checked.
  Result<UniqueFd> openParentMakingIt(const std::string &path) const;
  Result<UniqueFd> openIncoming() const;

 private:
  FolderTree(std::string directory, UniqueFd root) : directory_(std::move(directory)), root_(std::move(root)) {}

  SXError failure(int errorNumber, std::string_view doing, std::string_view path) const;
  UniqueFd openBeneath(const std::string &path, int flags) const;
  std::optional<SXError> putTextAs(const std::string &path, const std::string &name, std::string_view text) const;

  std::string directory_;
  UniqueFd root_;
};

}  // namespace storix::example
