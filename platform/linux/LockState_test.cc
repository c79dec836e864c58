#include "platform/linux/LockState.h"

#include <gmock/gmock.h>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::Field;
using testing::HasSubstr;
using testing::IsEmpty;

class LockStateTest : public testing::Test {
 protected:
  void write(const std::string &content) { directory_.makeFile(std::string(lockStateFileName), content); }

  void expectLockedSinceBoot(const std::string &content, const std::string &reason) {
    write(content);
    LockState state(directory_.path());
    EXPECT_EQ(state.lockState(), 0) << content;
    EXPECT_FALSE(state.unlockedSinceBoot()) << content;
    EXPECT_THAT(platform_->log().take(),
                ElementsAre(AllOf(Field(&fake::LogLine::severity, LogSeverity::fault),
                                  Field(&fake::LogLine::text, AllOf(HasSubstr(lockStateFileName), HasSubstr(reason))))))
        << content;
  }

  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
  TestDirectory directory_;
  LockState state_{directory_.path()};
};

TEST_F(LockStateTest, NoFileMeansNoPasscode) {
  EXPECT_EQ(state_.lockState(), 3);
  EXPECT_TRUE(state_.unlockedSinceBoot());
  EXPECT_THAT(platform_->log().lines(), IsEmpty());
}

TEST_F(LockStateTest, FileIsLookedAtEachTime) {
  write(R"({"lockState": 1, "unlockedSinceBoot": false})");
  EXPECT_EQ(state_.lockState(), 1);
  EXPECT_FALSE(state_.unlockedSinceBoot());
  write(R"({"lockState": -2, "unlockedSinceBoot": true})");
  EXPECT_EQ(state_.lockState(), -2);
  EXPECT_TRUE(state_.unlockedSinceBoot());
  EXPECT_THAT(platform_->log().lines(), IsEmpty());
}

TEST_F(LockStateTest, NotSayingThatItWasUnlockedMeansThatItWasNot) {
  write(R"({"lockState": 1})");
  EXPECT_EQ(state_.lockState(), 1);
  EXPECT_FALSE(state_.unlockedSinceBoot());
}

TEST_F(LockStateTest, WhatCannotBeUnderstoodIsOneLineAndCountsAsLocked) {
  expectLockedSinceBoot("{", "");
  expectLockedSinceBoot("", "");
  expectLockedSinceBoot(R"({"unlockedSinceBoot": true})", "lockState");
  expectLockedSinceBoot(R"({"lockState": "3", "unlockedSinceBoot": true})", "whole number");
  expectLockedSinceBoot(R"({"lockState": 3, "unlockedSinceBoot": 1})", "unlockedSinceBoot");
}

TEST_F(LockStateTest, NumberBeyondAnIntegerIsNotUnderstood) {
  expectLockedSinceBoot(R"({"lockState": 4294967299, "unlockedSinceBoot": true})", "whole number");
}

TEST_F(LockStateTest, DirectoryInItsPlaceCountsAsLocked) {
  directory_.makeDirectory(std::string(lockStateFileName));
  EXPECT_EQ(state_.lockState(), 0);
  EXPECT_FALSE(state_.unlockedSinceBoot());
  EXPECT_EQ(platform_->log().lines().size(), 1U);
}

}  // namespace
}  // namespace storix::linuxhost
