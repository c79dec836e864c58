#include "tools/storixctl/Replacement.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>
#include <utility>

namespace storix::ctl {

namespace {

namespace fs = std::filesystem;

/// What the path names once the links at its end are followed.
Result<fs::path> followed(const fs::path &path) {
  std::error_code error;
  if (!fs::is_symlink(fs::symlink_status(path, error))) return path;
  fs::path target = fs::canonical(path, error);
  if (error) return posixError(error.value(), "following the symbolic link " + path.string());
  return target;
}

std::optional<SXError> checkReplaceable(int directory, const std::string &name, const std::string &path,
                                        struct stat &former, bool &exists) {
  exists = ::fstatat(directory, name.c_str(), &former, AT_SYMLINK_NOFOLLOW) == 0;
  if (!exists) return errno == ENOENT ? std::nullopt : std::optional(posixError(errno, "looking at " + path));
  if (S_ISDIR(former.st_mode)) return posixError(EISDIR, "writing " + path);
  if (!S_ISREG(former.st_mode)) return posixError(EINVAL, "writing " + path + ", which is not a regular file");
  return std::nullopt;
}

}  // namespace

Replacement::Replacement(UniqueFd directory, UniqueFd file, std::string temporaryName, std::string name,
                         std::string path)
    : directory_(std::move(directory)),
      file_(std::move(file)),
      temporaryName_(std::move(temporaryName)),
      name_(std::move(name)),
      path_(std::move(path)) {}

Result<Replacement> Replacement::of(const std::string &path) {
  const auto target = followed(path);
  if (!target) return target.error();
  const std::string name = target.value().filename().string();
  if (name.empty() || name == "." || name == "..") return posixError(EISDIR, "writing " + path);
  const fs::path parent = target.value().has_parent_path() ? target.value().parent_path() : fs::path(".");
  UniqueFd directory(::open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return posixError(errno, "opening the directory " + parent.string());
  struct stat former {};
  bool exists = false;
  if (auto refused = checkReplaceable(directory.get(), name, path, former, exists)) return *std::move(refused);

  for (unsigned number = 0;; ++number) {
    std::string temporaryName = ".storixctl-" + std::to_string(::getpid()) + "-" + std::to_string(number);
    UniqueFd file(::openat(directory.get(), temporaryName.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC,
                           exists ? 0600 : 0666));
    if (file) return Replacement(std::move(directory), std::move(file), std::move(temporaryName), name, path);
    if (errno != EEXIST) return posixError(errno, "making a file in " + parent.string());
  }
}

Replacement::~Replacement() {
  if (file_) ::unlinkat(directory_.get(), temporaryName_.c_str(), 0);
}

std::optional<SXError> Replacement::takePlace() {
  struct stat former {};
  bool exists = false;
  if (auto refused = checkReplaceable(directory_.get(), name_, path_, former, exists)) return refused;
  if (exists) {
    mode_t mode = former.st_mode & 07777U;
    if (::fchown(file_.get(), static_cast<uid_t>(-1), former.st_gid) != 0) {
      // Another group gets no more than everybody does.
      mode = (mode & ~07070U) | ((mode & 07U) << 3);
    }
    if (::fchmod(file_.get(), mode) != 0) {
      return posixError(errno, "setting the permissions of what replaces " + path_);
    }
  }
  if (::fsync(file_.get()) != 0) return posixError(errno, "putting on the disk what replaces " + path_);
  if (::renameat(directory_.get(), temporaryName_.c_str(), directory_.get(), name_.c_str()) != 0) {
    return posixError(errno, "replacing " + path_);
  }
  file_.reset();
  if (::fsync(directory_.get()) != 0) return posixError(errno, "putting on the disk the directory of " + path_);
  return std::nullopt;
}

}  // namespace storix::ctl
