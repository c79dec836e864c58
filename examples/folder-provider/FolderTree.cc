#include "FolderTree.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <memory>
#include <tuple>
#include <utility>

namespace storix::example {

namespace {

constexpr const char *incomingDirectory = ".incoming";

/// Opens below `directory` alone, following no symbolic link.
UniqueFd openBelow(int directory, const std::string &path, int flags) {
  open_how how{};
  how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  for (;;) {
    long fd = ::syscall(SYS_openat2, directory, path.c_str(), &how, sizeof how);
    // EAGAIN: something was renamed meanwhile, and the kernel could not be sure of the way.
    if (fd >= 0 || (errno != EINTR && errno != EAGAIN)) return UniqueFd(static_cast<int>(fd));
  }
}

std::pair<std::string, std::string> splitLast(const std::string &path) {
  std::size_t slash = path.rfind('/');
  if (slash == std::string::npos) return {".", path};
  return {path.substr(0, slash), path.substr(slash + 1)};
}

FileState stateFrom(const struct stat &status) { return {status.st_size, status.st_mtim, status.st_mode & 07777U}; }

/// 0, or the errno.
int writeAll(int fd, const char *bytes, std::size_t size) {
  while (size > 0) {
    ssize_t written = ::write(fd, bytes, size);
    if (written < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    bytes += written;
    size -= static_cast<std::size_t>(written);
  }
  return 0;
}

/// Copies from the beginning to the end, whatever the size turns out to be. In the kernel where the
/// file systems allow it, else through a buffer. 0, or the errno.
int copyAll(int from, int to) {
  constexpr std::size_t step = std::size_t{64} << 20;
  off_t offset = 0;
  for (;;) {
    ssize_t copied = ::copy_file_range(from, &offset, to, nullptr, step, 0);
    if (copied > 0) continue;
    // A file system that makes its files up as they are read may claim that there is nothing.
    if (copied == 0 && offset > 0) return 0;
    if (copied < 0 && errno == EINTR) continue;
    if (copied < 0 && errno != EXDEV && errno != EINVAL && errno != EOPNOTSUPP && errno != ENOSYS) return errno;
    break;
  }
  auto buffer = std::make_unique<std::array<char, std::size_t{256} << 10>>();
  for (;;) {
    ssize_t count = ::pread(from, buffer->data(), buffer->size(), offset);
    if (count < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (count == 0) return 0;
    if (int error = writeAll(to, buffer->data(), static_cast<std::size_t>(count))) return error;
    offset += count;
  }
}

/// A file below the incoming directory that goes away unless it was renamed.
class TemporaryFile {
 public:
  explicit TemporaryFile(int directory) : directory_(directory) {
    static std::atomic<unsigned> next{0};
    name_ = std::to_string(::getpid()) + "-" + std::to_string(next++);
    file_ = UniqueFd(::openat(directory_, name_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  }
  ~TemporaryFile() {
    if (file_ && !renamed_) ::unlinkat(directory_, name_.c_str(), 0);
  }
  TemporaryFile(const TemporaryFile &) = delete;
  TemporaryFile &operator=(const TemporaryFile &) = delete;

  explicit operator bool() const { return static_cast<bool>(file_); }
  [[nodiscard]] int fd() const { return file_.get(); }

  /// 0, or the errno.
  int renameTo(int directory, const std::string &name) {
    if (::fsync(file_.get()) != 0) return errno;
    if (::renameat(directory_, name_.c_str(), directory, name.c_str()) != 0) return errno;
    renamed_ = true;
    return ::fsync(directory) == 0 ? 0 : errno;
  }

 private:
  int directory_;
  std::string name_;
  UniqueFd file_;
  bool renamed_ = false;
};

}  // namespace

bool FileState::sameContentAs(const FileState &other) const {
  return size == other.size && !newerThan(other) && !other.newerThan(*this);
}

bool FileState::newerThan(const FileState &other) const {
  return std::tie(modificationTime.tv_sec, modificationTime.tv_nsec) >
         std::tie(other.modificationTime.tv_sec, other.modificationTime.tv_nsec);
}

Result<FolderTree> FolderTree::open(const std::string &directory) {
  UniqueFd root(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!root) return posixError(errno, "opening the directory " + directory);
  return FolderTree(directory, std::move(root));
}

std::optional<SXError> FolderTree::checkPath(std::string_view path) {
  auto refused = [path](std::string_view why) {
    return posixError(EINVAL, "naming a document \"" + std::string(path) + "\": " + std::string(why));
  };
  if (path.empty()) return refused("the name is empty");
  if (path.find('\0') != std::string_view::npos) return refused("the name holds a zero byte");
  while (true) {
    std::size_t slash = path.find('/');
    std::string_view component = path.substr(0, slash);
    if (component.empty()) return refused("a path relative to the folder is needed, without empty components");
    if (component.starts_with('.')) return refused("names that begin with a dot are not documents");
    if (slash == std::string_view::npos) return std::nullopt;
    path.remove_prefix(slash + 1);
  }
}

Result<FileState> FolderTree::stateOf(const std::string &path) const {
  auto file = openFile(path);
  if (!file) return file.error();
  struct stat status {};
  if (::fstat(file.value().get(), &status) != 0) return failure(errno, "looking at", path);
  return stateFrom(status);
}

Result<UniqueFd> FolderTree::openFile(const std::string &path) const {
  if (auto refused = checkPath(path)) return *refused;
  // Not blocking, so that a pipe without a writer cannot hold us up.
  UniqueFd file = openBeneath(path, O_RDONLY | O_NONBLOCK);
  if (!file) return failure(errno, "opening", path);
  struct stat status {};
  if (::fstat(file.get(), &status) != 0) return failure(errno, "looking at", path);
  if (S_ISDIR(status.st_mode)) return failure(EISDIR, "opening", path);
  if (!S_ISREG(status.st_mode)) return failure(EINVAL, "opening (it is not a regular file)", path);
  return file;
}

std::optional<SXError> FolderTree::put(const std::string &path, int file) const {
  if (auto refused = checkPath(path)) return refused;
  struct stat status {};
  if (::fstat(file, &status) != 0) return failure(errno, "looking at what becomes", path);

  auto parent = openParentMakingIt(path);
  if (!parent) return parent.error();
  auto incoming = openIncoming();
  if (!incoming) return incoming.error();
  TemporaryFile temporary(incoming.value().get());
  if (!temporary) return failure(errno, "making a temporary file for", path);

  const std::string name = splitLast(path).second;
  struct stat replaced {};
  const bool replaces = ::fstatat(parent.value().get(), name.c_str(), &replaced, AT_SYMLINK_NOFOLLOW) == 0;
  if (replaces && S_ISREG(replaced.st_mode) && ::fchmod(temporary.fd(), replaced.st_mode & 0777U) != 0) {
    return failure(errno, "setting the permissions of", path);
  }
  if (int error = copyAll(file, temporary.fd())) return failure(error, "copying", path);
  struct stat after {};
  if (::fstat(file, &after) != 0) return failure(errno, "looking at what becomes", path);
  if (!stateFrom(after).sameContentAs(stateFrom(status))) {
    return failure(EAGAIN, "copying (it changed meanwhile)", path);
  }
  const std::array<timespec, 2> times{timespec{0, UTIME_OMIT}, status.st_mtim};
  if (::futimens(temporary.fd(), times.data()) != 0) return failure(errno, "setting the time of", path);
  if (int error = temporary.renameTo(parent.value().get(), name)) return failure(error, "putting in place", path);
  return std::nullopt;
}

Result<std::string> FolderTree::putCompanion(const std::string &path, std::string_view text) const {
  const auto [directory, name] = splitLast(path);
  const std::string companion = "." + name;
  if (auto failed = putTextAs(path, companion, text)) return *failed;
  return directory == "." ? companion : directory + "/" + companion;
}

std::optional<SXError> FolderTree::putText(const std::string &path, std::string_view text) const {
  return putTextAs(path, splitLast(path).second, text);
}

std::optional<SXError> FolderTree::putTextAs(const std::string &path, const std::string &name,
                                             std::string_view text) const {
  if (auto refused = checkPath(path)) return *refused;
  auto parent = openParentMakingIt(path);
  if (!parent) return parent.error();
  auto incoming = openIncoming();
  if (!incoming) return incoming.error();
  TemporaryFile temporary(incoming.value().get());
  if (!temporary) return failure(errno, "making a temporary file for the text of", path);
  if (int error = writeAll(temporary.fd(), text.data(), text.size())) {
    return failure(error, "writing the text of", path);
  }
  if (int error = temporary.renameTo(parent.value().get(), name)) {
    return failure(error, "putting in place the text of", path);
  }
  return std::nullopt;
}

std::optional<SXError> FolderTree::remove(const std::string &path) const {
  if (auto refused = checkPath(path)) return refused;
  const auto [directory, name] = splitLast(path);
  UniqueFd parent = openBeneath(directory, O_PATH | O_DIRECTORY);
  if (!parent) {
    if (errno == ENOENT) return std::nullopt;
    return failure(errno, "opening the directory of", path);
  }
  if (::unlinkat(parent.get(), name.c_str(), 0) != 0 && errno != ENOENT) return failure(errno, "removing", path);
  return std::nullopt;
}

void FolderTree::discardIncoming() const {
  UniqueFd incoming = openBeneath(incomingDirectory, O_RDONLY | O_DIRECTORY);
  if (!incoming) return;
  std::unique_ptr<DIR, int (*)(DIR *)> listing(::fdopendir(incoming.get()), &::closedir);
  if (!listing) return;
  const int directory = incoming.release();
  while (const dirent *entry = ::readdir(listing.get())) {
    if (entry->d_name[0] != '.') ::unlinkat(directory, entry->d_name, 0);
  }
}

SXError FolderTree::failure(int errorNumber, std::string_view doing, std::string_view path) const {
  return posixError(errorNumber, std::string(doing) + " \"" + std::string(path) + "\" in " + directory_);
}

UniqueFd FolderTree::openBeneath(const std::string &path, int flags) const {
  return openBelow(root_.get(), path, flags);
}

Result<UniqueFd> FolderTree::openParentMakingIt(const std::string &path) const {
  UniqueFd directory = openBeneath(".", O_RDONLY | O_DIRECTORY);
  if (!directory) return failure(errno, "opening the directory of", path);
  std::size_t begin = 0;
  for (std::size_t slash = path.find('/'); slash != std::string::npos; slash = path.find('/', begin)) {
    const std::string component = path.substr(begin, slash - begin);
    begin = slash + 1;
    if (::mkdirat(directory.get(), component.c_str(), 0700) != 0 && errno != EEXIST) {
      return failure(errno, "making the directory of", path);
    }
    UniqueFd next = openBelow(directory.get(), component, O_RDONLY | O_DIRECTORY);
    if (!next) return failure(errno, "opening the directory of", path);
    directory = std::move(next);
  }
  return directory;
}

Result<UniqueFd> FolderTree::openIncoming() const {
  if (::mkdirat(root_.get(), incomingDirectory, 0700) != 0 && errno != EEXIST) {
    return failure(errno, "making the directory", incomingDirectory);
  }
  UniqueFd incoming = openBeneath(incomingDirectory, O_PATH | O_DIRECTORY);
  if (!incoming) return failure(errno, "opening the directory", incomingDirectory);
  return incoming;
}

}  // namespace storix::example
