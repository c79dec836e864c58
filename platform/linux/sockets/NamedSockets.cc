#include "platform/linux/sockets/NamedSockets.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <map>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/files/PathText.h"

namespace storix::linuxhost {

namespace {

/// Accepted in one turn, so that one socket's flood does not keep a thread for itself.
constexpr int acceptedAtOnce = 16;
/// When the system has no descriptor or memory left, it is asked again so much later.
constexpr std::chrono::milliseconds pauseWithoutResources{200};
/// A login gets 25 seconds, whatever comes meanwhile. One timer looks at all of them, so that connections
/// that come and go leave none behind: at the sixth look 25 to 30 seconds have passed.
constexpr std::chrono::seconds timeBetweenLooks{5};
constexpr int looksAtALogin = 6;

SXError cannotListen(const std::string &path, std::string_view why) {
  return hostError(HostErrorCode::cannotStart,
                   "The socket " + quotedPath(path) + " cannot be made: " + std::string(why));
}

/// Makes the socket, and replaces one that nobody serves any more.
Result<UniqueFd> makeListeningSocket(const RuntimeDirectory &directory, const std::string &name) {
  const std::string path = directory.path() + "/" + name;
  struct stat found {};
  if (::fstatat(directory.fd(), name.c_str(), &found, AT_SYMLINK_NOFOLLOW) == 0) {
    if (!S_ISSOCK(found.st_mode)) return cannotListen(path, "something else is there; remove it.");
    if (::unlinkat(directory.fd(), name.c_str(), 0) != 0 && errno != ENOENT) {
      return cannotListen(path, std::string("the one of an earlier daemon cannot be removed: ") + std::strerror(errno));
    }
  }
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!socket) return cannotListen(path, std::strerror(errno));
  // However long the directory's path is, this one is short enough for an address.
  const std::string reachable = "/proc/self/fd/" + std::to_string(directory.fd()) + "/" + name;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (reachable.size() >= sizeof address.sun_path) return cannotListen(path, "its name is too long.");
  std::memcpy(address.sun_path, reachable.c_str(), reachable.size() + 1);
  if (::bind(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0 ||
      ::fchmodat(directory.fd(), name.c_str(), 0600, 0) != 0 || ::listen(socket.get(), SOMAXCONN) != 0) {
    return cannotListen(path, std::strerror(errno));
  }
  return socket;
}

bool isLackOfResources(int errorNumber) {
  return errorNumber == EMFILE || errorNumber == ENFILE || errorNumber == ENOBUFS || errorNumber == ENOMEM;
}

}  // namespace

struct NamedSocket::State : std::enable_shared_from_this<NamedSocket::State> {
  State(const ServingContext &servingContext, const RuntimeDirectory &runtimeDirectory, std::string socketName,
        wire::BusConnection::Descriptors passing, UniqueFd listening, bool isOwn)
      : context(servingContext),
        directory(runtimeDirectory),
        name(std::move(socketName)),
        descriptors(passing),
        socket(std::move(listening)),
        madeHere(isOwn) {}

  void acceptWaiting();
  bool acceptOne();
  void add(UniqueFd connection, ConnectionLimit::Place place);
  void pause();
  void goOn();
  void watchLogins();
  void checkLogins();

  const ServingContext context;
  const RuntimeDirectory &directory;
  const std::string name;
  const wire::BusConnection::Descriptors descriptors;
  const UniqueFd socket;
  const bool madeHere;
  /// Set before anything is accepted.
  Accepted accepted;

  std::mutex mutex;
  // Under the mutex:
  std::unique_ptr<IoLoop::Watch> watch;
  /// With the number of looks at a login that is not over.
  std::map<std::shared_ptr<ServedConnection>, int> connections;
  bool loginsAreWatched = false;
  bool ended = false;

  /// Used by the accepting handler alone.
  bool lacksResources = false;
};

void NamedSocket::State::acceptWaiting() {
  for (int i = 0; i < acceptedAtOnce; ++i) {
    if (!acceptOne()) return;
  }
}

/// False when no more can be accepted for now.
bool NamedSocket::State::acceptOne() {
  // Paused before asking, so that a place that comes free meanwhile is not missed.
  pause();
  std::optional<ConnectionLimit::Place> place = context.limit.take([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->goOn();
  });
  if (!place) return false;
  goOn();
  UniqueFd connection(::accept4(socket.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
  if (connection) {
    lacksResources = false;
    add(std::move(connection), std::move(*place));
    return true;
  }
  const int why = errno;
  if (isLackOfResources(why)) {
    if (!std::exchange(lacksResources, true)) {
      sx_default_log().fault("[ERROR] Connections to %@ have to wait: %@", name, posixError(why, "accept"));
    }
    pause();
    context.executor.executeAfter(pauseWithoutResources, [weak = weak_from_this()] {
      if (const auto self = weak.lock()) self->goOn();
    });
    return false;
  }
  // Whoever was about to connect may be gone again; that is no reason to stop.
  return why != EAGAIN && why != EBADF && why != EINVAL;
}

void NamedSocket::State::add(UniqueFd connection, ConnectionLimit::Place place) {
  Result<std::shared_ptr<Peer>> peer = context.peers.admit(connection.get());
  if (!peer) {
    sx_default_log().notice("[NOTICE] Dropped a connection to %@: %@", name, peer.error());
    return;
  }
  auto opened =
      ServedConnection::open(context, std::move(connection), std::move(peer.value()), descriptors, std::move(place));
  if (!opened) return;
  const std::shared_ptr<ServedConnection> &served = opened.value();
  served->setEnded([weak = weak_from_this()](const std::shared_ptr<ServedConnection> &over) {
    const auto self = weak.lock();
    if (!self) return;
    const std::lock_guard lock(self->mutex);
    self->connections.erase(over);
  });
  {
    const std::lock_guard lock(mutex);
    if (ended) return;
    connections.emplace(served, 0);
  }
  accepted(served);
  if (!served->isStarted()) {
    const std::lock_guard lock(mutex);
    connections.erase(served);
    return;
  }
  watchLogins();
}

void NamedSocket::State::pause() {
  const std::lock_guard lock(mutex);
  if (watch) watch->setEvents(0);
}

void NamedSocket::State::goOn() {
  const std::lock_guard lock(mutex);
  if (watch) watch->setEvents(EPOLLIN);
}

void NamedSocket::State::watchLogins() {
  {
    const std::lock_guard lock(mutex);
    if (ended || std::exchange(loginsAreWatched, true)) return;
  }
  context.executor.executeAfter(timeBetweenLooks, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->checkLogins();
  });
}

void NamedSocket::State::checkLogins() {
  std::vector<std::shared_ptr<ServedConnection>> tooLong;
  bool isAnyLeft = false;
  {
    const std::lock_guard lock(mutex);
    loginsAreWatched = false;
    for (auto &[connection, looks] : connections) {
      if (connection->isLoggedIn()) continue;
      if (++looks < looksAtALogin) {
        isAnyLeft = true;
      } else {
        tooLong.push_back(connection);
      }
    }
  }
  for (const auto &connection : tooLong) {
    sx_default_log().notice("[NOTICE] Ended the connection of pid %d: its login took longer than 25 seconds.",
                            connection->peer()->processIdentifier());
    connection->end();
  }
  if (isAnyLeft) watchLogins();
}

Result<std::unique_ptr<NamedSocket>> NamedSocket::open(const ServingContext &context, const RuntimeDirectory &directory,
                                                       ActivatedSockets &activated, std::string name,
                                                       wire::BusConnection::Descriptors descriptors) {
  UniqueFd listening;
  const auto given = activated.find(name);
  const bool isGiven = given != activated.end();
  if (isGiven) {
    listening = std::move(given->second);
    activated.erase(given);
    const int flags = ::fcntl(listening.get(), F_GETFL);
    if (flags < 0 || ::fcntl(listening.get(), F_SETFL, flags | O_NONBLOCK) != 0) {
      return posixError(errno, "use the socket " + name + " that was handed over");
    }
  } else {
    Result<UniqueFd> made = makeListeningSocket(directory, name);
    if (!made) return made.error();
    listening = std::move(made.value());
  }
  return std::unique_ptr<NamedSocket>(new NamedSocket(
      std::make_shared<State>(context, directory, std::move(name), descriptors, std::move(listening), !isGiven)));
}

NamedSocket::~NamedSocket() {
  std::unique_ptr<IoLoop::Watch> watch;
  {
    const std::lock_guard lock(state_->mutex);
    state_->ended = true;
    watch = std::move(state_->watch);
  }
  watch.reset();
  std::vector<std::shared_ptr<ServedConnection>> open;
  {
    const std::lock_guard lock(state_->mutex);
    for (const auto &[connection, looks] : state_->connections) open.push_back(connection);
  }
  for (const auto &connection : open) connection->end();
  if (state_->madeHere) ::unlinkat(state_->directory.fd(), state_->name.c_str(), 0);
}

void NamedSocket::serve(Accepted accepted) {
  State &state = *state_;
  state.accepted = std::move(accepted);
  std::unique_ptr<IoLoop::Watch> watch =
      state.context.loop.watch(state.socket.get(), 0, [weak = std::weak_ptr(state_)](std::uint32_t) {
        if (const auto self = weak.lock()) self->acceptWaiting();
      });
  if (!watch) {
    sx_default_log().fault("[ERROR] Could not watch the socket %@: %@", state.name, posixError(errno, "epoll"));
    return;
  }
  const std::lock_guard lock(state.mutex);
  state.watch = std::move(watch);
  state.watch->setEvents(EPOLLIN);
}

const std::string &NamedSocket::name() const { return state_->name; }

}  // namespace storix::linuxhost
