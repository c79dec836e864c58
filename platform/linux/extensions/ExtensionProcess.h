#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/Executor.h"
#include "platform/SXError.h"
#include "platform/linux/extensions/ExtensionLauncher.h"
#include "platform/linux/extensions/OutputLines.h"
#include "platform/linux/sockets/IoLoop.h"
#include "wire/BusConnection.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// One process of an extension, from its start until it is reaped, with its connection and its output.
/// Thread-safe. `LiveProcesses` owns it as long as it runs, the record that asked for it as long as it
/// is of use. It never starts a second process: whoever needs one makes another object.
///
/// It is of use until it fails or is ended. It fails when it cannot be started, does not log in in
/// time, closes its connection or exits. Handlers run on threads of the loop and the executor, never
/// inside a call to this object, but for `whenCauseIsKnown`.
class ExtensionProcess : public std::enable_shared_from_this<ExtensionProcess> {
 public:
  static constexpr std::chrono::seconds loginTime{10};
  /// After the end of its connection a process gets so long until SIGTERM, and again until SIGKILL.
  static constexpr std::chrono::seconds timeUntilSignal{5};
  /// How long after the end of its connection the reason, an exit most often, is waited for.
  static constexpr std::chrono::seconds timeUntilExit{1};
  /// How often it is tried to reap a process that has exited, but that a debugger holds.
  static constexpr std::chrono::milliseconds timeUntilReaped{10};
  /// Messages that it has not answered yet. Sixteen clients with all that they may have in flight; and as
  /// requests that want no answer count nowhere else, what a process that hangs can cost the daemon.
  static constexpr std::size_t messagesWaitingAtMost = 4096;

  /// All of them outlive the process.
  struct Surroundings {
    Executor &executor;  ///< Gives the time, too.
    IoLoop &loop;
    ExtensionLauncher &launcher;
  };

  /// They get the process that they are about.
  struct Handlers {
    /// The login has succeeded.
    std::function<void(const std::shared_ptr<ExtensionProcess> &)> ready;
    /// It failed, before or after `ready`: once, and never after `end`. With the reason.
    std::function<void(const std::shared_ptr<ExtensionProcess> &, const SXError &)> failed;
    /// It is reaped, or never came to be.
    std::function<void(const std::shared_ptr<ExtensionProcess> &)> gone;
  };

  /// `name` is what log lines and errors call the extension.
  ExtensionProcess(Surroundings surroundings, std::string name);
  ~ExtensionProcess();
  ExtensionProcess(const ExtensionProcess &) = delete;
  ExtensionProcess &operator=(const ExtensionProcess &) = delete;

  /// Once. The description's socket is made here.
  void start(LaunchDescription description, Handlers handlers);

  /// Closes the connection, and sees to it that the process ends if it does not do so by itself.
  void end();

  /// Whether it has neither failed nor been ended.
  [[nodiscard]] bool isUsable() const;

  /// Null until the login has succeeded.
  [[nodiscard]] std::shared_ptr<wire::BusConnection> connection() const;

  /// 0 before it is started and once it is reaped.
  [[nodiscard]] pid_t processIdentifier() const;

  /// Calls `handler` when it is known why the connection has ended; at once if it is known already.
  void whenCauseIsKnown(std::function<void(SXError)> handler);

  /// For the daemon's end, once the launcher has nothing more to do: closes the connection and sends
  /// the signal to a process that still runs.
  void endNow(int signal);
  /// Then waits for it, and reaps it. False when it still runs after that time.
  [[nodiscard]] bool waitForExit(std::chrono::milliseconds time);

 private:
  enum class State { starting, loggingIn, ready, ending };

  void launched(LaunchedProcess process);
  [[nodiscard]] std::optional<SXError> openConnection();
  void connectionIsReadable();
  void followConnection();
  void loggedIn();
  void connectionEnded(const SXError &error);
  void loginTimeIsOver();
  void outputIsReadable();
  void takeOutput(std::size_t limit);
  /// Whether it is gone. A debugger can hold it for a while after its exit.
  bool reapIfExited();
  void reapLater();
  [[nodiscard]] SXError exitCause(int code, int status) const;
  void closeConnectionAndEscalate();
  void sendSignal(int signal);
  void settle(const SXError &cause, bool isFailure);

  const Surroundings surroundings_;
  const std::string name_;
  /// Set before anything can call them.
  Handlers handlers_;
  std::string executable_;

  mutable std::mutex mutex_;
  State state_ = State::starting;
  bool wasReady_ = false;
  bool isGone_ = false;
  std::optional<SXError> cause_;
  std::vector<std::function<void(SXError)>> awaitingCause_;
  pid_t processIdentifier_ = 0;
  bool isConfined_ = false;
  UniqueFd pidfd_;
  UniqueFd execFailure_;
  UniqueFd socket_;  ///< Until the connection has it.
  std::shared_ptr<wire::BusConnection> connection_;
  std::unique_ptr<IoLoop::Watch> connectionWatch_;
  std::unique_ptr<IoLoop::Watch> exitWatch_;
  std::unique_ptr<IoLoop::Watch> outputWatch_;
  /// Where a debugger holds it.
  UniqueFd heldTimer_;
  std::unique_ptr<IoLoop::Watch> heldWatch_;

  std::mutex outputMutex_;
  UniqueFd output_;
  OutputLines lines_;
};

}  // namespace storix::linuxhost
