// The writer copies sixteen bytes at a time, where the processor can. Programs with both kinds of writer
// keep them apart by the name.
#if defined(__SSE2__)
#define RAPIDJSON_SSE2
#elif defined(__ARM_NEON)
#define RAPIDJSON_NEON
#endif
#define RAPIDJSON_NAMESPACE wide_rapidjson
#define RAPIDJSON_NAMESPACE_BEGIN namespace wide_rapidjson {
#define RAPIDJSON_NAMESPACE_END }

#include <fcntl.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdio>

#include "platform/Log.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "platform/linux/files/PathText.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

namespace rapidjson = wide_rapidjson;

/// Writes values as text; on the first that cannot be written `problem` says why, and all ends.
class TextWriter {
 public:
  explicit TextWriter(rapidjson::StringBuffer &buffer) : writer_(buffer) {}

  bool write(const Dictionary &dictionary) {
    if (++level_ > keyedValueNestingLimit) {
      return refuse("there are more than " + std::to_string(keyedValueNestingLimit) + " levels");
    }
    writer_.StartObject();
    for (const auto &[key, value] : dictionary) {
      if (!isUTF8(key)) return refuse("the key " + quotedPath(key) + " is not UTF-8");
      writer_.Key(key.data(), static_cast<rapidjson::SizeType>(key.size()));
      if (!write(value)) return false;
    }
    writer_.EndObject();
    --level_;
    return true;
  }

  [[nodiscard]] const std::string &problem() const { return problem_; }

 private:
  bool refuse(std::string problem) {
    problem_ = std::move(problem);
    return false;
  }

  bool write(const List &list) {
    if (++level_ > keyedValueNestingLimit) {
      return refuse("there are more than " + std::to_string(keyedValueNestingLimit) + " levels");
    }
    writer_.StartArray();
    for (const Value &value : list) {
      if (!write(value)) return false;
    }
    writer_.EndArray();
    --level_;
    return true;
  }

  bool write(const Value &value) {
    if (const std::string *text = value.string()) {
      if (!isUTF8(*text)) return refuse("the string " + quotedPath(*text) + " is not UTF-8");
      return writer_.String(text->data(), static_cast<rapidjson::SizeType>(text->size()));
    }
    if (const Dictionary *dictionary = value.dictionary()) return write(*dictionary);
    if (const List *list = value.list()) return write(*list);
    if (const bool *flag = value.boolean()) return writer_.Bool(*flag);
    if (const std::int64_t *number = value.integer()) return writer_.Int64(*number);
    if (const double *number = value.real()) {
      return std::isfinite(*number) ? writer_.Double(*number) : refuse("a number is not finite");
    }
    return refuse("a value of the kind " + std::string(valueKindName(value.kind())) + " cannot be written");
  }

  // The one that is made for sixteen bytes at a time; it does not look whether they are UTF-8.
  rapidjson::Writer<rapidjson::StringBuffer> writer_;
  std::size_t level_ = 0;
  std::string problem_;
};

std::optional<SXError> writeText(const Dictionary &content, rapidjson::StringBuffer &buffer) {
  TextWriter writer(buffer);
  std::string problem;
  if (!writer.write(content)) {
    problem = writer.problem();
  } else {
    buffer.Put('\n');
    if (buffer.GetSize() <= keyedValueSizeLimit) return std::nullopt;
    problem = "the text is longer than " + std::to_string(keyedValueSizeLimit) + " bytes";
  }
  return SXError(std::string(filesErrorDomain), keyedValueFormatErrorCode,
                 {{"description", "Not keyed-value content: " + problem}});
}

/// The new file under the name that it has until it is complete. One writer at a time holds it; what
/// a writer left that died is used again. Goes away unless `keep` was called.
class NewFile {
 public:
  NewFile(int directory, std::string name) : directory_(directory), name_(std::move(name)) {}
  NewFile(const NewFile &) = delete;
  NewFile &operator=(const NewFile &) = delete;
  ~NewFile() {
    if (fd_) ::unlinkat(directory_, name_.c_str(), 0);
  }

  [[nodiscard]] int fd() const { return fd_.get(); }
  [[nodiscard]] const std::string &name() const { return name_; }

  /// 0, or an errno.
  [[nodiscard]] int open() {
    for (;;) {
      UniqueFd fd(::openat(directory_, name_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
      if (!fd) {
        const int error = errno;
        const bool foreign = error == ELOOP || error == ENXIO;  // A symbolic link, or a socket: no writer's.
        if (!foreign || ::unlinkat(directory_, name_.c_str(), 0) != 0) return error;
        continue;
      }
      // A file system without locks leaves it at that: there is one daemon.
      while (::flock(fd.get(), LOCK_EX) != 0 && errno == EINTR) {
      }
      struct stat mine {};
      struct stat named {};
      if (::fstat(fd.get(), &mine) != 0) return errno;
      if (::fstatat(directory_, name_.c_str(), &named, AT_SYMLINK_NOFOLLOW) != 0 || named.st_ino != mine.st_ino ||
          named.st_dev != mine.st_dev) {
        continue;  // The writer before has put it in place.
      }
      if (!S_ISREG(mine.st_mode) || mine.st_nlink != 1) {
        if (::unlinkat(directory_, name_.c_str(), 0) != 0) return errno;
        continue;
      }
      fd_ = std::move(fd);
      return ::ftruncate(fd_.get(), 0) == 0 && ::fchmod(fd_.get(), 0600) == 0 ? 0 : errno;
    }
  }

  [[nodiscard]] int write(const char *bytes, std::size_t count) const {
    while (count > 0) {
      const ssize_t written = ::write(fd_.get(), bytes, count);
      if (written < 0 && errno == EINTR) continue;
      if (written < 0) return errno;
      bytes += written;
      count -= static_cast<std::size_t>(written);
    }
    return ::fsync(fd_.get()) == 0 ? 0 : errno;
  }

  void keep() { fd_.reset(); }

 private:
  int directory_;
  std::string name_;
  UniqueFd fd_;
};

/// 0 when the previous file has its other name, or there is none; a directory stays where it is.
int moveAside(int directory, const std::string &name, const std::string &aside) {
  struct stat status {};
  if (::fstatat(directory, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) return errno == ENOENT ? 0 : errno;
  if (S_ISDIR(status.st_mode)) return EISDIR;
  return ::renameat(directory, name.c_str(), directory, aside.c_str()) == 0 ? 0 : errno;
}

}  // namespace

Result<std::string> keyedValueText(const Dictionary &content) {
  rapidjson::StringBuffer buffer;
  if (std::optional<SXError> error = writeText(content, buffer)) return *std::move(error);
  return std::string(buffer.GetString(), buffer.GetSize());
}

std::optional<SXError> writeKeyedValueFile(const Dictionary &content, const std::string &path, PreviousFile previous) {
  rapidjson::StringBuffer text;
  if (std::optional<SXError> error = writeText(content, text)) return error;

  const auto failed = [&path](int error, std::string_view doing) {
    return posixError(error, std::string(doing) + " " + quotedPath(path));
  };
  const std::size_t slash = path.rfind('/');
  const std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  const std::string directoryPath = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  if (name.empty() || name == "." || name == ".." || path.find('\0') != std::string::npos) {
    return failed(EINVAL, "No file can be named");
  }
  const UniqueFd directory(::open(directoryPath.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return failed(errno, "Cannot open the directory of");

  NewFile file(directory.get(), "." + name + ".new");
  if (const int error = file.open()) return failed(error, "Cannot make the new file for");
  if (const int error = file.write(text.GetString(), text.GetSize())) return failed(error, "Cannot write");

  const std::string aside = name + ".corrupt";
  if (previous == PreviousFile::keptAsCorrupt) {
    if (const int error = moveAside(directory.get(), name, aside)) return failed(error, "Cannot keep what stands in");
  }
  if (::renameat(directory.get(), file.name().c_str(), directory.get(), name.c_str()) != 0) {
    const int error = errno;
    if (previous == PreviousFile::keptAsCorrupt) {
      ::renameat(directory.get(), aside.c_str(), directory.get(), name.c_str());
    }
    return failed(error, "Cannot put the new file in place of");
  }
  file.keep();
  if (::fsync(directory.get()) != 0) return failed(errno, "The disk did not take the directory of");
  return std::nullopt;
}

}  // namespace storix::linuxhost
