// A provider that logs in like any other and answers every call with something that nobody asked for.

#include <systemd/sd-bus.h>

#include <cstdlib>

namespace {

int answerNonsense(sd_bus_message *message, void * /*userdata*/, sd_bus_error * /*error*/) {
  if (sd_bus_message_is_method_call(message, nullptr, nullptr) <= 0) return 0;
  return sd_bus_reply_method_return(message, "ub", 4711U, 1);
}

}  // namespace

int main() {
  const char *number = std::getenv("STORIX_EXTENSION_FD");
  if (!number) return 1;
  const int fd = std::atoi(number);
  sd_bus *bus = nullptr;
  if (sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, fd, fd) < 0 || sd_bus_start(bus) < 0) return 1;
  if (sd_bus_add_filter(bus, nullptr, answerNonsense, nullptr) < 0) return 1;
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) break;
    if (processed == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) break;
  }
  sd_bus_unref(bus);
  return 0;
}
