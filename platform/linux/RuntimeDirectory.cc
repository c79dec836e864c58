#include "platform/linux/RuntimeDirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/linux/HostErrors.h"
#include "platform/linux/files/PathText.h"

namespace storix::linuxhost {

namespace {

SXError refusal(const std::string &path, const std::string &rest) {
  return hostError(HostErrorCode::cannotStart, "The runtime directory " + quotedPath(path) + " " + rest);
}

std::string reasonOf(int errorNumber) { return std::strerror(errorNumber); }

/// Whether what was opened may be the runtime directory.
std::optional<SXError> unfitness(const std::string &path, const struct stat &found) {
  const std::string elsewhere = "or name another directory in STORIX_RUNTIME_DIR.";
  if (S_ISLNK(found.st_mode)) {
    return refusal(path, "is a symbolic link, which is not followed; remove it, " + elsewhere);
  }
  if (!S_ISDIR(found.st_mode)) return refusal(path, "is not a directory; remove what is there, " + elsewhere);
  if (found.st_uid != ::geteuid()) {
    return refusal(path, "belongs to another user, " + std::to_string(found.st_uid) + "; the daemon runs as user " +
                             std::to_string(::geteuid()) + ". Remove it, " + elsewhere);
  }
  const mode_t mode = found.st_mode & 0777;
  if (mode != 0700) {
    std::array<char, 8> octal{};
    (void)std::snprintf(octal.data(), octal.size(), "%04o", mode);
    const std::string whatIsWrong = (mode & 077) != 0 ? "lets other users in" : "keeps its own user out";
    return refusal(path, whatIsWrong + " (its mode is " + octal.data() + "); chmod 700 it, " + elsewhere);
  }
  return std::nullopt;
}

/// The process that wrote its number into the lock file, for the error text.
std::string holderOf(int lock) {
  std::array<char, 16> text{};
  const ssize_t length = ::pread(lock, text.data(), text.size() - 1, 0);
  const long process = length > 0 ? std::strtol(text.data(), nullptr, 10) : 0;
  return process > 0 ? " (process " + std::to_string(process) + ")" : std::string();
}

Result<UniqueFd> takeLock(const std::string &path, int directory) {
  // The sticky bit keeps it from those who tidy runtime directories.
  UniqueFd lock(::openat(directory, std::string(lockFileName).c_str(),
                         O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600 | S_ISVTX));
  if (!lock) {
    return refusal(path, "has a lock file, " + std::string(lockFileName) + ", that cannot be opened (" +
                             reasonOf(errno) + "); remove that file.");
  }
  while (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno == EINTR) continue;
    if (errno != EWOULDBLOCK) return refusal(path, "cannot be locked (" + reasonOf(errno) + ").");
    return refusal(path, "is in use by another storixd" + holderOf(lock.get()) +
                             "; stop that one first, or name another directory in STORIX_RUNTIME_DIR.");
  }
  const std::string process = std::to_string(::getpid()) + "\n";
  if (::ftruncate(lock.get(), 0) != 0 ||
      ::pwrite(lock.get(), process.data(), process.size(), 0) != static_cast<ssize_t>(process.size())) {
    return refusal(path, "cannot be written to (" + reasonOf(errno) + ").");
  }
  return lock;
}

}  // namespace

RuntimeDirectory::RuntimeDirectory(std::string path, UniqueFd directory, UniqueFd lock)
    : path_(std::move(path)), directory_(std::move(directory)), lock_(std::move(lock)) {}

Result<std::unique_ptr<RuntimeDirectory>> RuntimeDirectory::open(std::string path) {
  while (path.size() > 1 && path.ends_with('/')) path.pop_back();
  if (::mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) {
    return refusal(path, "cannot be made (" + reasonOf(errno) +
                             "); make the directory that shall hold it, or name another one in STORIX_RUNTIME_DIR.");
  }
  // Opened first and looked at then, so that it cannot be exchanged in between.
  const UniqueFd found(::open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status {};
  if (!found || ::fstat(found.get(), &status) != 0) {
    return refusal(path, "cannot be opened (" + reasonOf(errno) + ").");
  }
  if (std::optional<SXError> error = unfitness(path, status)) return *std::move(error);
  UniqueFd directory(::openat(found.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return refusal(path, "cannot be opened (" + reasonOf(errno) + ").");
  Result<UniqueFd> lock = takeLock(path, directory.get());
  if (!lock) return lock.error();
  return std::unique_ptr<RuntimeDirectory>(
      new RuntimeDirectory(std::move(path), std::move(directory), std::move(lock.value())));
}

Result<ActivatedSockets> takeActivatedSockets() {
  char **names = nullptr;
  const int count = sd_listen_fds_with_names(1, &names);
  ActivatedSockets sockets;
  std::optional<SXError> problem;
  if (count < 0) {
    problem = hostError(HostErrorCode::cannotStart, "The sockets of the service manager cannot be taken (" +
                                                        reasonOf(-count) + "); look at LISTEN_FDS and LISTEN_FDNAMES.");
  }
  for (int i = 0; i < count; ++i) {
    UniqueFd socket(SD_LISTEN_FDS_START + i);
    const std::string name = names[i];
    if (sd_is_socket(socket.get(), AF_UNIX, SOCK_STREAM, 1) <= 0) {
      problem = hostError(HostErrorCode::cannotStart, "What the service manager hands over as " + quotedPath(name) +
                                                          " is no listening unix stream socket; mend its unit.");
      continue;
    }
    if (!sockets.try_emplace(name, std::move(socket)).second) {
      problem = hostError(HostErrorCode::cannotStart, "The service manager hands over two sockets with the name " +
                                                          quotedPath(name) + "; mend its unit.");
    }
  }
  for (char **name = names; name && *name; ++name) std::free(*name);
  std::free(names);
  if (problem) return *std::move(problem);
  return sockets;
}

}  // namespace storix::linuxhost
