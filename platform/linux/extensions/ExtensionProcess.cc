#include "platform/linux/extensions/ExtensionProcess.h"

#include <fcntl.h>
#include <malloc.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <thread>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/extensions/ExtensionConfinement.h"

namespace storix::linuxhost {

namespace {

/// What is read of the output at a time, and what is still read of it after the exit: a process that
/// it has started may go on writing for ever.
constexpr std::size_t outputAtATime = 64 * 1024;
constexpr std::size_t outputAfterExit = 1024 * 1024;

/// The program that confines another one adds the number of the signal that has ended that one.
constexpr int signalStatusBase = 128;

std::string signalText(int signal) {
  const char *description = ::sigdescr_np(signal);
  return std::to_string(signal) + (description ? " (" + std::string(description) + ")" : std::string());
}

}  // namespace

ExtensionProcess::ExtensionProcess(Surroundings surroundings, std::string name)
    : surroundings_(surroundings),
      name_(std::move(name)),
      lines_([this](std::string_view line) { sx_default_log().notice("[NOTICE] Extension %@: %@", name_, line); }) {}

/// Whatever waited for the process is gone by now, and may have been much.
ExtensionProcess::~ExtensionProcess() { ::malloc_trim(0); }

void ExtensionProcess::start(LaunchDescription description, Handlers handlers) {
  handlers_ = std::move(handlers);
  executable_ = description.executable;
  const std::shared_ptr<ExtensionProcess> self = shared_from_this();
  surroundings_.executor.executeAfter(loginTime, [weak = weak_from_this()] {
    if (const auto process = weak.lock()) process->loginTimeIsOver();
  });
  const auto notStarted = [this, self](const SXError &error) {
    // Without a process nobody else will say so.
    surroundings_.executor.execute([self, error] {
      {
        const std::lock_guard lock(self->mutex_);
        self->state_ = State::ending;
        self->isGone_ = true;
      }
      self->settle(error, true);
      if (self->handlers_.gone) self->handlers_.gone(self);
    });
  };
  std::array<int, 2> ends{};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
    notStarted(posixError(errno, "making the connection of the extension " + name_));
    return;
  }
  description.socket.reset(ends[1]);
  {
    const std::lock_guard lock(mutex_);
    socket_.reset(ends[0]);
  }
  surroundings_.launcher.launch(std::move(description), [self, notStarted](Result<LaunchedProcess> launchedProcess) {
    if (!launchedProcess) {
      notStarted(launchedProcess.error());
    } else {
      self->launched(std::move(launchedProcess.value()));
    }
  });
}

void ExtensionProcess::launched(LaunchedProcess process) {
  sx_default_log().info("[INFO] Started process %d of the extension %@.", process.processIdentifier, name_);
  {
    const std::lock_guard lock(outputMutex_);
    output_ = std::move(process.output);
  }
  std::optional<SXError> notWatched;
  std::optional<SXError> notConnected;
  bool isTooLate = false;
  {
    const std::lock_guard lock(mutex_);
    processIdentifier_ = process.processIdentifier;
    pidfd_ = std::move(process.pidfd);
    execFailure_ = std::move(process.execFailure);
    isConfined_ = process.isConfined;
    exitWatch_ = surroundings_.loop.watch(pidfd_.get(), EPOLLIN, [weak = weak_from_this()](std::uint32_t) {
      if (const auto self = weak.lock()) self->reapIfExited();
    });
    outputWatch_ = surroundings_.loop.watch(output_.get(), EPOLLIN, [weak = weak_from_this()](std::uint32_t) {
      if (const auto self = weak.lock()) self->outputIsReadable();
    });
    isTooLate = state_ == State::ending;
    if (!exitWatch_ || !outputWatch_) {
      notWatched = posixError(ENOMEM, "watching the process of the extension " + name_);
      state_ = State::ending;
    } else if (!isTooLate) {
      state_ = State::loggingIn;
      notConnected = openConnection();
    }
  }
  if (notWatched) settle(*notWatched, true);
  if (notWatched || isTooLate) closeConnectionAndEscalate();
  // A process that is gone already, for instance: its exit will say more.
  if (notConnected) connectionEnded(*notConnected);
}

std::optional<SXError> ExtensionProcess::openConnection() {
  wire::BusConnection::Options options;
  options.side = wire::BusConnection::Side::server;
  options.peer = "extension " + name_ + ", pid " + std::to_string(processIdentifier_);
  options.messagesWaitingAtMost = messagesWaitingAtMost;
  options.runLater = [&executor = surroundings_.executor](Task task) { executor.execute(std::move(task)); };
  Result<std::shared_ptr<wire::BusConnection>> opened = wire::BusConnection::open(std::move(socket_), options);
  if (!opened) return opened.error();
  connection_ = std::move(opened.value());
  connection_->setReadyHandler([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->loggedIn();
  });
  connection_->setClosedHandler([weak = weak_from_this()](const SXError &error) {
    if (const auto self = weak.lock()) self->connectionEnded(error);
  });
  connection_->setWantedChangedHandler([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->followConnection();
  });
  // The login has a time of its own here, so that the connection's deadlines do not matter.
  connectionWatch_ = surroundings_.loop.watch(
      connection_->fd(), static_cast<std::uint32_t>(connection_->wanted().events),
      [weak = weak_from_this()](std::uint32_t) {
        if (const auto self = weak.lock()) self->connectionIsReadable();
      },
      IoLoop::Expected::answers);
  if (!connectionWatch_) return posixError(ENOMEM, "watching the connection of the extension " + name_);
  return std::nullopt;
}

void ExtensionProcess::connectionIsReadable() {
  std::shared_ptr<wire::BusConnection> connection;
  {
    const std::lock_guard lock(mutex_);
    if (connectionWatch_) connection = connection_;
  }
  if (!connection) return;
  connection->process();
  followConnection();
}

void ExtensionProcess::followConnection() {
  std::unique_ptr<IoLoop::Watch> ended;
  std::shared_ptr<wire::BusConnection> connection;
  {
    const std::lock_guard lock(mutex_);
    if (!connectionWatch_) return;
    if (connection_->isOpen()) {
      connectionWatch_->setEvents(static_cast<std::uint32_t>(connection_->wanted().events));
      return;
    }
    ended = std::move(connectionWatch_);
    connection = connection_;
  }
  ended.reset();
  connection->releaseSocket();
}

void ExtensionProcess::loggedIn() {
  {
    const std::lock_guard lock(mutex_);
    if (state_ != State::loggingIn) return;
    state_ = State::ready;
    wasReady_ = true;
    execFailure_.reset();
  }
  if (handlers_.ready) handlers_.ready(shared_from_this());
}

void ExtensionProcess::connectionEnded(const SXError &error) {
  bool beforeLogin = false;
  {
    const std::lock_guard lock(mutex_);
    if (state_ == State::ending) return;
    beforeLogin = !wasReady_;
    state_ = State::ending;
  }
  // Most often it ends because the process does, and that says more.
  const SXError cause =
      hostError(HostErrorCode::connectionClosed,
                beforeLogin ? "The login of the extension " + name_ +
                                  " failed: it closed its connection or sent nonsense (" + error.message() + ")."
                            : "The connection to the extension " + name_ + " has ended (" + error.message() + ").");
  surroundings_.executor.executeAfter(timeUntilExit, [weak = weak_from_this(), cause] {
    if (const auto self = weak.lock()) self->settle(cause, true);
  });
  closeConnectionAndEscalate();
}

void ExtensionProcess::loginTimeIsOver() {
  {
    const std::lock_guard lock(mutex_);
    if (state_ != State::starting && state_ != State::loggingIn) return;
    state_ = State::ending;
  }
  settle(hostError(HostErrorCode::loginTimedOut,
                   "The process of the extension " + name_ + " did not finish its login within 10 seconds."),
         true);
  closeConnectionAndEscalate();
}

void ExtensionProcess::end() {
  {
    const std::lock_guard lock(mutex_);
    if (state_ == State::ending) return;
    state_ = State::ending;
  }
  settle(hostError(HostErrorCode::connectionClosed,
                   "The process of the extension " + name_ + " was ended, since no request was open."),
         false);
  closeConnectionAndEscalate();
}

void ExtensionProcess::closeConnectionAndEscalate() {
  std::shared_ptr<wire::BusConnection> connection;
  {
    const std::lock_guard lock(mutex_);
    connection = connection_;
    socket_.reset();
  }
  if (connection) {
    connection->close();
    followConnection();
  }
  for (const auto &[time, signal] : {std::pair{timeUntilSignal, SIGTERM}, std::pair{2 * timeUntilSignal, SIGKILL}}) {
    surroundings_.executor.executeAfter(time, [weak = weak_from_this(), number = signal] {
      if (const auto self = weak.lock()) self->sendSignal(number);
    });
  }
}

void ExtensionProcess::sendSignal(int signal) {
  const std::lock_guard lock(mutex_);
  if (isGone_ || !pidfd_) return;
  sx_default_log().info("[INFO] Ending process %d of the extension %@ with signal %@.", processIdentifier_, name_,
                        signalText(signal));
  // The program itself is asked to end; the end of the one that confines it would kill it.
  if (isConfined_ && signal != SIGKILL && signalConfined(processIdentifier_, signal)) return;
  if (isConfined_) killConfined(processIdentifier_);
  ::syscall(SYS_pidfd_send_signal, pidfd_.get(), signal, nullptr, 0);
}

void ExtensionProcess::outputIsReadable() { takeOutput(outputAtATime); }

void ExtensionProcess::takeOutput(std::size_t limit) {
  std::array<char, 4096> buffer;
  bool hasEnded = false;
  {
    const std::lock_guard lock(outputMutex_);
    std::size_t taken = 0;
    while (output_ && taken < limit) {
      const ssize_t size = ::read(output_.get(), buffer.data(), buffer.size());
      if (size < 0 && errno == EINTR) continue;
      if (size < 0 && errno == EAGAIN) break;
      if (size <= 0) {
        hasEnded = true;
        lines_.finish();
        break;
      }
      lines_.append(std::string_view(buffer.data(), static_cast<std::size_t>(size)));
      taken += static_cast<std::size_t>(size);
    }
  }
  if (!hasEnded) return;
  const std::lock_guard lock(mutex_);
  if (outputWatch_) outputWatch_->setEvents(0);
}

bool ExtensionProcess::reapIfExited() {
  UniqueFd pidfd;
  std::unique_ptr<IoLoop::Watch> exitWatch;
  std::unique_ptr<IoLoop::Watch> outputWatch;
  std::unique_ptr<IoLoop::Watch> heldWatch;
  std::optional<SXError> cause;
  {
    const std::lock_guard lock(mutex_);
    if (isGone_ || !pidfd_) return true;
    siginfo_t information{};
    const int waited = ::waitid(P_PIDFD, static_cast<id_t>(pidfd_.get()), &information, WEXITED | WNOHANG);
    if (waited != 0 && errno == EINTR) return false;
    if (waited == 0 && information.si_pid == 0) {
      if (exitWatch_) reapLater();
      return false;
    }
    isGone_ = true;
    // Where somebody else has reaped it there is nothing more to know than that it is gone.
    cause = exitCause(waited == 0 ? information.si_code : CLD_EXITED, waited == 0 ? information.si_status : 0);
    state_ = State::ending;
    exitWatch = std::move(exitWatch_);
    outputWatch = std::move(outputWatch_);
    heldWatch = std::move(heldWatch_);
    // Where somebody who waits for the exit has taken the watch, it is still at it: then the descriptor stays as
    // long as this object.
    if (exitWatch) pidfd = std::move(pidfd_);
    execFailure_.reset();
    socket_.reset();
    // What it has answered is still read; then the connection ends, even if a process that it has
    // started holds the other end open.
    if (connectionWatch_) ::shutdown(connection_->fd(), SHUT_RDWR);
  }
  exitWatch.reset();
  outputWatch.reset();
  heldWatch.reset();
  takeOutput(outputAfterExit);
  {
    const std::lock_guard lock(outputMutex_);
    output_.reset();
    lines_.finish();
  }
  sx_default_log().info("[INFO] %@", cause->message());
  settle(*cause, true);
  if (handlers_.gone) handlers_.gone(shared_from_this());
  return true;
}

/// With the mutex held. The descriptor of a process that a debugger holds tells of the exit all the time, which
/// would keep a thread of the loop busy until the debugger lets go.
void ExtensionProcess::reapLater() {
  if (!heldWatch_) {
    heldTimer_.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    if (!heldTimer_) return;
    heldWatch_ = surroundings_.loop.watch(heldTimer_.get(), EPOLLIN, [weak = weak_from_this()](std::uint32_t) {
      if (const auto self = weak.lock()) self->reapIfExited();
    });
    if (!heldWatch_) return;
  }
  itimerspec next{};
  next.it_value.tv_nsec = std::chrono::nanoseconds(timeUntilReaped).count();
  // The timer is not readable again before then.
  if (::timerfd_settime(heldTimer_.get(), 0, &next, nullptr) == 0) exitWatch_->setEvents(0);
}

SXError ExtensionProcess::exitCause(int code, int status) const {
  int execError = 0;
  if (execFailure_ && ::read(execFailure_.get(), &execError, sizeof(execError)) == sizeof(execError)) {
    return programError(execError, executable_, name_);
  }
  const bool tellsOfSignal =
      isConfined_ && code == CLD_EXITED && status > signalStatusBase && status < signalStatusBase + NSIG;
  const std::string when = wasReady_ ? "." : ", before it had logged in.";
  if (code == CLD_EXITED && !tellsOfSignal) {
    return SXError(std::string(platformErrorDomain), static_cast<std::int64_t>(HostErrorCode::extensionExited),
                   {{"description",
                     "The process of the extension " + name_ + " exited with status " + std::to_string(status) + when},
                    {"status", status}});
  }
  return hostError(HostErrorCode::extensionKilled, "The process of the extension " + name_ + " was killed by signal " +
                                                       signalText(tellsOfSignal ? status - signalStatusBase : status) +
                                                       when);
}

void ExtensionProcess::settle(const SXError &cause, bool isFailure) {
  std::vector<std::function<void(SXError)>> waiting;
  {
    const std::lock_guard lock(mutex_);
    if (cause_) return;
    cause_ = cause;
    waiting.swap(awaitingCause_);
  }
  if (isFailure && handlers_.failed) handlers_.failed(shared_from_this(), cause);
  for (const auto &handler : waiting) handler(cause);
}

bool ExtensionProcess::isUsable() const {
  const std::lock_guard lock(mutex_);
  return state_ != State::ending;
}

std::shared_ptr<wire::BusConnection> ExtensionProcess::connection() const {
  const std::lock_guard lock(mutex_);
  return wasReady_ ? connection_ : nullptr;
}

pid_t ExtensionProcess::processIdentifier() const {
  const std::lock_guard lock(mutex_);
  return isGone_ ? 0 : processIdentifier_;
}

void ExtensionProcess::whenCauseIsKnown(std::function<void(SXError)> handler) {
  std::optional<SXError> cause;
  {
    const std::lock_guard lock(mutex_);
    if (!cause_) {
      awaitingCause_.push_back(std::move(handler));
      return;
    }
    cause = cause_;
  }
  handler(*cause);
}

void ExtensionProcess::endNow(int signal) {
  {
    const std::lock_guard lock(mutex_);
    state_ = State::ending;
  }
  settle(hostError(HostErrorCode::hostEnding, "The daemon is ending, and with it the extension " + name_ + "."), true);
  closeConnectionAndEscalate();
  sendSignal(signal);
}

bool ExtensionProcess::waitForExit(std::chrono::milliseconds time) {
  std::unique_ptr<IoLoop::Watch> exitWatch;
  std::unique_ptr<IoLoop::Watch> heldWatch;
  {
    const std::lock_guard lock(mutex_);
    exitWatch = std::move(exitWatch_);
    heldWatch = std::move(heldWatch_);
  }
  // From here on no other thread reaps it, so that the descriptor stays.
  exitWatch.reset();
  heldWatch.reset();
  const auto deadline = std::chrono::steady_clock::now() + time;
  for (;;) {
    pollfd waiting{};
    {
      const std::lock_guard lock(mutex_);
      if (isGone_ || !pidfd_) return true;
      waiting = {pidfd_.get(), POLLIN, 0};
    }
    const auto left =
        std::max(std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()),
                 std::chrono::milliseconds::zero());
    const int ready = ::poll(&waiting, 1, static_cast<int>(left.count()));
    if (ready > 0 && reapIfExited()) return true;
    if (left == std::chrono::milliseconds::zero()) return false;
    if (ready > 0) std::this_thread::sleep_for(std::min(left, timeUntilReaped));
  }
}

}  // namespace storix::linuxhost
