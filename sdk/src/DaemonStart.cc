#include "sdk/src/DaemonStart.h"

#include <cstdlib>
#include <utility>

#include "sdk/src/ServiceSocket.h"
#include "service/SXDaemon.h"

namespace storix::sdk {

DaemonStart::DaemonStart(BusLoop &loop, std::optional<std::string> runtimeDirectory)
    : loop_(loop),
      runtimeDirectory_(std::move(runtimeDirectory)),
      isExtension_(std::getenv("STORIX_EXTENSION_FD") != nullptr),
      state_(isExtension_ ? State::over : State::unknown) {}

void DaemonStart::then(Task task) {
  if (state_ == State::over) return task();
  waiting_.push_back(std::move(task));
  if (state_ == State::unknown) ask();
}

void DaemonStart::forget() {
  if (state_ == State::over && !isExtension_) state_ = State::unknown;
}

void DaemonStart::ask() {
  state_ = State::asked;
  auto connected = connectTo(loop_, runtimeDirectory_, "com.tessel.Storix", BusLoop::Descriptors::refused);
  if (!connected) return finish();
  connection_ = connected.value();
  const auto finished = [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->finish();
  };
  SXDaemonProxy(connection_->remoteObject(LinkInterface(SXDaemonProtocol().description()), [finished](const SXError &) {
    finished();
  })).wakeUp(finished);
}

void DaemonStart::finish() {
  if (state_ != State::asked) return;
  state_ = State::over;
  if (const auto connection = std::exchange(connection_, nullptr)) connection->close();
  for (const Task &task : std::exchange(waiting_, {})) task();
}

}  // namespace storix::sdk
