#include "platform/linux/identity/ProcessFiles.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {

std::optional<std::string> readSmallFile(int directory, const char *name, std::size_t limit) {
  const UniqueFd fd(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) return std::nullopt;
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return std::nullopt;
  if (!S_ISREG(status.st_mode)) {
    errno = EINVAL;
    return std::nullopt;
  }
  std::string text;
  constexpr std::size_t piece = 4096;
  for (;;) {
    const std::size_t before = text.size();
    text.resize(before + piece);
    const ssize_t got = ::read(fd.get(), text.data() + before, piece);
    if (got < 0 && errno != EINTR) return std::nullopt;
    text.resize(before + (got > 0 ? static_cast<std::size_t>(got) : 0));
    if (got == 0) return text;
    if (text.size() > limit) {
      errno = EFBIG;
      return std::nullopt;
    }
  }
}

}  // namespace storix::linuxhost
