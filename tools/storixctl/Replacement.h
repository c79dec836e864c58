#pragma once

#include <optional>
#include <string>

#include "platform/Result.h"
#include "wire/UniqueFd.h"

namespace storix::ctl {

/// A new file that is written beside the one whose place it takes at the end, so that nobody sees half
/// of it and what was there stays until all is written. Without `takePlace` it goes away again.
class Replacement {
 public:
  /// Of a file that need not be there yet; its directory must. Where the path is a symbolic link, of
  /// what the link leads to. A directory, a device or a pipe cannot be replaced.
  static Result<Replacement> of(const std::string &path);

  Replacement(Replacement &&) noexcept = default;
  Replacement &operator=(Replacement &&) = delete;
  ~Replacement();

  /// Open for reading and writing.
  [[nodiscard]] int descriptor() const { return file_.get(); }

  /// Puts what was written on the disk and gives it the place, with the permissions of the file that
  /// was there; a new one has those that the umask leaves. None when that is done.
  [[nodiscard]] std::optional<SXError> takePlace();

 private:
  Replacement(UniqueFd directory, UniqueFd file, std::string temporaryName, std::string name, std::string path);

  UniqueFd directory_;
  UniqueFd file_;
  std::string temporaryName_;
  std::string name_;
  std::string path_;
};

}  // namespace storix::ctl
