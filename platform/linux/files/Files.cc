#include "platform/linux/files/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/linux/files/KeyedValueFile.h"
#include "platform/linux/files/PathText.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr mode_t newDirectoryMode = 0700;

class FileInputStream : public InputStream {
 public:
  FileInputStream(UniqueFd fd, std::string path) : fd_(std::move(fd)), path_(std::move(path)) {}
  [[nodiscard]] int fd() const { return fd_.get(); }
  [[nodiscard]] const std::string &path() const { return path_; }

 private:
  UniqueFd fd_;
  std::string path_;
};

bool isDirectory(const std::string &path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

/// The path of the directory that holds this one; empty when the text names none.
std::string parentOf(const std::string &path) {
  const std::size_t end = path.find_last_not_of('/');
  if (end == std::string::npos) return {};
  const std::size_t slash = path.rfind('/', end);
  return slash == std::string::npos ? std::string() : path.substr(0, slash + 1);
}

/// Puts a directory's entries on the disk.
int syncDirectory(const std::string &path) {
  const UniqueFd fd(::open(path.empty() ? "." : path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd && ::fsync(fd.get()) == 0 ? 0 : errno;
}

int makeDirectory(const std::string &path, bool withIntermediateDirectories) {
  if (::mkdir(path.c_str(), newDirectoryMode) == 0) return syncDirectory(parentOf(path));
  const int error = errno;
  if (!withIntermediateDirectories) return error;
  if (error == EEXIST) return isDirectory(path) ? 0 : EEXIST;
  const std::string parent = parentOf(path);
  if (error != ENOENT || parent.empty() || parent == path) return error;
  if (const int parentError = makeDirectory(parent, true)) return parentError;
  if (::mkdir(path.c_str(), newDirectoryMode) == 0) return syncDirectory(parent);
  return errno == EEXIST && isDirectory(path) ? 0 : errno;
}

}  // namespace

bool Files::fileExists(const std::string &path) { return ::access(path.c_str(), F_OK) == 0; }

std::optional<SXError> Files::createDirectory(const std::string &path, bool withIntermediateDirectories) {
  // PATH_MAX bounds how deep this goes: the kernel refuses a longer path at once.
  const int error = makeDirectory(path, withIntermediateDirectories);
  if (error == 0) return std::nullopt;
  return posixError(error, "Cannot make the directory " + quotedPath(path));
}

std::unique_ptr<InputStream> Files::openFileInputStream(const std::string &path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat status {};
  if (!fd) {
    if (::stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode)) setUnread(path, true);
    return nullptr;
  }
  if (::fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return nullptr;
  return std::make_unique<FileInputStream>(std::move(fd), path);
}

Result<Value> Files::readKeyedValueStream(InputStream &stream, KeyedValueMutability) {
  auto *file = dynamic_cast<FileInputStream *>(&stream);
  if (!file) return posixError(EBADF, "Cannot read a stream that is no file's");
  Result<Dictionary> content = readKeyedValues(file->fd(), file->path());
  setUnread(file->path(), !content.ok());
  if (!content) return content.error();
  Value value(std::move(content.value()));
  return value;
}

bool Files::writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) {
  PreviousFile previous = PreviousFile::dropped;
  {
    const std::lock_guard lock(mutex_);
    if (unread_.contains(path)) previous = PreviousFile::keptAsCorrupt;
  }
  if (const std::optional<SXError> error = writeKeyedValueFile(content, path, previous)) {
    sx_default_log().notice("[NOTICE] %@", error->message());
    return false;
  }
  if (previous == PreviousFile::keptAsCorrupt) setUnread(path, false);
  return true;
}

void Files::setUnread(const std::string &path, bool unread) {
  const std::lock_guard lock(mutex_);
  if (unread) {
    unread_.insert(path);
  } else {
    unread_.erase(path);
  }
}

}  // namespace storix::linuxhost
