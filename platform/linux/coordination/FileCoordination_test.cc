#include "platform/linux/coordination/FileCoordinationTest.h"

namespace storix::linuxhost {
namespace {

using testing::IsEmpty;

TEST_F(FileCoordinationTest, FilesOutsideEveryProviderAreCoordinatedWithoutACallback) {
  const auto reader = read(*claims_, file("elsewhere"));
  ASSERT_TRUE(reader->isHeld());
  EXPECT_NE(reader->claim(), 0U);
  const auto writer = write(*others_, file("elsewhere"));
  EXPECT_FALSE(writer->outcome);
  EXPECT_EQ(claims_->endRead(reader->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(writer->isHeld());
  EXPECT_EQ(others_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
}

TEST_F(FileCoordinationTest, ReadersStandSideBySideAndAWriterAlone) {
  const auto first = read(*claims_, file("a"));
  const auto second = read(*others_, file("a"));
  const auto writer = write(*claims_, file("a"));
  const auto third = read(*others_, file("a"));
  EXPECT_TRUE(first->isHeld());
  EXPECT_TRUE(second->isHeld());
  EXPECT_FALSE(writer->outcome);
  EXPECT_FALSE(third->outcome) << "overtook the writer";
  EXPECT_EQ(claims_->endRead(first->claim()), std::nullopt);
  EXPECT_EQ(others_->endRead(second->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(writer->isHeld());
  EXPECT_FALSE(third->outcome);
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(third->isHeld());
}

TEST_F(FileCoordinationTest, ClaimsConflictAboveAndBelow) {
  const auto writer = write(*claims_, urlOf(directory_ / "d", true));
  const auto below = read(*others_, file("d/e/f"));
  const auto above = read(*others_, urlOf(directory_.path(), true));
  const auto beside = read(*others_, file("dd"));
  EXPECT_TRUE(writer->isHeld());
  EXPECT_FALSE(below->outcome);
  EXPECT_FALSE(above->outcome);
  EXPECT_TRUE(beside->isHeld());
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(below->isHeld());
  EXPECT_TRUE(above->isHeld());
}

TEST_F(FileCoordinationTest, TwoNamesOfOneFileConflict) {
  directory_.makeDirectory("real");
  directory_.makeLink("link", directory_ / "real");
  const auto writer = write(*claims_, file("real/file"));
  const auto reader = read(*others_, file("link/../real/./file"));
  EXPECT_TRUE(writer->isHeld());
  EXPECT_FALSE(reader->outcome);
  EXPECT_FALSE(read(*others_, file("link/file"))->outcome);
}

TEST_F(FileCoordinationTest, ClaimsEndWithTheirConnection) {
  const auto writer = write(*claims_, file("a"));
  const auto waitingToo = write(*claims_, file("a"));
  const auto reader = read(*others_, file("a"));
  EXPECT_FALSE(reader->outcome);
  claims_.reset();
  executor_.runUntilIdle();
  EXPECT_TRUE(reader->isHeld());
  EXPECT_FALSE(waitingToo->outcome);
}

TEST_F(FileCoordinationTest, ConnectionThatEndsWhileWaitingGivesUpItsPlace) {
  const auto reader = read(*claims_, file("a"));
  const auto writer = write(*others_, file("a"));
  const auto later = read(*claims_, file("a"));
  EXPECT_FALSE(later->outcome);
  others_.reset();
  executor_.runUntilIdle();
  EXPECT_TRUE(later->isHeld());
  EXPECT_FALSE(writer->outcome);
}

TEST_F(FileCoordinationTest, OnlyAHeldClaimOfTheConnectionAndTheKindCanBeEnded) {
  const auto isNoSuchClaim = [](const std::optional<CoordinationFailure> &failure) {
    return failure && failure->kind == CoordinationFailure::Kind::noSuchClaim && !failure->text.empty();
  };
  const auto reader = read(*claims_, file("a"));
  const auto writer = write(*claims_, file("b"));
  const auto waiting = write(*claims_, file("a"));
  EXPECT_TRUE(isNoSuchClaim(claims_->endRead(0)));
  EXPECT_TRUE(isNoSuchClaim(claims_->endRead(4711)));
  EXPECT_TRUE(isNoSuchClaim(others_->endRead(reader->claim())));
  EXPECT_TRUE(isNoSuchClaim(claims_->endWrite(reader->claim())));
  EXPECT_TRUE(isNoSuchClaim(claims_->endRead(writer->claim())));
  EXPECT_TRUE(isNoSuchClaim(claims_->endWrite(writer->claim() + 1))) << "still waiting";
  EXPECT_FALSE(waiting->outcome);
  EXPECT_EQ(claims_->endRead(reader->claim()), std::nullopt);
  EXPECT_TRUE(isNoSuchClaim(claims_->endRead(reader->claim()))) << "ended before";
}

TEST_F(FileCoordinationTest, OneConnectionHasOnlySoManyClaims) {
  for (std::size_t i = 0; i < FileCoordination::claimsPerConnection; ++i) {
    claims_->beginRead(file("a"), std::nullopt, [](const ClaimOutcome &) {});
  }
  executor_.runUntilIdle();
  EXPECT_EQ(read(*claims_, file("a"))->failure(), CoordinationFailure::Kind::busy);
  EXPECT_TRUE(read(*others_, file("a"))->isHeld());
  claims_ = coordination_->claimsOf(nullptr);
  EXPECT_TRUE(read(*claims_, file("a"))->isHeld());
}

TEST_F(FileCoordinationTest, AllConnectionsTogetherHaveOnlySoManyComponents) {
  std::string deep;
  for (int i = 0; i < 1000; ++i) deep += "/a";
  const URL url = file(deep);
  std::size_t held = 0;
  while (held <= FileCoordination::componentsAltogether / 1000 && read(*claims_, url)->isHeld()) ++held;
  EXPECT_LT(held, FileCoordination::componentsAltogether / 1000);
  EXPECT_GT(held, FileCoordination::componentsAltogether / 1100);
  EXPECT_EQ(read(*others_, url)->failure(), CoordinationFailure::Kind::busy);
  claims_.reset();
  EXPECT_TRUE(read(*others_, url)->isHeld());
}

TEST_F(FileCoordinationTest, WhatCannotBeLookedAtIsUnavailable) {
  directory_.makeLink("loop", directory_ / "loop");
  EXPECT_EQ(read(*claims_, file("loop/file"))->failure(), CoordinationFailure::Kind::unavailable);
  EXPECT_EQ(write(*claims_, file("loop/file"))->failure(), CoordinationFailure::Kind::unavailable);
}

TEST_F(FileCoordinationTest, ClaimsThatOutliveTheServiceDoNothing) {
  const auto reader = read(*claims_, file("a"));
  const auto waiting = write(*others_, file("a"));
  coordination_.reset();
  EXPECT_TRUE(claims_->endRead(reader->claim()).has_value());
  EXPECT_FALSE(read(*claims_, file("a"))->outcome);
  EXPECT_FALSE(waiting->outcome);
}

}  // namespace
}  // namespace storix::linuxhost
