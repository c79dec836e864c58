#pragma once

#include <gtest/gtest.h>

#include <memory>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"

namespace storix::fake {

/// A test on a fresh fake host with a fresh process scope. What the test makes of the logic must not
/// outlive the test body, or be a member that is dropped in `TearDown` before this one's.
class FakeHostTest : public ::testing::Test {
 protected:
  explicit FakeHostTest(FakePlatform::Options options = {}) : platform_(FakePlatform::create(std::move(options))) {
    scope_ = std::make_unique<ProcessScope>(*platform_);
  }

  void TearDown() override {
    platform_->shutDown();
    scope_.reset();
    platform_->runUntilIdle();
  }

  FakePlatform &platform() { return *platform_; }
  void runUntilIdle() { platform_->runUntilIdle(); }

 private:
  std::unique_ptr<FakePlatform> platform_;
  std::unique_ptr<ProcessScope> scope_;
};

}  // namespace storix::fake
