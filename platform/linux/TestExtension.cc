// A provider extension for tests, on sd-bus alone. What it does at its start is told by the name under
// which it was started, what it does with a request by the last component of the item's URL.

#include <dirent.h>
#include <sys/prctl.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

namespace {

std::string joined(std::vector<std::string> list) {
  std::sort(list.begin(), list.end());
  std::string text;
  for (const std::string &entry : list) text += entry + "\n";
  return text;
}

std::string environmentText() {
  std::vector<std::string> variables;
  for (char **variable = environ; *variable; ++variable) variables.emplace_back(*variable);
  return joined(std::move(variables));
}

std::string descriptorsText() {
  std::vector<std::string> descriptors;
  DIR *directory = ::opendir("/proc/self/fd");
  while (const dirent *entry = ::readdir(directory)) {
    const std::string name(entry->d_name);
    if (name.starts_with('.') || std::stoi(name) == ::dirfd(directory)) continue;
    char target[4096];
    const ssize_t size = ::readlink(("/proc/self/fd/" + name).c_str(), target, sizeof(target));
    const std::string_view text(target, size < 0 ? 0 : static_cast<std::size_t>(size));
    descriptors.push_back(name + " " + std::string(text.substr(0, text.find(':'))));
  }
  ::closedir(directory);
  return joined(std::move(descriptors));
}

std::string signalsText() {
  sigset_t blocked;
  ::sigprocmask(SIG_SETMASK, nullptr, &blocked);
  for (int number = 1; number < SIGRTMIN; ++number) {
    struct sigaction action {};
    if (::sigismember(&blocked, number) == 1) return "blocked " + std::to_string(number);
    if (::sigaction(number, nullptr, &action) == 0 && action.sa_handler == SIG_IGN) {
      return "ignored " + std::to_string(number);
    }
  }
  int parentDeath = 0;
  ::prctl(PR_GET_PDEATHSIG, &parentDeath);
  return "parent death " + std::to_string(parentDeath);
}

std::string directoryText() {
  char path[4096];
  return ::getcwd(path, sizeof(path)) ? path : "none";
}

int replyWith(sd_bus_message *message, const std::string &text) {
  return sd_bus_reply_method_return(message, "a(sxa{sv})as", 0, 1, text.c_str());
}

int identifierForItem(sd_bus_message *message, void *, sd_bus_error *) {
  const char *url = nullptr;
  if (sd_bus_message_enter_container(message, 'a', "s") < 0 || sd_bus_message_read(message, "s", &url) <= 0)
    return -EINVAL;
  const std::string_view what = std::strrchr(url, '/') + 1;
  if (what == "pid") return replyWith(message, std::to_string(::getpid()));
  if (what == "environment") return replyWith(message, environmentText());
  if (what == "descriptors") return replyWith(message, descriptorsText());
  if (what == "directory") return replyWith(message, directoryText());
  if (what == "signals") return replyWith(message, signalsText());
  if (what == "crash") ::raise(SIGKILL);
  if (what == "exit") ::_exit(3);
  if (what == "leave") ::_exit(0);
  if (what == "silence") return 1;
  if (what == "bus-error") return sd_bus_reply_method_errorf(message, "org.sample.Error", "no such luck");
  if (what == "wrong-signature") return sd_bus_reply_method_return(message, "s", "what?");
  if (what == "close") {
    sd_bus_close(sd_bus_message_get_bus(message));
    for (;;) ::pause();
  }
  if (what == "answer-and-exit") {
    replyWith(message, "the last words");
    sd_bus_flush(sd_bus_message_get_bus(message));
    ::_exit(0);
  }
  if (what == "print") {
    std::string text = "out one\nout two\n" + std::string(5000, 'x') + "\nforged\x1b[2J\x01line\nno end";
    static_cast<void>(!::write(STDOUT_FILENO, text.data(), text.size()));
    static_cast<void>(!::write(STDERR_FILENO, "\nerr\n", 5));
    return replyWith(message, "printed");
  }
  return replyWith(message, std::string(what));
}

const sd_bus_vtable vtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("IdentifierForItemAtURL", "as", "a(sxa{sv})as", identifierForItem, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

[[noreturn]] void waitForSignal() {
  for (;;) ::pause();
}

void serve(int socket) {
  sd_bus *bus = nullptr;
  if (sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, socket, socket) < 0 || sd_bus_start(bus) < 0) ::_exit(100);
  if (sd_bus_add_object_vtable(bus, nullptr, "/com/tessel/StorixVendor", "com.tessel.StorixVendor", vtable, nullptr) <
      0) {
    ::_exit(101);
  }
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) break;
    if (processed == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) break;
  }
  sd_bus_close_unref(bus);
}

}  // namespace

int main(int, char **arguments) {
  const std::string path(arguments[0]);
  const std::string behaviour = path.substr(path.rfind('/') + 1);
  const char *number = std::getenv("STORIX_EXTENSION_FD");
  if (!number) return 99;
  const int socket = std::atoi(number);
  if (behaviour == "exits-at-once") return 7;
  if (behaviour == "dies-at-once") ::raise(SIGKILL);
  if (behaviour == "never-logs-in") waitForSignal();
  if (behaviour == "sends-nonsense") {
    static_cast<void>(!::write(socket, "nonsense\r\n", 10));
    waitForSignal();
  }
  if (behaviour == "closes-at-once") {
    ::close(socket);
    waitForSignal();
  }
  if (behaviour == "ignores-termination") ::signal(SIGTERM, SIG_IGN);
  ::signal(SIGUSR1, [](int) { ::_exit(0); });
  serve(socket);
  if (behaviour == "stays" || behaviour == "ignores-termination") waitForSignal();
  return 0;
}
