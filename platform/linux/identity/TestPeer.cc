// A peer for tests, which may be run in a sandbox:
//
//   storix_test_peer NAME [LANDLOCK-DIRECTORY]
//
// It gives itself a Landlock domain in which it may touch files of that directory alone, if one is named;
// connects twice to the abstract unix socket; and then opens what it is told on descriptor 3, one message
// each: the flags as a number, a blank, the path. The answer is the descriptor, or the errno in a byte.
// It ends when nobody can tell it anything any more.

#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "wire/SendBytes.h"

namespace {

constexpr int controlSocket = 3;

bool enterLandlockDomain(const char *directory) {
  const std::uint64_t access = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_WRITE_FILE;
  landlock_ruleset_attr attributes{};
  attributes.handled_access_fs = access;
  const long ruleset = ::syscall(SYS_landlock_create_ruleset, &attributes, sizeof(attributes.handled_access_fs), 0);
  landlock_path_beneath_attr rule{};
  rule.allowed_access = access;
  rule.parent_fd = ::open(directory, O_PATH | O_DIRECTORY | O_CLOEXEC);
  return ruleset >= 0 && rule.parent_fd >= 0 &&
         ::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) == 0 &&
         ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && ::syscall(SYS_landlock_restrict_self, ruleset, 0) == 0;
}

bool connectTo(const char *name) {
  sockaddr_un address{AF_UNIX, {}};
  const std::size_t length = std::strlen(name);
  if (length + 1 > sizeof(address.sun_path)) return false;
  std::memcpy(address.sun_path + 1, name, length);
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  return ::connect(socket, reinterpret_cast<const sockaddr *>(&address),
                   static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + length)) == 0;
}

void answer(int opened, int error) {
  const char byte = static_cast<char>(opened < 0 ? error : 0);
  const std::array<int, 1> passed{opened};
  (void)storix::wire::sendBytes(controlSocket, std::string_view(&byte, 1), std::span(passed).first(opened < 0 ? 0 : 1));
}

}  // namespace

int main(int count, char **arguments) {
  if (count > 2 && !enterLandlockDomain(arguments[2])) {
    std::perror("storix_test_peer: cannot enter a Landlock domain");
    return 1;
  }
  if (count < 2 || !connectTo(arguments[1]) || !connectTo(arguments[1])) {
    std::perror("storix_test_peer: cannot connect");
    return 1;
  }
  for (std::array<char, 8192> text{};;) {
    const ssize_t size = ::recv(controlSocket, text.data(), text.size() - 1, 0);
    if (size <= 0) return 0;
    text[static_cast<std::size_t>(size)] = '\0';
    char *path = nullptr;
    const long flags = std::strtol(text.data(), &path, 10);
    const int opened = ::open(path + 1, static_cast<int>(flags) | O_CLOEXEC);
    answer(opened, errno);
    if (opened >= 0) ::close(opened);
  }
}
