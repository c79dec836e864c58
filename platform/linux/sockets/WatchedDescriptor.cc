#include "platform/linux/sockets/WatchedDescriptor.h"

#include <sys/epoll.h>

namespace storix::linuxhost {

Epoll::Epoll() : fd_(epoll_create1(EPOLL_CLOEXEC)) {}

bool Epoll::arm(WatchedDescriptor &descriptor) const {
  if (descriptor.events == 0) {
    disarm(descriptor);
    return true;
  }
  epoll_event event{};
  event.events = descriptor.events | EPOLLONESHOT;
  event.data.u64 = descriptor.identifier;
  const int operation = descriptor.registered ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
  if (epoll_ctl(fd_.get(), operation, descriptor.fd, &event) != 0) return false;
  descriptor.registered = true;
  return true;
}

void Epoll::disarm(WatchedDescriptor &descriptor) const {
  if (!descriptor.registered) return;
  epoll_ctl(fd_.get(), EPOLL_CTL_DEL, descriptor.fd, nullptr);
  descriptor.registered = false;
}

}  // namespace storix::linuxhost
