#include "platform/linux/sockets/ServedConnection.h"

#include <sys/epoll.h>

#include <string>
#include <utility>

#include "platform/Log.h"

namespace storix::linuxhost {

Result<std::shared_ptr<ServedConnection>> ServedConnection::open(const ServingContext &context, UniqueFd socket,
                                                                 std::shared_ptr<Peer> peer,
                                                                 wire::BusConnection::Descriptors descriptors,
                                                                 ConnectionLimit::Place place) {
  wire::BusConnection::Options options;
  options.side = wire::BusConnection::Side::server;
  options.descriptors = descriptors;
  options.peer = "pid " + std::to_string(peer->processIdentifier());
  options.runLater = [executor = &context.executor](Task task) { executor->execute(std::move(task)); };
  auto bus = wire::BusConnection::open(std::move(socket), std::move(options));
  if (!bus) return bus.error();
  return std::shared_ptr<ServedConnection>(
      new ServedConnection(context, std::move(peer), std::move(place), std::move(bus.value())));
}

ServedConnection::ServedConnection(const ServingContext &context, std::shared_ptr<Peer> peer,
                                   ConnectionLimit::Place place, std::shared_ptr<wire::BusConnection> bus)
    : context_(context), peer_(std::move(peer)), place_(std::move(place)), bus_(std::move(bus)) {}

ServedConnection::~ServedConnection() { bus_->releaseSocket(); }

void ServedConnection::start() {
  bus_->setReadyHandler([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->loggedIn_ = true;
  });
  bus_->setClosedHandler([weak = weak_from_this()](const SXError &) {
    if (const auto self = weak.lock()) (void)self->finish();
  });
  bus_->setWantedChangedHandler([weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->follow();
  });
  std::unique_lock lock(mutex_);
  started_ = true;
  // What the peer sent before may have been read already: then an answer waits to be written.
  const auto events = static_cast<std::uint32_t>(bus_->wanted().events) | EPOLLHUP;
  watch_ = context_.loop.watch(bus_->fd(), events, [weak = weak_from_this()](std::uint32_t) {
    if (const auto self = weak.lock()) self->serve();
  });
  const bool isWatched = watch_ != nullptr;
  lock.unlock();
  if (isWatched) return;
  sx_default_log().fault("[ERROR] Could not watch the connection of pid %d.", peer_->processIdentifier());
  end();
}

bool ServedConnection::isStarted() const {
  const std::lock_guard lock(mutex_);
  return started_;
}

void ServedConnection::serve() {
  bus_->process();
  follow();
}

void ServedConnection::follow() {
  const std::lock_guard lock(mutex_);
  if (!watch_) return;
  // Even where nothing is to be read, the peer's end is.
  watch_->setEvents(static_cast<std::uint32_t>(bus_->wanted().events) | EPOLLHUP);
}

void ServedConnection::end() {
  bus_->close();
  if (finish()) return;
  std::unique_lock lock(mutex_);
  isOver_.wait(lock, [this] { return over_; });
}

/// False when somebody else is at it, or was. The closed handler must not wait for that: it may run in
/// the very handler that the other one waits for.
bool ServedConnection::finish() {
  const std::shared_ptr<ServedConnection> self = shared_from_this();
  std::unique_ptr<IoLoop::Watch> watch;
  Ended ended;
  {
    const std::lock_guard lock(mutex_);
    if (std::exchange(finishing_, true)) return false;
    watch = std::move(watch_);
    ended = std::move(ended_);
  }
  watch.reset();
  bus_->releaseSocket();
  if (ended) ended(self);
  const std::lock_guard lock(mutex_);
  over_ = true;
  isOver_.notify_all();
  return true;
}

}  // namespace storix::linuxhost
