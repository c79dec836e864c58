#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstddef>
#include <cstring>
#include <functional>
#include <string>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// A listening unix socket of a test, without a file.
class TestListener {
 public:
  TestListener() : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    // The kernel chooses an abstract name.
    const sa_family_t family = AF_UNIX;
    EXPECT_EQ(::bind(socket_.get(), reinterpret_cast<const sockaddr *>(&family), sizeof family), 0);
    length_ = sizeof address_;
    EXPECT_EQ(::getsockname(socket_.get(), reinterpret_cast<sockaddr *>(&address_), &length_), 0);
    EXPECT_EQ(::listen(socket_.get(), 16), 0);
  }

  /// Without the zero byte that makes it an abstract one.
  [[nodiscard]] std::string name() const {
    return {address_.sun_path + 1, length_ - offsetof(sockaddr_un, sun_path) - 1};
  }
  [[nodiscard]] UniqueFd connectToIt() const {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (::connect(fd.get(), reinterpret_cast<const sockaddr *>(&address_), length_) != 0) fd.reset();
    return fd;
  }
  /// None when nobody came within half a minute.
  [[nodiscard]] UniqueFd accept() const {
    pollfd ready{socket_.get(), POLLIN, 0};
    if (::poll(&ready, 1, 30'000) != 1) return {};
    return UniqueFd(::accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  }

 private:
  UniqueFd socket_;
  sockaddr_un address_{};
  socklen_t length_ = 0;
};

/// A process that prepares itself, connects twice, and does nothing until the test lets it go.
class TestPeerProcess {
 public:
  /// `namespaces` are the flags of clone(2) for those that it gets of its own.
  explicit TestPeerProcess(const TestListener &listener, const std::function<bool()> &prepare = nullptr,
                           unsigned long namespaces = 0) {
    std::array<int, 2> ends{};
    EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    UniqueFd waiting(ends[0]);
    letGo_.reset(ends[1]);
    process_ = namespaces == 0
                   ? ::fork()
                   : static_cast<pid_t>(::syscall(SYS_clone, namespaces | SIGCHLD, nullptr, nullptr, nullptr, nullptr));
    if (process_ == 0) {
      letGo_.reset();
      const bool prepared = !prepare || prepare();
      const UniqueFd first = prepared ? listener.connectToIt() : UniqueFd();
      const UniqueFd second = prepared ? listener.connectToIt() : UniqueFd();
      char byte = 0;
      const ssize_t ignored = ::read(waiting.get(), &byte, 1);
      ::_exit(ignored == 0 && first && second ? 0 : 1);
    }
    connection_ = listener.accept();
    secondConnection_ = listener.accept();
    EXPECT_TRUE(connection_ && secondConnection_) << "the process could not prepare itself";
  }
  ~TestPeerProcess() { end(); }
  TestPeerProcess(const TestPeerProcess &) = delete;
  TestPeerProcess &operator=(const TestPeerProcess &) = delete;

  void end() {
    letGo_.reset();
    if (process_ > 0) ::waitpid(process_, nullptr, 0);
    process_ = 0;
  }

  [[nodiscard]] pid_t process() const { return process_; }
  [[nodiscard]] int connection() const { return connection_.get(); }
  [[nodiscard]] int secondConnection() const { return secondConnection_.get(); }

 private:
  UniqueFd letGo_;
  pid_t process_ = 0;
  UniqueFd connection_;
  UniqueFd secondConnection_;
};

inline bool giveUpNewPrivileges() { return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0; }

}  // namespace storix::linuxhost
