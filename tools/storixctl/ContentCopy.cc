#include "tools/storixctl/ContentCopy.h"

#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <memory>
#include <optional>

namespace storix::ctl {

namespace {

constexpr std::size_t rangeStep = std::size_t{16} << 20;
constexpr std::size_t spliceStep = std::size_t{1} << 20;
constexpr std::size_t bufferSize = std::size_t{256} << 10;
/// What a descriptor that is ready takes without making us wait.
constexpr std::size_t unwaitedSize = PIPE_BUF;

enum class Kind { regular, pipe, other };

Kind kindOf(int descriptor) {
  struct stat status {};
  if (::fstat(descriptor, &status) != 0) return Kind::other;
  return S_ISREG(status.st_mode) ? Kind::regular : S_ISFIFO(status.st_mode) ? Kind::pipe : Kind::other;
}

/// Errors that mean: not with these two descriptors in this way.
bool isUnsuited(int error) {
  return error == EXDEV || error == EINVAL || error == EOPNOTSUPP || error == ENOSYS || error == EBADF ||
         error == EPERM;
}

bool isPassing(int error) { return error == EINTR || error == EAGAIN; }

class Copying {
 public:
  Copying(const ContentCopy &copy, Waiting &waiting, const std::function<void(std::uint64_t)> &progress)
      : copy_(copy), waiting_(waiting), progress_(progress), from_(kindOf(copy.from)), to_(kindOf(copy.to)) {}

  Result<std::uint64_t> run() {
    bool atEnd = false;
    if (from_ == Kind::regular && to_ == Kind::regular) {
      atEnd = inKernel([this] { return ::copy_file_range(copy_.from, nullptr, copy_.to, nullptr, rangeStep, 0); });
    } else if (from_ == Kind::pipe || to_ == Kind::pipe) {
      atEnd =
          inKernel([this] { return ::splice(copy_.from, nullptr, copy_.to, nullptr, spliceStep, SPLICE_F_NONBLOCK); });
    }
    if (!atEnd && !failure_) throughBuffer();
    if (failure_) return *failure_;
    return total_;
  }

 private:
  /// Whether all is copied. Not so: something failed, or the rest has to go through the buffer.
  template <class Step>
  bool inKernel(Step step) {
    while (waitFor(copy_.from, from_, POLLIN) && waitFor(copy_.to, to_, POLLOUT)) {
      const ssize_t count = step();
      if (count > 0) {
        advance(count);
      } else if (count == 0) {
        // A file system that makes its files up as they are read may claim that there is nothing.
        return total_ > 0 || from_ != Kind::regular;
      } else if (!isPassing(errno)) {
        if (!isUnsuited(errno)) fail(errno, "copying " + copy_.fromName + " to " + copy_.toName);
        return false;
      }
    }
    return false;
  }

  void throughBuffer() {
    const auto buffer = std::make_unique<std::array<char, bufferSize>>();
    while (waitFor(copy_.from, from_, POLLIN)) {
      const ssize_t count = ::read(copy_.from, buffer->data(), buffer->size());
      if (count < 0 && isPassing(errno)) continue;
      if (count < 0) return fail(errno, "reading " + copy_.fromName);
      if (count == 0 || !write(buffer->data(), static_cast<std::size_t>(count))) return;
    }
  }

  bool write(const char *bytes, std::size_t size) {
    while (size > 0) {
      if (!waitFor(copy_.to, to_, POLLOUT)) return false;
      const std::size_t step = to_ == Kind::regular ? size : std::min(size, unwaitedSize);
      const ssize_t count = ::write(copy_.to, bytes, step);
      if (count < 0 && isPassing(errno)) continue;
      if (count < 0) {
        fail(errno, "writing " + copy_.toName);
        return false;
      }
      bytes += count;
      size -= static_cast<std::size_t>(count);
      advance(count);
    }
    return true;
  }

  bool waitFor(int descriptor, Kind kind, short events) {
    const bool interrupted = kind == Kind::regular
                                 ? waiting_.isInterrupted()
                                 : waiting_.wait(descriptor, events, std::nullopt) == Waiting::Woken::interrupted;
    if (interrupted) failure_ = interruptedError();
    return !interrupted;
  }

  void advance(ssize_t count) {
    total_ += static_cast<std::uint64_t>(count);
    progress_(total_);
  }

  void fail(int error, const std::string &doing) { failure_ = posixError(error, doing); }

  const ContentCopy &copy_;
  Waiting &waiting_;
  const std::function<void(std::uint64_t)> &progress_;
  const Kind from_;
  const Kind to_;
  std::uint64_t total_ = 0;
  std::optional<SXError> failure_;
};

}  // namespace

Result<std::uint64_t> ContentCopy::run(Waiting &waiting, const std::function<void(std::uint64_t)> &progress) const {
  return Copying(*this, waiting, progress).run();
}

}  // namespace storix::ctl
