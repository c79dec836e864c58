#include "tools/storixctl/Waiting.h"

#include <poll.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <limits>

#include "storix/ClientOptions.h"

namespace storix::ctl {

namespace {

int millisecondsUntil(std::optional<Waiting::Clock::time_point> time) {
  if (!time) return -1;
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(*time - Waiting::Clock::now()).count();
  return static_cast<int>(std::clamp<std::int64_t>(left, 0, std::numeric_limits<int>::max()));
}

}  // namespace

SXError interruptedError() {
  return SXError(std::string(clientErrorDomain), static_cast<std::int64_t>(ClientErrorCode::cancelled),
                 {{"description", "Interrupted."}});
}

void ProcessWaiting::watchSignals() {
  (void)::signal(SIGPIPE, SIG_IGN);
  ::sigemptyset(&watched_);
  for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
    struct sigaction action {};
    if (::sigaction(number, nullptr, &action) == 0 && action.sa_handler != SIG_IGN) ::sigaddset(&watched_, number);
  }
  signals_.reset(::signalfd(-1, &watched_, SFD_CLOEXEC | SFD_NONBLOCK));
  // Without it the signals end the program as they would any other.
  if (signals_) ::pthread_sigmask(SIG_BLOCK, &watched_, nullptr);
}

Waiting::Woken ProcessWaiting::wait(int descriptor, short events, std::optional<Clock::time_point> until) {
  for (;;) {
    if (signalNumber_ != 0) return Woken::interrupted;
    std::array<pollfd, 2> waited{{{descriptor, events, 0}, {signals_.get(), POLLIN, 0}}};
    const int count = ::poll(waited.data(), waited.size(), millisecondsUntil(until));
    if (count < 0 && errno != EINTR) return Woken::ready;
    if (count <= 0) {
      if (until && Clock::now() >= *until) return Woken::timePassed;
      continue;
    }
    if (waited[1].revents != 0) takeSignal();
    if (signalNumber_ == 0 && waited[0].revents != 0) return Woken::ready;
  }
}

bool ProcessWaiting::isInterrupted() {
  if (signalNumber_ == 0) takeSignal();
  return signalNumber_ != 0;
}

void ProcessWaiting::takeSignal() {
  signalfd_siginfo information{};
  if (!signals_ || ::read(signals_.get(), &information, sizeof information) != sizeof information) return;
  signalNumber_ = static_cast<int>(information.ssi_signo);
  ::pthread_sigmask(SIG_UNBLOCK, &watched_, nullptr);
}

}  // namespace storix::ctl
