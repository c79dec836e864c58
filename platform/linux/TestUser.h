#pragma once

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>

namespace storix::linuxhost {

/// Runs a check in a process without root's rights. True when it answered true.
inline bool holdsWithoutRoot(const std::function<bool()> &check) {
  constexpr uid_t nobody = 65534;
  const pid_t child = ::fork();
  if (child == 0) {
    // Having changed its user a process cannot be looked at by its like, unless it says so.
    const bool dropped =
        ::geteuid() != 0 || (::setresgid(nobody, nobody, nobody) == 0 && ::setresuid(nobody, nobody, nobody) == 0 &&
                             ::prctl(PR_SET_DUMPABLE, 1, 0, 0, 0) == 0);
    ::_exit(dropped && check() ? 0 : 1);
  }
  int status = -1;
  ::waitpid(child, &status, 0);
  return status == 0;
}

}  // namespace storix::linuxhost
