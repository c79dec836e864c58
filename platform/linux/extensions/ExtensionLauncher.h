#pragma once

#include <sys/types.h>

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/Result.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// What a child process is made of, and nothing else: nothing of the daemon's environment,
/// descriptors, signal mask or signal handling gets into it.
struct LaunchDescription {
  std::string executable;
  /// Beside the program's own name.
  std::vector<std::string> arguments;
  std::string workingDirectory;
  /// "NAME=value". `STORIX_EXTENSION_FD` is added.
  std::vector<std::string> environment;
  /// Becomes the one descriptor beyond standard input, output and error.
  UniqueFd socket;
  /// Become the descriptors after the socket, in this order.
  std::vector<UniqueFd> descriptors;
  /// The program is one that runs another one inside a sandbox and ends as that ended.
  bool isConfined = false;
  /// Called first of all, on the launcher's thread, with what it may change; it may wait for a while.
  /// With an error nothing is started.
  std::function<std::optional<SXError>(LaunchDescription &)> prepare;
};

/// A process that was started. Whether the program could be run at all is known later: then
/// `execFailure` holds an errno, else it is empty at its end.
struct LaunchedProcess {
  pid_t processIdentifier = 0;
  UniqueFd pidfd;
  UniqueFd output;       ///< Non-blocking; the other end is its standard output and error.
  UniqueFd execFailure;  ///< Non-blocking.
  bool isConfined = false;
};

/// The number by which a child knows its socket.
inline constexpr int launchedSocketNumber = 3;

/// Starts a child process of the calling thread, which dies with that thread. `prepare` is not called.
Result<LaunchedProcess> launchProcess(LaunchDescription description);

/// Starts child processes from one thread, which lives as long as the launcher: the kernel ends a
/// child (SIGKILL) when the thread that started it ends, and so no child outlives the daemon.
class ExtensionLauncher {
 public:
  /// Runs on the launcher's thread, once; it must not wait.
  using Handler = std::function<void(Result<LaunchedProcess>)>;

  ExtensionLauncher();

  /// Starts what was asked for before, then ends the thread, and with it all children that still run.
  ~ExtensionLauncher();

  /// Returns at once.
  void launch(LaunchDescription description, Handler handler);

  /// Waits until all that was asked for so far has been started, and its handlers have returned.
  void waitUntilIdle();

 private:
  void run();

  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<std::function<void()>> work_;
  bool ending_ = false;
  std::thread thread_;
};

}  // namespace storix::linuxhost
