#include "platform/linux/files/ResolvedPath.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr std::string_view deletedSuffix = " (deleted)";
/// As many as the kernel follows.
constexpr int linkLimit = 40;

/// The one path by which the kernel knows what the descriptor stands for.
std::optional<std::string> pathOfDescriptor(int fd) {
  std::array<char, PATH_MAX + deletedSuffix.size()> buffer{};
  const std::string link = "/proc/self/fd/" + std::to_string(fd);
  const ssize_t length = ::readlink(link.c_str(), buffer.data(), buffer.size());
  if (length < 0) return std::nullopt;
  std::string path(buffer.data(), static_cast<std::size_t>(length));
  if (!path.starts_with('/')) {
    errno = ENOENT;  // Outside of this process's root, or of no mount at all.
    return std::nullopt;
  }
  if (path.ends_with(deletedSuffix)) {
    // So says the kernel of what has just lost its name, unless it is really called that.
    struct stat opened {};
    struct stat named {};
    if (::fstat(fd, &opened) != 0) return std::nullopt;
    if (::lstat(path.c_str(), &named) != 0 || opened.st_ino != named.st_ino || opened.st_dev != named.st_dev) {
      errno = ENOENT;
      return std::nullopt;
    }
  }
  return path;
}

/// Takes the last component of the path away and puts it in front of the rest.
void moveLastComponent(std::string &path, std::string &rest) {
  const std::size_t end = path.find_last_not_of('/') + 1;
  const std::size_t slash = path.rfind('/', end - 1);
  const std::string component = path.substr(slash + 1, end - slash - 1);
  if (component != ".") rest = rest.empty() ? component : component + "/" + rest;
  path.resize(slash == 0 ? 1 : slash);
}

struct Appended {
  std::string path;
  bool wentUp = false;
};

/// Appends components to a resolved path; ".." takes one away.
Appended append(std::string path, std::string_view rest) {
  Appended result{std::move(path), false};
  while (!rest.empty()) {
    const std::size_t slash = rest.find('/');
    const std::string_view component = rest.substr(0, slash);
    rest.remove_prefix(slash == std::string_view::npos ? rest.size() : slash + 1);
    if (component == "..") {
      result.wentUp = true;
      const std::size_t last = result.path.rfind('/');
      result.path.resize(last == 0 ? 1 : last);
    } else if (!component.empty() && component != ".") {
      if (result.path.size() > 1) result.path += '/';
      result.path += component;
    }
  }
  return result;
}

std::optional<std::string> linkTarget(const std::string &path) {
  std::array<char, PATH_MAX> buffer{};
  const ssize_t length = ::readlink(path.c_str(), buffer.data(), buffer.size());
  if (length <= 0 || static_cast<std::size_t>(length) == buffer.size()) return std::nullopt;
  return std::string(buffer.data(), static_cast<std::size_t>(length));
}

bool isUsable(const std::string &path) {
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos) {
    errno = EINVAL;
    return false;
  }
  if (path.size() >= PATH_MAX) {
    errno = ENAMETOOLONG;
    return false;
  }
  return true;
}

}  // namespace

std::optional<std::string> resolveExistingPath(const std::string &path) {
  if (!isUsable(path)) return std::nullopt;
  const UniqueFd fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (!fd) return std::nullopt;
  return pathOfDescriptor(fd.get());
}

std::optional<ResolvedPath> resolvePath(const std::string &path) {
  if (!isUsable(path)) return std::nullopt;
  std::string head = path;
  std::string rest;
  for (int links = 0; links < linkLimit;) {
    if (!isUsable(head)) return std::nullopt;
    if (std::optional<std::string> resolved = resolveExistingPath(head)) {
      if (rest.empty()) return ResolvedPath{*std::move(resolved), true};
      Appended appended = append(*std::move(resolved), rest);
      if (!appended.wentUp) return ResolvedPath{std::move(appended.path), false};
      // Having gone up, the path may lead through what exists, and so through links, once more.
      head = std::move(appended.path);
      rest.clear();
      ++links;
      continue;
    }
    if ((errno != ENOENT && errno != ENOTDIR && errno != ENAMETOOLONG) || head == "/") return std::nullopt;

    std::string last;
    std::string parent = head;
    moveLastComponent(parent, last);
    const std::string link = parent == "/" ? "/" + last : parent + "/" + last;
    if (const std::optional<std::string> target = last.empty() ? std::nullopt : linkTarget(link)) {
      // A link to what does not exist, or no longer: what counts is where it leads.
      head = target->front() == '/' ? *target : parent + "/" + *target;
      ++links;
      continue;
    }
    moveLastComponent(head, rest);
  }
  errno = ELOOP;
  return std::nullopt;
}

std::optional<std::string_view> pathBelow(std::string_view directory, std::string_view path) {
  if (directory == "/") return path.substr(1);
  if (!path.starts_with(directory)) return std::nullopt;
  path.remove_prefix(directory.size());
  if (path.empty()) return path;
  if (path.front() != '/') return std::nullopt;
  return path.substr(1);
}

}  // namespace storix::linuxhost
