#include "platform/linux/coordination/FileCoordinationTest.h"

namespace storix::linuxhost {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

// --- Readers of a provider's files

TEST_F(FileCoordinationTest, ReaderGetsItsClaimOnceTheProviderHasProvided) {
  const auto reader = read(*claims_, file("storage/one"), "reader 1");
  EXPECT_FALSE(reader->outcome);
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("provide " + text("storage/one") + " to reader 1"));
  answer(0, std::nullopt);
  EXPECT_TRUE(reader->isHeld());
  EXPECT_FALSE(write(*others_, file("storage/one"))->outcome);
}

TEST_F(FileCoordinationTest, ProvidersErrorIsGivenToTheReaderAndNothingIsClaimed) {
  const SXError error("org.sample", 7, {{"description", Value("no network")}});
  const auto reader = read(*claims_, file("storage/one"));
  answer(0, error);
  EXPECT_EQ(reader->error(), error);
  EXPECT_TRUE(write(*others_, file("storage/one"))->isHeld());
}

TEST_F(FileCoordinationTest, ReadersThatComeMeanwhileShareTheOneAnswer) {
  const auto first = read(*claims_, file("storage/one"), "1");
  const auto second = read(*others_, file("storage/one"), "2");
  const auto otherFile = read(*others_, file("storage/two"), "3");
  EXPECT_THAT(provider_->takeCalls(),
              ElementsAre("provide " + text("storage/one") + " to 1", "provide " + text("storage/two") + " to 3"));
  answer(0, std::nullopt);
  EXPECT_TRUE(first->isHeld());
  EXPECT_TRUE(second->isHeld());
  EXPECT_FALSE(otherFile->outcome);
  const auto later = read(*claims_, file("storage/one"), "4");
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("provide " + text("storage/one") + " to 4"));
  EXPECT_FALSE(later->outcome);
}

TEST_F(FileCoordinationTest, ErrorIsGivenToAllWhoWait) {
  const SXError error("org.sample", 7);
  const auto first = read(*claims_, file("storage/one"));
  const auto second = read(*others_, file("storage/one"));
  answer(0, error);
  EXPECT_EQ(first->error(), error);
  EXPECT_EQ(second->error(), error);
}

TEST_F(FileCoordinationTest, OnlyTheFirstAnswerCounts) {
  const auto reader = read(*claims_, file("storage/one"));
  answer(0, std::nullopt);
  answer(0, SXError("org.sample", 7));
  EXPECT_TRUE(reader->isHeld());
  const auto later = read(*claims_, file("storage/one"));
  answer(0, std::nullopt);
  EXPECT_FALSE(later->outcome) << "answered by the answer to an earlier question";
  answer(1, std::nullopt);
  EXPECT_TRUE(later->isHeld());
}

TEST_F(FileCoordinationTest, LettingGoOfTheQuestionIsAFailure) {
  const auto reader = read(*claims_, file("storage/one"));
  provider_->completions.clear();
  executor_.runUntilIdle();
  ASSERT_TRUE(reader->error());
  EXPECT_EQ(reader->error()->domain(), platformErrorDomain);
  EXPECT_EQ(reader->error()->code(), static_cast<std::int64_t>(HostErrorCode::noAnswer));
}

TEST_F(FileCoordinationTest, RequiredFormIsUsedWhereTheOtherIsAbsent) {
  provider_->answersReaderForm = false;
  const auto reader = read(*claims_, file("storage/one"), "1");
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("old form " + text("storage/one")));
  answer(0, std::nullopt);
  EXPECT_TRUE(reader->isHeld());
}

TEST_F(FileCoordinationTest, ReaderOfAProvidersFileStillWaitsForAWriter) {
  const auto writer = write(*others_, file("storage/one"));
  const auto reader = read(*claims_, file("storage/one"));
  answer(0, std::nullopt);
  EXPECT_TRUE(writer->isHeld());
  EXPECT_FALSE(reader->outcome);
  EXPECT_EQ(others_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(reader->isHeld());
}

TEST_F(FileCoordinationTest, ProviderMayWriteTheFileThatAReaderWaitsFor) {
  const auto reader = read(*claims_, file("storage/one"));
  const auto itself = write(*others_, file("storage/one"));
  EXPECT_TRUE(itself->isHeld()) << "the reader has not come before the provider's answer";
  EXPECT_FALSE(reader->outcome);
}

TEST_F(FileCoordinationTest, DirectoryItselfAndWhatLiesAboveItNeedNoCallback) {
  EXPECT_TRUE(read(*claims_, urlOf(directory_ / "storage", true))->isHeld());
  EXPECT_TRUE(read(*claims_, file("storage"))->isHeld());
  EXPECT_TRUE(read(*claims_, urlOf(directory_.path(), true))->isHeld());
  EXPECT_TRUE(read(*claims_, file("storagetwo"))->isHeld());
  EXPECT_TRUE(read(*claims_, urlOf("/", true))->isHeld());
  EXPECT_THAT(provider_->calls, IsEmpty());
}

TEST_F(FileCoordinationTest, ProviderIsAskedByItsOwnURLHoweverTheFileWasReached) {
  directory_.makeLink("link", directory_ / "storage");
  const auto reader = read(*claims_, file("link/sub/../a b%"), "1");
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("provide " + text("storage/a b%") + " to 1"));
  read(*claims_, urlOf(directory_ / "link/package", true), "2");
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("provide " + text("storage/package") + "/ to 2"));
}

TEST_F(FileCoordinationTest, ProviderWhoseDirectoryIsReachedThroughALinkIsFound) {
  directory_.makeDirectory("real");
  directory_.makeLink("second", directory_ / "real");
  const auto second = makeProvider("second", "org.sample.second");
  coordination_->addProvider(second);
  read(*claims_, file("real/one"), "1");
  EXPECT_THAT(second->takeCalls(), ElementsAre("provide " + text("second/one") + " to 1"));
}

TEST_F(FileCoordinationTest, InnermostProviderIsAsked) {
  const auto inner = makeProvider("storage/inner", "org.sample.inner");
  coordination_->addProvider(inner);
  read(*claims_, file("storage/inner/one"), "1");
  EXPECT_THAT(provider_->calls, IsEmpty());
  EXPECT_THAT(inner->takeCalls(), ElementsAre("provide " + text("storage/inner/one") + " to 1"));
  read(*claims_, file("storage/inner"), "2");
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("provide " + text("storage/inner") + " to 2"));
}

TEST_F(FileCoordinationTest, OfTwoProvidersWithOneDirectoryTheLaterIsAsked) {
  const auto later = makeProvider("storage", "org.sample.later");
  coordination_->addProvider(later);
  read(*claims_, file("storage/one"));
  EXPECT_THAT(provider_->calls, IsEmpty());
  EXPECT_EQ(later->calls.size(), 1U);
  coordination_->removeProvider(later);
  read(*claims_, file("storage/two"));
  EXPECT_EQ(provider_->calls.size(), 1U);
}

TEST_F(FileCoordinationTest, ProviderWithoutADirectoryIsNeverAsked) {
  const auto homeless = std::make_shared<ScriptedProvider>(executor_, std::nullopt);
  coordination_->addProvider(homeless);
  EXPECT_TRUE(read(*claims_, file("elsewhere"))->isHeld());
  EXPECT_THAT(homeless->calls, IsEmpty());
  coordination_->removeProvider(homeless);
  EXPECT_EQ(homeless.use_count(), 1);
}

TEST_F(FileCoordinationTest, ReaderThatGoesWhileTheProviderIsAskedIsForgotten) {
  const auto gone = read(*claims_, file("storage/one"));
  const auto stays = read(*others_, file("storage/one"));
  claims_.reset();
  answer(0, std::nullopt);
  EXPECT_FALSE(gone->outcome);
  EXPECT_TRUE(stays->isHeld());
  others_.reset();
  claims_ = coordination_->claimsOf(nullptr);
  EXPECT_TRUE(write(*claims_, file("storage/one"))->isHeld());
}

TEST_F(FileCoordinationTest, ThousandsOfReadersOfOneFileAreServedByOneQuestionAndMayAllGo) {
  constexpr std::size_t connections = 40;
  constexpr std::size_t each = 1000;
  std::vector<std::unique_ptr<FileClaims>> readers;
  std::size_t held = 0;
  for (std::size_t i = 0; i < connections; ++i) {
    readers.push_back(coordination_->claimsOf(nullptr));
    for (std::size_t j = 0; j < each; ++j) {
      readers.back()->beginRead(file("storage/one"), std::nullopt, [&held](const ClaimOutcome &outcome) {
        EXPECT_TRUE(std::holds_alternative<ClaimIdentifier>(outcome));
        ++held;
      });
    }
  }
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, testing::SizeIs(1));
  readers.resize(connections / 2);
  answer(0, std::nullopt);
  EXPECT_EQ(held, connections / 2 * each);
  const auto writer = write(*claims_, file("storage/one"));
  EXPECT_FALSE(writer->outcome);
  readers.clear();
  executor_.runUntilIdle();
  EXPECT_TRUE(writer->isHeld());
}

// --- Writers of a provider's files

TEST_F(FileCoordinationTest, WriterAsksNobodyAndItsEndIsToldToTheProvider) {
  const auto writer = write(*claims_, file("storage/one"), "writer 1");
  ASSERT_TRUE(writer->isHeld());
  EXPECT_THAT(provider_->calls, IsEmpty());
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->takeCalls(), ElementsAre("written " + text("storage/one") + " by writer 1"));
}

TEST_F(FileCoordinationTest, ProviderHearsOfTheWriteBeforeTheNextClaimIsGiven) {
  const auto writer = write(*claims_, file("storage/one"));
  const auto next = std::make_shared<Begun>();
  bool toldBefore = false;
  others_->beginWrite(file("storage/one"), std::nullopt, [this, &toldBefore, next](ClaimOutcome outcome) {
    toldBefore = provider_->calls.size() == 1;
    next->outcome = std::move(outcome);
  });
  executor_.runUntilIdle();
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_TRUE(next->isHeld());
  EXPECT_TRUE(toldBefore);
}

TEST_F(FileCoordinationTest, ProviderThatDoesNotWantToHearOfWritesIsNotTold) {
  provider_->answersWriter = false;
  const auto writer = write(*claims_, file("storage/one"));
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
}

TEST_F(FileCoordinationTest, WriteOfTheDirectoryItselfAndEndOfTheConnectionAreNotTold) {
  const auto writer = write(*claims_, urlOf(directory_ / "storage", true));
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  write(*claims_, file("storage/one"));
  claims_.reset();
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
}

// --- The provider's own process

TEST_F(FileCoordinationTest, ProvidersOwnProcessIsNotCalledBack) {
  ownProvider_ = "org.sample.docs";
  const auto own = coordination_->claimsOf(ownPeer());
  const auto reader = read(*own, file("storage/one"));
  ASSERT_TRUE(reader->isHeld());
  EXPECT_EQ(own->endRead(reader->claim()), std::nullopt);
  const auto writer = write(*own, file("storage/one"));
  ASSERT_TRUE(writer->isHeld());
  EXPECT_EQ(own->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
}

TEST_F(FileCoordinationTest, ProcessOfAnotherProviderIsLikeAnyOther) {
  ownProvider_ = "org.sample.other";
  const auto other = coordination_->claimsOf(ownPeer());
  EXPECT_FALSE(read(*other, file("storage/one"))->outcome);
  EXPECT_EQ(provider_->calls.size(), 1U);
}

// --- Withdrawal

TEST_F(FileCoordinationTest, WithdrawnProviderHearsOfNothingAnyMore) {
  coordination_->removeProvider(provider_);
  EXPECT_TRUE(read(*claims_, file("storage/one"))->isHeld());
  const auto writer = write(*claims_, file("storage/two"));
  EXPECT_EQ(claims_->endWrite(writer->claim()), std::nullopt);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
  EXPECT_EQ(provider_.use_count(), 1);
}

TEST_F(FileCoordinationTest, WhatIsOnItsWayToAWithdrawnProviderIsDropped) {
  const auto reader = std::make_shared<Begun>();
  const auto writer = write(*others_, file("storage/two"));
  claims_->beginRead(file("storage/one"), std::nullopt, into(reader));
  EXPECT_EQ(others_->endWrite(writer->claim()), std::nullopt);
  coordination_->removeProvider(provider_);
  executor_.runUntilIdle();
  EXPECT_THAT(provider_->calls, IsEmpty());
  EXPECT_TRUE(reader->isHeld()) << "a file like any other now";
}

TEST_F(FileCoordinationTest, AnswerOfAWithdrawnProviderStillCounts) {
  const auto reader = read(*claims_, file("storage/one"));
  coordination_->removeProvider(provider_);
  EXPECT_FALSE(reader->outcome);
  answer(0, SXError("org.sample", 7));
  EXPECT_TRUE(reader->error());
}

TEST_F(FileCoordinationTest, ProviderThatWasAddedTwiceIsWithdrawnOnce) {
  coordination_->addProvider(provider_);
  coordination_->removeProvider(provider_);
  EXPECT_TRUE(read(*claims_, file("storage/one"))->isHeld());
  coordination_->removeProvider(provider_);
  coordination_->addProvider(provider_);
  EXPECT_FALSE(read(*claims_, file("storage/one"))->outcome);
}

TEST_F(FileCoordinationTest, AbsentAndUnknownProvidersAreIgnored) {
  coordination_->addProvider(nullptr);
  coordination_->removeProvider(nullptr);
  coordination_->removeProvider(makeProvider("storage"));
  EXPECT_FALSE(read(*claims_, file("storage/one"))->outcome);
}

}  // namespace
}  // namespace storix::linuxhost
