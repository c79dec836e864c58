#include "sdk/src/RequestThread.h"

namespace storix::sdk {

std::shared_ptr<RequestThread> RequestThread::start() {
  auto thread = std::make_shared<RequestThread>();
  thread->thread_ = std::thread([thread] { thread->run(); });
  return thread;
}

void RequestThread::run() {
  loop_.run();
  {
    const std::lock_guard lock(mutex_);
    ended_ = true;
  }
  // Whatever was posted between the two.
  loop_.run();
}

void RequestThread::end() {
  loop_.stop();
  if (isCurrent()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

bool RequestThread::post(Task task) {
  const std::lock_guard lock(mutex_);
  if (ended_) return false;
  loop_.later(std::move(task));
  return true;
}

}  // namespace storix::sdk
