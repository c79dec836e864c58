// A provider extension for tests, on sd-bus alone. What it does at its start is told by the name under
// which it was started, what it does with a request by the last component of the item's URL.

#include <dirent.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
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

/// "done", or why not.
std::string outcome(bool done) { return done ? "done" : std::strerror(errno); }

std::string connected(int family, const sockaddr *address, socklen_t length) {
  const int socket = ::socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const std::string text = outcome(::connect(socket, address, length) == 0);
  ::close(socket);
  return text;
}

std::string opened(const std::string &path, int flags) {
  const int fd = ::open(path.c_str(), flags | O_CLOEXEC, 0600);
  const std::string text = outcome(fd >= 0);
  ::close(fd);
  return text;
}

std::string namesIn(const std::string &path) {
  DIR *directory = ::opendir(path.c_str());
  if (!directory) return std::strerror(errno);
  std::vector<std::string> names;
  while (const dirent *entry = ::readdir(directory)) {
    if (entry->d_name[0] != '.') names.emplace_back(entry->d_name);
  }
  ::closedir(directory);
  return joined(std::move(names));
}

std::string linksIn(const std::string &path, const std::string &names) {
  std::string text;
  for (std::size_t start = 0; start < names.size();) {
    const std::size_t end = names.find('\n', start);
    char target[4096];
    const ssize_t size = ::readlink((path + "/" + names.substr(start, end - start)).c_str(), target, sizeof(target));
    text += std::string(target, size < 0 ? 0 : static_cast<std::size_t>(size)) + "\n";
    start = end + 1;
  }
  return text;
}

/// The lines of /proc/self/status that bear on what the process may do.
std::string privilegesText() {
  std::vector<std::string> lines;
  FILE *status = std::fopen("/proc/self/status", "re");
  char line[4096];
  while (std::fgets(line, sizeof(line), status)) {
    if (std::strncmp(line, "Cap", 3) == 0 || std::strncmp(line, "NoNewPrivs", 10) == 0) {
      lines.emplace_back(line, std::strcspn(line, "\n"));
    }
  }
  std::fclose(status);
  return joined(std::move(lines));
}

/// Tries something on a path, or a port of the loopback address, and says what came of it.
std::string tried(const std::string &verb, const std::string &path) {
  if (verb == "read") return opened(path, O_RDONLY);
  if (verb == "write") return opened(path, O_WRONLY | O_CREAT);
  if (verb == "list") return namesIn(path);
  if (verb == "link") return outcome(::symlink("/etc", path.c_str()) == 0);
  if (verb == "connect") {
    sockaddr_un address{AF_UNIX, {}};
    path.copy(address.sun_path, sizeof(address.sun_path) - 1);
    return connected(AF_UNIX, reinterpret_cast<const sockaddr *>(&address), sizeof(address));
  }
  if (verb == "dial") {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<std::uint16_t>(std::atoi(path.c_str() + 1)));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return connected(AF_INET, reinterpret_cast<const sockaddr *>(&address), sizeof(address));
  }
  return "unknown";
}

/// The number of a new process that traces this one, and so keeps it from being reaped, until it is
/// killed; or why there is none.
std::string tracerText() {
  const pid_t traced = ::getpid();
  int ready[2];
  if (::pipe2(ready, O_CLOEXEC) != 0) return std::strerror(errno);
  ::prctl(PR_SET_PTRACER, PR_SET_PTRACER_ANY);  // where a process may trace only what it has started
  const pid_t tracer = ::fork();
  if (tracer == 0) {
    ::alarm(60);  // should the test end before it has killed this process
    const int failure = ::ptrace(PTRACE_SEIZE, traced, nullptr, nullptr) == 0 ? 0 : errno;
    static_cast<void>(!::write(ready[1], &failure, sizeof(failure)));
    if (failure != 0) ::_exit(1);
    for (int fd = 0; fd < 100; ++fd) ::close(fd);
    for (;;) {
      // A signal for the traced one stops it here, and goes on to it. Its end is left unheard.
      siginfo_t stopped{};
      if (::waitid(P_PID, static_cast<id_t>(traced), &stopped, WSTOPPED | WEXITED | WNOWAIT) != 0) continue;
      if (stopped.si_code != CLD_TRAPPED && stopped.si_code != CLD_STOPPED) break;
      ::ptrace(PTRACE_CONT, traced, nullptr, stopped.si_status);
    }
    for (;;) ::pause();
  }
  int failure = EIO;
  static_cast<void>(!::read(ready[0], &failure, sizeof(failure)));
  ::close(ready[0]);
  ::close(ready[1]);
  return failure == 0 ? std::to_string(tracer) : std::strerror(failure);
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
  // A path's slashes are written as "=".
  if (const std::size_t verbEnd = what.find('='); verbEnd != std::string_view::npos) {
    std::string path(what.substr(verbEnd));
    std::replace(path.begin(), path.end(), '=', '/');
    return replyWith(message, tried(std::string(what.substr(0, verbEnd)), path));
  }
  if (what == "privileges") return replyWith(message, privilegesText());
  if (what == "namespaces") return replyWith(message, linksIn("/proc/self/ns", namesIn("/proc/self/ns")));
  if (what == "leave-a-child") {
    // It holds on to nothing but its life.
    if (::fork() == 0) {
      for (int fd = 0; fd < 100; ++fd) ::close(fd);
      for (;;) ::pause();
    }
    return replyWith(message, "left");
  }
  if (what == "be-traced") return replyWith(message, tracerText());
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
  if (behaviour == "cleans-up") {
    ::signal(SIGTERM, [](int) {
      static_cast<void>(!::write(STDERR_FILENO, "cleaned up\n", 11));
      ::_exit(0);
    });
  }
  if (behaviour == "ignores-termination") ::signal(SIGTERM, SIG_IGN);
  ::signal(SIGUSR1, [](int) { ::_exit(0); });
  serve(socket);
  if (behaviour == "stays" || behaviour == "cleans-up" || behaviour == "ignores-termination") waitForSignal();
  return 0;
}
