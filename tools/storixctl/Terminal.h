#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <unistd.h>

#include <string>

#include "wire/UniqueFd.h"

namespace storix::ctl {

/// A terminal, for tests: what is written to it can be read back.
class Terminal {
 public:
  explicit Terminal(unsigned short columns = 80) {
    int outer = -1;
    int inner = -1;
    winsize size{};
    size.ws_row = 24;
    size.ws_col = columns;
    EXPECT_EQ(::openpty(&outer, &inner, nullptr, nullptr, &size), 0);
    outer_.reset(outer);
    inner_.reset(inner);
    ::fcntl(outer, F_SETFD, FD_CLOEXEC);
    ::fcntl(inner, F_SETFD, FD_CLOEXEC);
    ::fcntl(outer, F_SETFL, O_NONBLOCK);
  }

  /// What a program has as its terminal.
  [[nodiscard]] int descriptor() const { return inner_.get(); }

  /// Everything that was written so far.
  const std::string &shown() {
    readMore();
    return shown_;
  }

  /// Waits until the text was written. Fails the test if it does not come.
  void waitFor(const std::string &text) {
    while (shown().find(text) == std::string::npos) {
      pollfd readable{outer_.get(), POLLIN, 0};
      if (::poll(&readable, 1, 60'000) != 1) {
        ADD_FAILURE() << "“" << text << "” did not come; there was:\n" << shown_;
        return;
      }
    }
  }

 private:
  void readMore() {
    char buffer[4096];
    for (ssize_t count = 0; (count = ::read(outer_.get(), buffer, sizeof buffer)) > 0;) {
      shown_.append(buffer, static_cast<std::size_t>(count));
    }
  }

  UniqueFd outer_;
  UniqueFd inner_;
  std::string shown_;
};

}  // namespace storix::ctl
