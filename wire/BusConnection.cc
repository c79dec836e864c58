#include "wire/BusConnection.h"

#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstdint>
#include <utility>

#include "platform/Log.h"
#include "wire/BusConnectionState.h"
#include "wire/FrameGate.h"
#include "wire/FrameLimit.h"

namespace storix::wire {

namespace {

/// The identity that this process shows as a D-Bus server.
sd_id128_t serverIdentity() {
  static const sd_id128_t identity = [] {
    sd_id128_t made{};
    sd_id128_randomize(&made);
    return made;
  }();
  return identity;
}

void logEnd(const std::string &peer, const SXError &reason) {
  sx_default_log().notice("[NOTICE] Ended the connection of %@: %@", peer, reason);
}

SXError brokenConnection(int errorNumber, bool loggedIn) {
  return posixError(errorNumber, loggedIn ? "the peer closed or broke the connection" : "the login failed");
}

/// What a connection is ended with.
SXError refusal(Framing::Verdict verdict, bool loggedIn) {
  switch (verdict) {
    case Framing::Verdict::loginTooLong:
      return posixError(EMSGSIZE, "the login failed");
    case Framing::Verdict::noMessage:
      return posixError(EBADMSG, "what came is no message of the D-Bus protocol");
    case Framing::Verdict::otherVersion:
      return posixError(EPROTO, "a message is not of version 1 of the D-Bus protocol");
    case Framing::Verdict::tooLarge:
      return posixError(EMSGSIZE, "a message is larger than " + std::to_string(maximumMessageSize) + " bytes");
    case Framing::Verdict::unwantedDescriptor:
      return posixError(EPROTO, "a message carries a file descriptor that nothing here takes");
    case Framing::Verdict::ended:
    case Framing::Verdict::read:
    case Framing::Verdict::nothing:
      break;
  }
  return brokenConnection(ECONNRESET, loggedIn);
}

bool isWritable(int fd) {
  pollfd waited{fd, POLLOUT, 0};
  return poll(&waited, 1, 0) > 0 && (waited.revents & POLLOUT) != 0;
}

bool hasHungUp(int fd) {
  pollfd waited{fd, 0, 0};
  return poll(&waited, 1, 0) > 0;
}

}  // namespace

Result<std::shared_ptr<BusConnection>> BusConnection::open(UniqueFd socket, Options options) {
  sd_bus *raw = nullptr;
  int result = sd_bus_new(&raw);
  if (result < 0) return busError(result, "make a D-Bus connection");
  auto state = std::make_unique<State>();
  state->bus.reset(raw);
  const int fd = socket.get();
  const bool passesDescriptors = options.descriptors == Descriptors::passed;
  UniqueFd gated;
  if (options.side == Side::server && passesDescriptors) {
    state->framing = FrameGate::make(
        [state = state.get()](const BusTarget &target, std::string_view signature) {
          return state->takesDescriptor(target, signature);
        },
        gated);
    if (!state->framing) return posixError(errno, "make a socket pair for " + options.peer);
  } else {
    state->framing = std::make_unique<FrameLimit>();
  }
  result = sd_bus_set_fd(raw, gated ? gated.get() : fd, fd);
  if (result < 0) return busError(result, "use the socket of " + options.peer);
  (void)gated.release();
  (void)socket.release();
  if (options.side == Side::server) result = sd_bus_set_server(raw, 1, serverIdentity());
  if (result >= 0) result = sd_bus_negotiate_fds(raw, passesDescriptors ? 1 : 0);
  if (result >= 0) result = sd_bus_start(raw);
  if (result < 0) {
    SXError error = busError(result, "the login failed");
    logEnd(options.peer, error);
    return error;
  }
  state->options = std::move(options);
  return std::shared_ptr<BusConnection>(new BusConnection(std::move(state), fd));
}

BusConnection::BusConnection(std::unique_ptr<State> state, int fd) : state_(std::move(state)), fd_(fd) {}

BusConnection::~BusConnection() { close(); }

void BusConnection::setReadyHandler(std::function<void()> handler) {
  const std::lock_guard lock(state_->mutex);
  state_->readyHandler = std::move(handler);
}

void BusConnection::setClosedHandler(ClosedHandler handler) {
  const std::lock_guard lock(state_->mutex);
  state_->closedHandler = std::move(handler);
}

void BusConnection::setWantedChangedHandler(std::function<void()> handler) {
  const std::lock_guard lock(state_->mutex);
  state_->wantedChangedHandler = std::move(handler);
}

bool BusConnection::isOpen() const {
  const std::lock_guard lock(state_->mutex);
  return !state_->ended;
}

void BusConnection::close() {
  Lock lock(state_->mutex);
  end(lock, posixError(ECANCELED, "the connection to " + state_->options.peer + " was closed on this side"), true);
}

void BusConnection::releaseSocket() {
  close();
  const std::lock_guard lock(state_->mutex);
  sd_bus_close(state_->bus.get());
  state_->framing->release();
}

BusConnection::Wanted BusConnection::wanted() {
  const std::lock_guard lock(state_->mutex);
  Wanted wanted;
  if (state_->ended) return wanted;
  const int events = sd_bus_get_events(state_->bus.get());
  wanted.events = static_cast<short>(events > 0 ? events : 0);
  if (!state_->begun) {
    // The start may have read already what the peer sent; nothing else would say so.
    wanted.events |= POLLOUT;
  } else if (state_->isFull()) {
    wanted.events = static_cast<short>(wanted.events & ~POLLIN);
  } else if (!state_->held.empty() || state_->framing->holdsUnread()) {
    // A request is here already. The socket says at once that it may be written to.
    wanted.events |= POLLOUT;
  }
  std::uint64_t microseconds = UINT64_MAX;
  if (sd_bus_get_timeout(state_->bus.get(), &microseconds) >= 0 && microseconds != UINT64_MAX) {
    wanted.deadline = std::chrono::steady_clock::time_point(std::chrono::microseconds(microseconds));
  }
  return wanted;
}

void BusConnection::process() {
  // A handler may let go of the connection.
  const std::shared_ptr<BusConnection> self = shared_from_this();
  Lock lock(state_->mutex);
  state_->begun = true;
  while (!state_->ended && step(lock)) {
  }
}

/// One turn of `process`; false when there is nothing more to do for now.
bool BusConnection::step(Lock &lock) {
  State &state = *state_;
  if (!state.held.empty() && !state.isFull()) {
    OwnedMessage message = std::move(state.held.front());
    state.held.pop_front();
    dispatch(lock, std::move(message));
    return true;
  }
  const bool writes = state.unwritten() > 0;
  // sd-bus reads where it has nothing to write, or cannot.
  if (state.isFull() && !(writes && isWritable(fd_))) {
    if (hasHungUp(fd_)) end(lock, posixError(ECONNRESET, "the peer closed the connection"), false);
    return false;
  }

  Framing::Verdict verdict = state.framing->beforeProcess(fd_, writes);
  if (verdict == Framing::Verdict::nothing) return false;
  OwnedMessage message;
  int result = 0;
  if (verdict == Framing::Verdict::read) {
    sd_bus_message *raw = nullptr;
    result = sd_bus_process(state.bus.get(), &raw);
    message.reset(raw);
    if (result >= 0 && sd_bus_is_open(state.bus.get()) <= 0) result = -ECONNRESET;
    if (result >= 0) {
      const bool isReady = sd_bus_is_ready(state.bus.get()) > 0;
      verdict = state.framing->afterProcess(fd_, {isReady, message != nullptr, result == 0});
    }
  }
  if (result < 0 || verdict != Framing::Verdict::read) {
    message.reset();
    end(lock, result < 0 ? brokenConnection(-result, state.loggedIn) : refusal(verdict, state.loggedIn), false);
    return false;
  }
  if (!state.loggedIn && sd_bus_is_ready(state.bus.get()) > 0) loggedIn(lock);
  if (!message) return result > 0 || state.framing->holdsUnread();
  if (state.isFull()) {
    state.held.push_back(std::move(message));
    return true;
  }
  dispatch(lock, std::move(message));
  // Whatever comes next lies in the socket, and whoever waits for that sees it.
  return !(state.framing->atBoundary() && state.held.empty());
}

void BusConnection::loggedIn(Lock &lock) {
  State &state = *state_;
  state.loggedIn = true;
  std::deque<Outgoing> unsent = std::exchange(state.unsent, {});
  std::vector<Task> failures;
  failures.reserve(unsent.size());
  for (Outgoing &outgoing : unsent) failures.push_back(state.transmit(outgoing));
  std::function<void()> ready = std::exchange(state.readyHandler, {});
  lock.unlock();
  if (ready) ready();
  for (const Task &failure : failures) {
    if (failure) failure();
  }
  // What they hold may be the last of something that asks for this connection.
  ready = nullptr;
  failures.clear();
  unsent.clear();
  lock.lock();
}

void BusConnection::dispatch(Lock &lock, OwnedMessage message) {
  std::uint8_t type = 0;
  sd_bus_message_get_type(message.get(), &type);
  if (type == SD_BUS_MESSAGE_METHOD_CALL) {
    dispatchRequest(lock, std::move(message));
  } else if (type == SD_BUS_MESSAGE_METHOD_RETURN || type == SD_BUS_MESSAGE_METHOD_ERROR) {
    dispatchReply(lock, std::move(message));
  }
}

/// All that someone else may own a part of. It goes without the mutex, since the last of something that
/// asks for this connection may be among it.
struct BusConnection::Remains {
  std::vector<std::unique_ptr<Waiter>> waiters;
  std::vector<std::shared_ptr<const BusExport>> exports;
  ClosedHandler closed;
  std::function<void()> ready;
  std::function<void()> wantedChanged;

  explicit Remains(State &state)
      : exports(std::exchange(state.exports, {})),
        closed(std::exchange(state.closedHandler, {})),
        ready(std::exchange(state.readyHandler, {})),
        wantedChanged(std::exchange(state.wantedChangedHandler, {})) {
    for (auto &[cookie, waiter] : state.waiting) waiters.push_back(std::move(waiter));
    for (Outgoing &outgoing : state.unsent) waiters.push_back(std::move(outgoing.waiter));
    state.waiting.clear();
    state.unsent.clear();
    state.held.clear();
  }

  /// Tells everyone who waits, and last the owner.
  [[nodiscard]] Task telling(const SXError &reason) const {
    std::vector<Task> tasks;
    tasks.reserve(waiters.size() + 1);
    for (const auto &waiter : waiters) tasks.push_back(waiter->failed(disconnected(reason.message())));
    if (closed) tasks.emplace_back([handler = closed, reason] { handler(reason); });
    if (tasks.empty()) return {};
    return [tasks = std::move(tasks)] {
      for (const Task &task : tasks) {
        if (task) task();
      }
    };
  }
};

void BusConnection::end(Lock &lock, const SXError &reason, bool later) {
  State &state = *state_;
  if (state.ended) return;
  state.ended = true;
  const bool isOrdinary = reason.code() == ECANCELED || (state.loggedIn && reason.code() == ECONNRESET);
  // The peer does not see the end before it is in the log.
  if (!isOrdinary) logEnd(state.options.peer, reason);
  shutdown(fd_, SHUT_RDWR);
  {
    const Remains remains(state);
    lock.unlock();
    if (later) {
      state.runLater(remains.telling(reason));
    } else {
      if (const Task tell = remains.telling(reason)) tell();
    }
  }
  lock.lock();
}

}  // namespace storix::wire
