#pragma once

#include <systemd/sd-bus.h>

#include <memory>
#include <string>
#include <string_view>

#include "platform/SXError.h"

namespace storix::wire {

/// Owners of sd-bus objects. Their reference counts are not atomic: whoever copies out or destroys one
/// holds the mutex of its connection.
struct BusDeleter {
  void operator()(sd_bus *bus) const { sd_bus_close_unref(bus); }
};
using OwnedBus = std::unique_ptr<sd_bus, BusDeleter>;

struct MessageDeleter {
  void operator()(sd_bus_message *message) const { sd_bus_message_unref(message); }
};
using OwnedMessage = std::unique_ptr<sd_bus_message, MessageDeleter>;

/// A D-Bus error that borrows both texts.
inline sd_bus_error borrowedError(const char *name, const char *message) { return {name, message, 0}; }

/// The error value of a negative sd-bus result.
inline SXError busError(int negativeErrno, std::string_view doing) {
  return posixError(negativeErrno < 0 ? -negativeErrno : negativeErrno, doing);
}

}  // namespace storix::wire
