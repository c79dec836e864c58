#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <utility>

#include "platform/ThreadPool.h"
#include "wire/BusConnection.h"
#include "wire/SdBus.h"
#include "wire/UniqueFd.h"

namespace storix::wire {

/// Far more than anything takes; a test that waits so long has failed.
inline constexpr std::chrono::seconds generousDeadline{60};

inline std::pair<UniqueFd, UniqueFd> makeSocketPair() {
  std::array<int, 2> ends{-1, -1};
  EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()), 0);
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

/// Something that another thread gives once, or several times, and a test waits for.
template <class T>
class Received {
 public:
  void put(T value) {
    const std::lock_guard lock(mutex_);
    values_.push_back(std::move(value));
    changed_.notify_all();
  }
  /// The next one that was given; none after the deadline.
  std::optional<T> take() {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, generousDeadline, [this] { return !values_.empty(); })) {
      ADD_FAILURE() << "nothing came";
      return std::nullopt;
    }
    T value = std::move(values_.front());
    values_.erase(values_.begin());
    return value;
  }
  std::size_t count() {
    const std::lock_guard lock(mutex_);
    return values_.size();
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<T> values_;
};

/// Drives one connection on a thread of its own, from `start` to the end of the connection.
class TestConnection {
 public:
  TestConnection(ThreadPool &pool, UniqueFd socket, BusConnection::Options options)
      : wake_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    options.runLater = [&pool](Task task) { pool.execute(std::move(task)); };
    auto opened = BusConnection::open(std::move(socket), std::move(options));
    if (!opened) {
      ADD_FAILURE() << opened.error().message();
      return;
    }
    connection_ = opened.value();
    connection_->setWantedChangedHandler([this] { eventfd_write(wake_.get(), 1); });
  }
  ~TestConnection() {
    connection_->close();
    eventfd_write(wake_.get(), 1);
    if (thread_.joinable()) thread_.join();
  }
  TestConnection(const TestConnection &) = delete;
  TestConnection &operator=(const TestConnection &) = delete;

  BusConnection *operator->() const { return connection_.get(); }
  void start() {
    thread_ = std::thread([this] { run(); });
  }
  /// Waits for the end of the connection.
  void join() { thread_.join(); }

 private:
  void run() {
    while (connection_->isOpen()) {
      const BusConnection::Wanted wanted = connection_->wanted();
      std::array<pollfd, 2> waited{{{connection_->fd(), wanted.events, 0}, {wake_.get(), POLLIN, 0}}};
      int timeout = -1;
      if (wanted.deadline) {
        const auto left =
            std::chrono::ceil<std::chrono::milliseconds>(*wanted.deadline - std::chrono::steady_clock::now());
        timeout = static_cast<int>(std::max<std::int64_t>(left.count(), 0));
      }
      poll(waited.data(), waited.size(), timeout);
      eventfd_t value = 0;
      eventfd_read(wake_.get(), &value);
      connection_->process();
    }
    connection_->releaseSocket();
  }

  UniqueFd wake_;
  std::shared_ptr<BusConnection> connection_;
  std::thread thread_;
};

/// A plain sd-bus client at one end of a socket pair, which waits for its answers.
class PlainClient {
 public:
  explicit PlainClient(UniqueFd socket, bool descriptors = true) {
    sd_bus *raw = nullptr;
    EXPECT_GE(sd_bus_new(&raw), 0);
    bus_.reset(raw);
    const int fd = socket.release();
    EXPECT_GE(sd_bus_set_fd(raw, fd, fd), 0);
    EXPECT_GE(sd_bus_negotiate_fds(raw, descriptors ? 1 : 0), 0);
    EXPECT_GE(sd_bus_start(raw), 0);
  }

  [[nodiscard]] sd_bus *bus() const { return bus_.get(); }

  [[nodiscard]] OwnedMessage message(const char *path, const char *interface, const char *member) const {
    sd_bus_message *raw = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_.get(), &raw, nullptr, path, interface, member), 0);
    return OwnedMessage(raw);
  }

  /// The reply, or null; then `errorName` and `errorText` say why.
  OwnedMessage call(const OwnedMessage &request) {
    sd_bus_error error = borrowedError(nullptr, nullptr);
    sd_bus_message *reply = nullptr;
    const int result = sd_bus_call(bus_.get(), request.get(), 60'000'000, &error, &reply);
    errorName = error.name ? error.name : "";
    errorText = error.message ? error.message : "";
    sd_bus_error_free(&error);
    lastResult = result;
    return OwnedMessage(reply);
  }

  std::string errorName;
  std::string errorText;
  int lastResult = 0;

 private:
  OwnedBus bus_;
};

}  // namespace storix::wire
