#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <utility>

#include "platform/ProcessScope.h"
#include "tests/contract/HostUnderTest.h"

namespace storix::contract {

inline void PrintTo(const HostKind &kind, std::ostream *out) { *out << kind.name; }

/// What callbacks on other threads leave for the test, which waits for it.
template <class T>
class Awaited {
 public:
  template <class Change>
  void change(Change &&change) {
    const std::lock_guard lock(mutex_);
    change(value_);
    changed_.notify_all();
  }

  /// Waits until the value is as asked; false after a time in which it must have come.
  template <class Condition>
  [[nodiscard]] bool wait(Condition &&condition) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::seconds(30), [&] { return condition(std::as_const(value_)); });
  }

  [[nodiscard]] T value() const {
    const std::lock_guard lock(mutex_);
    return value_;
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  T value_{};
};

/// A test that every host must pass.
class ContractTest : public testing::TestWithParam<HostKind> {
 protected:
  ContractTest() : host_(GetParam().make()), scope_(std::make_unique<ProcessScope>(host_->platform())) {}
  ~ContractTest() override { host_->shutDown(); }

  HostUnderTest &host() { return *host_; }
  PlatformServices &platform() { return host_->platform(); }
  [[nodiscard]] std::string at(const std::string &name) const { return host_->directory() + "/" + name; }

  /// Runs the event loop on this thread while `steps` run on another one, and until they are over.
  void runEventLoopDuring(const std::function<void()> &steps);

 private:
  std::unique_ptr<HostUnderTest> host_;
  std::unique_ptr<ProcessScope> scope_;
};

#define STORIX_CONTRACT(suite)                                                    \
  INSTANTIATE_TEST_SUITE_P(EveryHost, suite, testing::ValuesIn(hostsUnderTest()), \
                           [](const testing::TestParamInfo<HostKind> &kind) { return kind.param.name; })

}  // namespace storix::contract
