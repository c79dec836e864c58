// A provider that does what it must until it is asked to start providing an item, and then one of many
// things that it must not. Which one the file "script" in its bundle says, in one word and perhaps a number.

#include <sys/prctl.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <string>
#include <vector>

#include "wire/SendBytes.h"

namespace {

constexpr const char *forgedText = "text\n[FORGED] line\r[FORGED] return\x1b[31m %s %n %@ \u2028[FORGED]\u0085";

/// Says in the log that it has come so far, and does nothing more.
void pauseForEver(const char *line) {
  std::puts(line);
  std::fflush(stdout);
  ::pause();
}

/// Writes all of it, whoever reads.
void writeAll(int fd, const char *bytes, std::size_t size) {
  while (size > 0) {
    const ssize_t count = ::send(fd, bytes, size, MSG_NOSIGNAL);
    if (count <= 0) return;
    bytes += count;
    size -= static_cast<std::size_t>(count);
  }
}

/// The beginning of a reply, whose body is that long.
std::string replyHeader(std::uint32_t replyTo, std::uint32_t bodyLength) {
  std::string header{'l', 2, 1, 1};
  const auto number = [&header](std::uint32_t value) {
    for (int shift = 0; shift < 32; shift += 8) header += static_cast<char>(value >> shift);
  };
  number(bodyLength);
  number(99);
  number(24);
  header += {5, 1, 'u', 0};
  number(replyTo);
  header += {8, 1, 'g', 0, 10};
  header += "a(sxa{sv})";
  header += '\0';
  return header;
}

class Provider {
 public:
  Provider(sd_bus *bus, int fd, std::string script, int number)
      : bus_(bus), fd_(fd), script_(std::move(script)), number_(number) {}

  void answer(sd_bus_message *call) {
    const std::string member = sd_bus_message_get_member(call) ? sd_bus_message_get_member(call) : "";
    if (member == "PerformInitialSetup") {
      sd_bus_reply_method_return(call, "asasa(sxa{sv})", 0, 0, 0);
    } else if (member == "IdentifierForItemAtURL") {
      identify(call);
    } else if (member == "URLForItemIdentifier") {
      sd_bus_reply_method_return(call, "a(sxa{sv})as", 0, 1, "file:///etc/passwd");
    } else if (member == "ProvidePlaceholderAtURL") {
      sd_bus_reply_method_return(call, "asa(sxa{sv})", 0, 0);
    } else if (member == "StartProvidingItemAtURL") {
      misbehave(call);
    } else {
      sd_bus_reply_method_return(call, "a(sxa{sv})", 0);
    }
  }

 private:
  static void identify(sd_bus_message *call) {
    const char *url = nullptr;
    if (sd_bus_message_enter_container(call, 'a', "s") < 0 || sd_bus_message_read(call, "s", &url) <= 0) return;
    const char *slash = std::strrchr(url, '/');
    sd_bus_reply_method_return(call, "a(sxa{sv})as", 0, 1, slash ? slash + 1 : url);
  }

  void misbehave(sd_bus_message *call) {
    const std::map<std::string, std::function<void()>> misdeeds = {
        {"never", [] {}},
        {"deaf", [] { pauseForEver("deaf"); }},
        {"signature", [&] { sd_bus_reply_method_return(call, "ub", 4711U, 1); }},
        {"two-errors", [&] { twoErrors(call); }},
        {"twice", [&] { twice(call); }},
        {"bus-error", [&] { busError(call); }},
        {"megabytes", [&] { megabytes(call); }},
        {"half", [&] { half(call); }},
        {"exit", [] { ::_exit(3); }},
        {"crash", [] { ::raise(SIGKILL); }},
        {"fork", [] { forkAndLeave(); }},
        {"close",
         [&] {
           ::shutdown(fd_, SHUT_RDWR);
           ::pause();
         }},
        {"junk", [&] { writeAll(fd_, std::string(4096, '\xff').data(), 4096); }},
        {"deep", [&] { deep(call); }},
        {"wide", [&] { wide(call); }},
        {"key-twice", [&] { keyTwice(call); }},
        {"forge", [&] { forge(call); }},
        {"output", [&] { output(call); }},
        {"calls", [&] { callDaemon(call); }},
        {"strays", [&] { strays(call); }},
        {"descriptors", [&] { descriptors(call); }},
        {"bad-url", [&] { badURL(call); }},
    };
    const auto found = misdeeds.find(script_);
    if (found != misdeeds.end()) found->second();
  }

  static void good(sd_bus_message *call) { sd_bus_reply_method_return(call, "a(sxa{sv})", 0); }

  static void twoErrors(sd_bus_message *call) {
    sd_bus_reply_method_return(call, "a(sxa{sv})", 2, "a", INT64_C(1), 0, "b", INT64_C(2), 0);
  }

  static void twice(sd_bus_message *call) {
    good(call);
    good(call);
    good(call);
  }

  static void busError(sd_bus_message *call) {
    sd_bus_error error{"org.sample.Error", forgedText, 0};
    sd_bus_reply_method_error(call, &error);
  }

  void megabytes(sd_bus_message *call) const {
    std::uint64_t cookie = 0;
    sd_bus_message_get_cookie(call, &cookie);
    const std::string header = replyHeader(static_cast<std::uint32_t>(cookie), 100U << 20U);
    writeAll(fd_, header.data(), header.size());
    const std::string megabyte(std::size_t{1} << 20, '\0');
    for (int i = 0; i < 100; ++i) writeAll(fd_, megabyte.data(), megabyte.size());
  }

  void half(sd_bus_message *call) const {
    std::uint64_t cookie = 0;
    sd_bus_message_get_cookie(call, &cookie);
    const std::string header = replyHeader(static_cast<std::uint32_t>(cookie), 64);
    writeAll(fd_, header.data(), header.size());
    ::_exit(0);
  }

  /// The children keep the connection and the output open; they end by themselves after a while, should
  /// nobody end them.
  static void forkAndLeave() {
    for (int i = 0; i < 8; ++i) {
      if (::fork() == 0) {
        ::signal(SIGTERM, SIG_IGN);
        ::alarm(90);
        for (;;) ::pause();
      }
    }
    ::_exit(0);
  }

  static sd_bus_message *openError(sd_bus_message *call, const char *domain) {
    sd_bus_message *reply = nullptr;
    sd_bus_message_new_method_return(call, &reply);
    sd_bus_message_open_container(reply, 'a', "(sxa{sv})");
    sd_bus_message_open_container(reply, 'r', "sxa{sv}");
    sd_bus_message_append(reply, "sx", domain, INT64_C(1));
    sd_bus_message_open_container(reply, 'a', "{sv}");
    return reply;
  }
  void closeError(sd_bus_message *reply) const {
    sd_bus_message_close_container(reply);
    sd_bus_message_close_container(reply);
    sd_bus_message_close_container(reply);
    sd_bus_send(bus_, reply, nullptr);
    sd_bus_message_unref(reply);
  }

  /// An error with so many lists inside each other, in the innermost of which stands a value.
  void deep(sd_bus_message *call) const {
    sd_bus_message *reply = openError(call, "org.sample.deep");
    sd_bus_message_open_container(reply, 'e', "sv");
    sd_bus_message_append(reply, "s", "key");
    sd_bus_message_open_container(reply, 'v', "av");
    for (int i = 0; i < number_; ++i) {
      sd_bus_message_open_container(reply, 'a', "v");
      sd_bus_message_open_container(reply, 'v', i + 1 < number_ ? "av" : "b");
    }
    sd_bus_message_append(reply, "b", 1);
    for (int i = 0; i < number_; ++i) {
      sd_bus_message_close_container(reply);
      sd_bus_message_close_container(reply);
    }
    sd_bus_message_close_container(reply);
    sd_bus_message_close_container(reply);
    closeError(reply);
  }

  void wide(sd_bus_message *call) const {
    sd_bus_message *reply = openError(call, "org.sample.wide");
    for (int i = 0; i < 30000; ++i) {
      sd_bus_message_append(reply, "{sv}", ("key" + std::to_string(i)).c_str(), "b", 1);
    }
    closeError(reply);
  }

  void keyTwice(sd_bus_message *call) const {
    sd_bus_message *reply = openError(call, "org.sample.twice");
    for (int i = 0; i < 2; ++i) sd_bus_message_append(reply, "{sv}", "key", "b", 1);
    closeError(reply);
  }

  void badURL(sd_bus_message *call) const {
    sd_bus_message *reply = openError(call, "org.sample.url");
    sd_bus_message_append(reply, "{sv}", "URL", "(s)", "file://host/a%00");
    closeError(reply);
  }

  void forge(sd_bus_message *call) const {
    for (std::FILE *stream : {stdout, stderr}) {
      std::fprintf(stream, "%s\n", forgedText);
      std::fflush(stream);
    }
    sd_bus_message *reply = openError(call, forgedText);
    sd_bus_message_append(reply, "{sv}", "description", "s", forgedText);
    sd_bus_message_append(reply, "{sv}", forgedText, "s", forgedText);
    closeError(reply);
  }

  static void output(sd_bus_message *call) {
    const std::string longLine(std::size_t{1} << 20, 'x');
    std::fwrite(longLine.data(), 1, longLine.size(), stdout);
    for (int i = 0; i < 20000; ++i) std::fputs("\nline of a flood", stdout);
    std::fputc('\n', stdout);
    std::fflush(stdout);
    good(call);
  }

  /// Calls of the daemon, whose answers it never reads, for as long as anybody takes them.
  void callDaemon(sd_bus_message *call) const {
    good(call);
    sd_bus_flush(bus_);
    std::string bytes;
    for (char serial = 1; serial < 100; ++serial) {
      // A call of "X" on "/", of no interface.
      bytes += std::string{'l', 1, 0, 1, 0, 0, 0, 0, serial, 0, 0, 0, 26, 0, 0, 0};
      bytes += std::string{1, 1, 'o', 0, 1, 0, 0, 0, '/', 0, 0, 0, 0, 0, 0, 0};
      bytes += std::string{3, 1, 's', 0, 1, 0, 0, 0, 'X', 0, 0, 0, 0, 0, 0, 0};
    }
    for (;;) {
      if (::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0) ::_exit(0);
    }
  }

  void strays(sd_bus_message *call) const {
    sd_bus_emit_signal(bus_, "/com/tessel/StorixVendor", "com.tessel.StorixVendor", "Signal", "s", "x");
    for (std::uint32_t serial = 1000; serial < 1100; ++serial) {
      const std::string reply = replyHeader(serial, 0);
      sd_bus_flush(bus_);
      writeAll(fd_, reply.data(), reply.size());
    }
    good(call);
  }

  void descriptors(sd_bus_message *call) const {
    std::uint64_t cookie = 0;
    sd_bus_message_get_cookie(call, &cookie);
    const std::string bytes = replyHeader(static_cast<std::uint32_t>(cookie), 4) + std::string(4, '\0');
    (void)storix::wire::sendBytes(fd_, bytes, std::vector<int>(200, fd_));
  }

  sd_bus *const bus_;
  const int fd_;
  const std::string script_;
  const int number_;
};

int answerCall(sd_bus_message *message, void *provider, sd_bus_error * /*error*/) {
  if (sd_bus_message_is_method_call(message, nullptr, nullptr) <= 0) return 0;
  static_cast<Provider *>(provider)->answer(message);
  return 1;
}

}  // namespace

int main() {
  const char *number = std::getenv("STORIX_EXTENSION_FD");
  if (!number) return 1;
  const int fd = std::atoi(number);
  const char *bundle = std::getenv("STORIX_BUNDLE_PATH");
  std::ifstream script(std::string(bundle ? bundle : ".") + "/script");
  std::string word;
  int count = 0;
  script >> word >> count;
  if (word == "no-login") return 4;
  if (word == "endless-login") pauseForEver("no login");
  sd_bus *bus = nullptr;
  if (sd_bus_new(&bus) < 0 || sd_bus_set_fd(bus, fd, fd) < 0 || sd_bus_start(bus) < 0) return 1;
  Provider provider(bus, fd, word, count);
  if (sd_bus_add_filter(bus, nullptr, answerCall, &provider) < 0) return 1;
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) break;
    if (processed == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) break;
  }
  sd_bus_unref(bus);
  return 0;
}
