#include "platform/linux/extensions/DirectoryWatches.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <string_view>

namespace storix::linuxhost {

namespace {

constexpr std::uint32_t watchedEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_CLOSE_WRITE |
                                        IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

/// Its parent tells when it comes, or when its permissions change.
bool isWatchedByParent(int error) { return error == ENOENT || error == ENOTDIR || error == EACCES || error == ELOOP; }

}  // namespace

DirectoryWatches::DirectoryWatches() : inotify_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
  if (!inotify_) openError_ = errno;
}

void DirectoryWatches::beginRound() {
  round_.clear();
  problems_.clear();
  if (!inotify_) problems_.push_back(posixError(openError_, "watching the extensions directories"));
}

int DirectoryWatches::add(const std::string &directory, const std::string &name) {
  const int watch = ::inotify_add_watch(inotify_.get(), directory.c_str(), watchedEvents);
  if (watch < 0) return -errno;
  round_[watch].insert(name);
  return watch;
}

void DirectoryWatches::watch(const std::string &directory, const std::string &name) {
  if (!inotify_) return;
  // Climb to the nearest directory that exists; then look once more at the one below it, which may
  // have come meanwhile.
  std::string path = directory;
  std::string awaited = name;
  for (;;) {
    const int watch = add(path, awaited);
    if (watch < 0) {
      const std::size_t slash = path.rfind('/');
      if (!isWatchedByParent(-watch) || path == "/" || slash == std::string::npos) {
        problems_.push_back(posixError(-watch, "watching the directory " + path));
        return;
      }
      awaited = path.substr(slash + 1);
      path = slash == 0 ? "/" : path.substr(0, slash);
      continue;
    }
    if (path == directory) return;
    const std::string below = path == "/" ? path + awaited : path + "/" + awaited;
    if (const int again = add(below, ""); again < 0) {
      if (!isWatchedByParent(-again)) problems_.push_back(posixError(-again, "watching the directory " + below));
      return;
    }
    path = directory;
    awaited = name;
  }
}

std::vector<SXError> DirectoryWatches::endRound() {
  for (const auto &[watch, names] : watches_) {
    if (!round_.contains(watch)) ::inotify_rm_watch(inotify_.get(), watch);
  }
  watches_ = std::move(round_);
  round_.clear();
  return std::move(problems_);
}

bool DirectoryWatches::isOfInterest(int watch, const char *name) const {
  for (const auto *watches : {&watches_, &round_}) {
    const auto found = watches->find(watch);
    if (found == watches->end()) continue;
    for (const std::string &wanted : found->second) {
      if (wanted == name) return true;
      if (wanted.starts_with('*') && std::string_view(name).ends_with(std::string_view(wanted).substr(1))) return true;
    }
  }
  return false;
}

bool DirectoryWatches::wantsLook(std::span<const std::byte> events) {
  bool wanted = false;
  while (events.size() >= sizeof(inotify_event)) {
    inotify_event event;
    std::memcpy(&event, events.data(), sizeof(event));
    if (events.size() - sizeof(event) < event.len) break;
    const char *name = event.len > 0 ? reinterpret_cast<const char *>(events.data() + sizeof(event)) : "";
    if ((event.mask & IN_Q_OVERFLOW) != 0) {
      wanted = true;
    } else if ((event.mask & IN_IGNORED) != 0) {
      // The directory is gone; this number may come to mean another one.
      if (watches_.erase(event.wd) + round_.erase(event.wd) > 0) wanted = true;
    } else if (event.len == 0) {
      // The directory itself: gone, moved, or other permissions.
      if (watches_.contains(event.wd) || round_.contains(event.wd)) wanted = true;
    } else if (isOfInterest(event.wd, name)) {
      wanted = true;
    }
    events = events.subspan(sizeof(event) + event.len);
  }
  return wanted;
}

bool DirectoryWatches::readChanges() {
  alignas(inotify_event) std::array<std::byte, 16384> buffer;
  bool wanted = false;
  for (;;) {
    const ssize_t size = ::read(inotify_.get(), buffer.data(), buffer.size());
    if (size < 0 && errno == EINTR) continue;
    if (size <= 0) return wanted;
    wanted = wantsLook(std::span<const std::byte>(buffer.data(), static_cast<std::size_t>(size))) || wanted;
  }
}

}  // namespace storix::linuxhost
