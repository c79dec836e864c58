#include "examples/webdav-provider/FaultProxy.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <chrono>

namespace storix::example {

namespace {

sockaddr_in loopback(std::uint16_t port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return address;
}

bool sendAll(int socket, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (count <= 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return true;
}

std::string methodOf(std::string_view bytes) {
  for (const std::string method : {"GET", "PUT", "PROPFIND", "MKCOL"}) {
    if (bytes.starts_with(method + " /")) return method;
  }
  return {};
}

}  // namespace

FaultProxy::FaultProxy(std::uint16_t serverPort) : serverPort_(serverPort) { listen(); }

FaultProxy::~FaultProxy() { end(); }

void FaultProxy::next(Fault fault) {
  const std::lock_guard lock(mutex_);
  faults_.push_back(std::move(fault));
}

std::string FaultProxy::answerWithStatus(int status) {
  return "HTTP/1.1 " + std::to_string(status) + " Injected\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
}

void FaultProxy::setGone(bool gone) {
  if (gone) {
    end();
  } else {
    listen();
  }
}

std::vector<std::string> FaultProxy::requests(const std::string &method) const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> found;
  std::copy_if(heads_.begin(), heads_.end(), std::back_inserter(found),
               [&method](const std::string &head) { return methodOf(head) == method; });
  return found;
}

void FaultProxy::waitForRequests(const std::string &method, std::size_t count) const {
  std::unique_lock lock(mutex_);
  const bool came = requested_.wait_for(lock, std::chrono::seconds(60), [&] {
    return static_cast<std::size_t>(std::count_if(heads_.begin(), heads_.end(), [&method](const std::string &head) {
             return methodOf(head) == method;
           })) >= count;
  });
  EXPECT_TRUE(came) << "no " << count << " requests " << method;
}

void FaultProxy::listen() {
  stop_ = UniqueFd(::eventfd(0, EFD_CLOEXEC));
  listening_ = UniqueFd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const int yes = 1;
  ::setsockopt(listening_.get(), SOL_SOCKET, SO_REUSEADDR, &yes, sizeof yes);
  sockaddr_in address = loopback(port_);
  ASSERT_EQ(::bind(listening_.get(), reinterpret_cast<sockaddr *>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(listening_.get(), 64), 0);
  socklen_t size = sizeof address;
  ::getsockname(listening_.get(), reinterpret_cast<sockaddr *>(&address), &size);
  port_ = ntohs(address.sin_port);
  accepting_ = std::thread([this] { accept(); });
}

void FaultProxy::end() {
  if (stop_) ::eventfd_write(stop_.get(), 1);
  if (accepting_.joinable()) accepting_.join();
  for (Connection &connection : connections_) connection.thread.join();
  connections_.clear();
  listening_.reset();
  stop_.reset();
}

void FaultProxy::accept() {
  for (;;) {
    std::array<pollfd, 2> waiting{pollfd{listening_.get(), POLLIN, 0}, pollfd{stop_.get(), POLLIN, 0}};
    ::poll(waiting.data(), waiting.size(), -1);
    if (waiting[1].revents != 0) return;
    UniqueFd client(::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    UniqueFd server(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_in address = loopback(serverPort_);
    if (::connect(server.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) continue;
    // Only this thread and, after it has ended, `end` touch the list.
    Connection &connection = connections_.emplace_back();
    connection.client = std::move(client);
    connection.server = std::move(server);
    connection.thread = std::thread([this, &connection] { serve(connection); });
  }
}

void FaultProxy::serve(Connection &connection) {
  std::optional<Fault> active;
  std::size_t passed = 0;
  for (;;) {
    const bool stalled = active && active->stallAfter && passed >= *active->stallAfter;
    std::array<pollfd, 3> waiting{pollfd{connection.client.get(), POLLIN, 0},
                                  pollfd{stalled ? -1 : connection.server.get(), POLLIN, 0},
                                  pollfd{stop_.get(), POLLIN, 0}};
    ::poll(waiting.data(), waiting.size(), -1);
    if (waiting[2].revents != 0) break;
    if (waiting[0].revents != 0) {
      const bool hadFault = active.has_value();
      if (!passRequest(connection, active)) break;
      if (!hadFault && active) passed = 0;
    }
    if (waiting[1].revents != 0 && !passAnswer(connection, active, passed)) break;
  }
  ::shutdown(connection.client.get(), SHUT_RDWR);
  ::shutdown(connection.server.get(), SHUT_RDWR);
}

bool FaultProxy::passRequest(Connection &connection, std::optional<Fault> &active) {
  std::array<char, 65536> buffer;
  const ssize_t count = ::recv(connection.client.get(), buffer.data(), buffer.size(), 0);
  if (count <= 0) return false;
  const std::string_view bytes(buffer.data(), static_cast<std::size_t>(count));
  if (const std::string method = methodOf(bytes); !method.empty()) {
    active = take(method);
    if (active && active->before) active->before();
    {
      const std::lock_guard lock(mutex_);
      heads_.emplace_back(bytes.substr(0, bytes.find("\r\n\r\n")));
    }
    requested_.notify_all();
    if (active && active->answer) {
      sendAll(connection.client.get(), *active->answer);
      return false;
    }
    if (active && !active->cutAfter && !active->stallAfter) active.reset();
  }
  return sendAll(connection.server.get(), bytes);
}

bool FaultProxy::passAnswer(Connection &connection, std::optional<Fault> &active, std::size_t &passed) {
  std::array<char, 65536> buffer;
  const ssize_t count = ::recv(connection.server.get(), buffer.data(), buffer.size(), 0);
  if (count <= 0) return false;
  std::string_view bytes(buffer.data(), static_cast<std::size_t>(count));
  if (active) {
    const std::size_t limit = active->cutAfter ? *active->cutAfter : *active->stallAfter;
    bytes = bytes.substr(0, limit - std::min(limit, passed));
    passed += bytes.size();
    if (!sendAll(connection.client.get(), bytes)) return false;
    return !active->cutAfter || passed < limit;
  }
  return sendAll(connection.client.get(), bytes);
}

std::optional<FaultProxy::Fault> FaultProxy::take(const std::string &method) {
  const std::lock_guard lock(mutex_);
  const auto found =
      std::find_if(faults_.begin(), faults_.end(), [&method](const Fault &fault) { return fault.method == method; });
  if (found == faults_.end()) return std::nullopt;
  Fault fault = std::move(*found);
  faults_.erase(found);
  return fault;
}

}  // namespace storix::example
