// What the daemon is compared with: programs that do nothing but what a request cannot do without,
// written on sd-bus alone, and with it the extension that the daemon asks while it is measured.
//
//   storix_bench_bare raw SOCKET             sends back each byte that arrives
//   storix_bench_bare echo SOCKET            answers every method of the daemon, a thread a connection
//   storix_bench_bare relay SOCKET BACKEND   asks the back end once for each request
//   storix_bench_bare broker SOCKET BACKEND  asks the back end twice for each request
//   storix_bench_bare vendor SOCKET          the back end: answers what an extension answers
//   storix_bench_bare                        the same over the socket in STORIX_EXTENSION_FD
//
// SOCKET is made; its directory is not. The broker and the relay serve one connection at a time.

#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <thread>

#include "wire/UniqueFd.h"

namespace {

using storix::UniqueFd;

constexpr const char *daemonPath = "/com/tessel/Storix";
constexpr const char *daemonInterface = "com.tessel.Storix.Daemon";
constexpr const char *vendorPath = "/com/tessel/StorixVendor";
constexpr const char *vendorInterface = "com.tessel.StorixVendor";

[[noreturn]] void fail(const char *what) {
  std::perror(what);
  std::exit(1);
}

int checked(int result, const char *what) {
  if (result >= 0) return result;
  errno = -result;
  fail(what);
}

sockaddr_un addressOf(const char *path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (std::strlen(path) >= sizeof address.sun_path) {
    errno = ENAMETOOLONG;
    fail(path);
  }
  std::strcpy(address.sun_path, path);
  return address;
}

UniqueFd listenOn(const char *path) {
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_un address = addressOf(path);
  if (!fd || ::bind(fd.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0 ||
      ::listen(fd.get(), SOMAXCONN) != 0) {
    fail(path);
  }
  return fd;
}

UniqueFd acceptOn(const UniqueFd &listener) {
  UniqueFd fd(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (!fd) fail("accept");
  return fd;
}

int answerNothing(sd_bus_message *request, void *, sd_bus_error *) { return sd_bus_reply_method_return(request, ""); }

/// The answer of an operation that has succeeded.
int answerNoError(sd_bus_message *request, void *, sd_bus_error *) {
  return sd_bus_reply_method_return(request, "a(sxa{sv})", 0);
}

int readText(sd_bus_message *request, const char **text) {
  int result = sd_bus_message_enter_container(request, 'a', "s");
  if (result >= 0) result = sd_bus_message_read(request, "s", text);
  if (result >= 0) result = sd_bus_message_exit_container(request);
  return result;
}

int answerSetup(sd_bus_message *request, void *, sd_bus_error *) {
  return sd_bus_reply_method_return(request, "asasa(sxa{sv})", 0, 0, 0);
}

/// An item is called as its file is.
int answerIdentifier(sd_bus_message *request, void *, sd_bus_error *) {
  const char *url = nullptr;
  const int result = readText(request, &url);
  if (result < 0) return result;
  const char *slash = std::strrchr(url, '/');
  return sd_bus_reply_method_return(request, "a(sxa{sv})as", 0, 1, slash ? slash + 1 : url);
}

int answerURL(sd_bus_message *request, void *, sd_bus_error *) {
  const char *identifier = nullptr;
  const int result = readText(request, &identifier);
  if (result < 0) return result;
  const char *group = std::getenv("STORIX_GROUP_CONTAINER");
  const std::string url = std::string("file://") + (group ? group : "") + "/Storix%20Storage/" + identifier;
  return sd_bus_reply_method_return(request, "a(sxa{sv})as", 0, 1, url.c_str());
}

int answerPlaceholder(sd_bus_message *request, void *, sd_bus_error *) {
  return sd_bus_reply_method_return(request, "asa(sxa{sv})", 0, 0);
}

/// What the broker and the relay pass a request on to.
struct Backend {
  sd_bus *bus;
  bool asksForIdentifier;
};

int callBackend(sd_bus *bus, const char *member, const char *url) {
  sd_bus_error error{};
  sd_bus_message *reply = nullptr;
  const int result =
      sd_bus_call_method(bus, nullptr, vendorPath, vendorInterface, member, &error, &reply, "as", 1, url);
  sd_bus_message_unref(reply);
  sd_bus_error_free(&error);
  return result;
}

int passOn(sd_bus_message *request, void *userData, sd_bus_error *) {
  const auto *backend = static_cast<const Backend *>(userData);
  const char *url = nullptr;
  int result = readText(request, &url);
  if (result >= 0 && backend->asksForIdentifier) result = callBackend(backend->bus, "IdentifierForItemAtURL", url);
  if (result >= 0) result = callBackend(backend->bus, "StartProvidingItemAtURL", url);
  if (result < 0) return result;
  return sd_bus_reply_method_return(request, "a(sxa{sv})", 0);
}

const sd_bus_vtable echoMethods[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("WakeUp", "", "", answerNothing, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StartProvidingItemAtURL", "asasas", "a(sxa{sv})", answerNoError, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable passingMethods[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("StartProvidingItemAtURL", "asasas", "a(sxa{sv})", passOn, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

const sd_bus_vtable vendorMethods[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("PerformInitialSetup", "", "asasa(sxa{sv})", answerSetup, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("ProvidePlaceholderAtURL", "as", "asa(sxa{sv})", answerPlaceholder, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StartProvidingItemAtURL", "as", "a(sxa{sv})", answerNoError, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("ItemChangedAtURL", "as", "a(sxa{sv})", answerNoError, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("StopProvidingItemAtURL", "as", "a(sxa{sv})", answerNoError, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("IdentifierForItemAtURL", "as", "a(sxa{sv})as", answerIdentifier, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_METHOD("URLForItemIdentifier", "as", "a(sxa{sv})as", answerURL, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

sd_bus *makeBus(UniqueFd socket) {
  sd_bus *bus = nullptr;
  checked(sd_bus_new(&bus), "sd_bus_new");
  const int fd = socket.release();
  checked(sd_bus_set_fd(bus, fd, fd), "sd_bus_set_fd");
  return bus;
}

/// Answers until the peer closes the connection.
void serve(sd_bus *bus) {
  for (;;) {
    const int processed = sd_bus_process(bus, nullptr);
    if (processed < 0) break;
    if (processed == 0 && sd_bus_wait(bus, UINT64_MAX) < 0) break;
  }
  sd_bus_close_unref(bus);
}

void serveAsServer(UniqueFd socket, const char *path, const char *interface, const sd_bus_vtable *methods, void *data) {
  sd_bus *bus = makeBus(std::move(socket));
  sd_id128_t identity{};
  checked(sd_id128_randomize(&identity), "sd_id128_randomize");
  checked(sd_bus_set_server(bus, 1, identity), "sd_bus_set_server");
  checked(sd_bus_add_object_vtable(bus, nullptr, path, interface, methods, data), "sd_bus_add_object_vtable");
  if (sd_bus_start(bus) < 0) {
    sd_bus_unref(bus);
    return;
  }
  serve(bus);
}

int serveRaw(const char *path) {
  const UniqueFd listener = listenOn(path);
  for (;;) {
    const UniqueFd peer = acceptOn(listener);
    char byte = 0;
    while (::read(peer.get(), &byte, 1) == 1 && ::write(peer.get(), &byte, 1) == 1) {
    }
  }
}

int serveEcho(const char *path) {
  const UniqueFd listener = listenOn(path);
  for (;;) {
    std::thread([peer = acceptOn(listener)]() mutable {
      serveAsServer(std::move(peer), daemonPath, daemonInterface, echoMethods, nullptr);
    }).detach();
  }
}

int servePassingOn(const char *path, const char *backendPath, bool asksForIdentifier) {
  const UniqueFd listener = listenOn(path);
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_un address = addressOf(backendPath);
  if (!socket || ::connect(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
    fail(backendPath);
  }
  Backend backend{makeBus(std::move(socket)), asksForIdentifier};
  checked(sd_bus_start(backend.bus), "sd_bus_start");
  for (;;) serveAsServer(acceptOn(listener), daemonPath, daemonInterface, passingMethods, &backend);
}

int serveVendor(const char *path) {
  const UniqueFd listener = listenOn(path);
  for (;;) serveAsServer(acceptOn(listener), vendorPath, vendorInterface, vendorMethods, nullptr);
}

/// The daemon has the server's side of the login here.
int serveExtension(const char *number) {
  sd_bus *bus = makeBus(UniqueFd(std::atoi(number)));
  checked(sd_bus_add_object_vtable(bus, nullptr, vendorPath, vendorInterface, vendorMethods, nullptr),
          "sd_bus_add_object_vtable");
  checked(sd_bus_start(bus), "sd_bus_start");
  serve(bus);
  return 0;
}

}  // namespace

int main(int count, char **arguments) {
  const char *extension = std::getenv("STORIX_EXTENSION_FD");
  if (count == 1 && extension) return serveExtension(extension);
  const std::string_view mode = count > 2 ? arguments[1] : "";
  if (mode == "raw") return serveRaw(arguments[2]);
  if (mode == "echo") return serveEcho(arguments[2]);
  if (mode == "vendor") return serveVendor(arguments[2]);
  if (mode == "relay" && count > 3) return servePassingOn(arguments[2], arguments[3], false);
  if (mode == "broker" && count > 3) return servePassingOn(arguments[2], arguments[3], true);
  (void)std::fprintf(stderr, "usage: %s raw|echo|vendor SOCKET, or relay|broker SOCKET BACKEND\n", arguments[0]);
  return 2;
}
