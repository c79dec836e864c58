#include "platform/linux/FileCoordination.h"

#include <gmock/gmock.h>
#include <sys/socket.h>
#include <unistd.h>

#include <utility>
#include <vector>

#include "platform/ManualExecutor.h"
#include "platform/linux/ApplicationManifests.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

URL urlOf(const std::string &path, bool isDirectory = false) { return *URL::fileURLWithPath(path, isDirectory); }

/// A provider object in this process that the test answers for.
class ScriptedProvider : public KTStorix {
 public:
  ScriptedProvider(Executor &executor, std::optional<URL> url, std::string identifier = "org.sample.docs")
      : queue(OperationQueue::create(executor, "Operation queue for " + identifier)),
        url_(std::move(url)),
        identifier_(std::move(identifier)) {}

  std::optional<URL> _providedItemsURL() override { return url_; }
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override { return queue; }
  std::optional<std::string> _fileReactorID() override { return identifier_; }
  [[nodiscard]] bool answers(OptionalMember member) const override {
    switch (member) {
      case OptionalMember::provideItemAtURLToReaderWithID:
        return answersReaderForm;
      case OptionalMember::writerWithIDDidFinishWritingForURL:
        return answersWriter;
      case OptionalMember::fileReactorID:
        return true;
      default:
        return false;
    }
  }
  void _provideItemAtURL(std::optional<URL> url, Completion completionHandler) override {
    note("old form " + url->absoluteString());
    completions.push_back(std::move(completionHandler));
  }
  void _provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                         Completion completionHandler) override {
    note("provide " + url->absoluteString() + " to " + toReaderWithID.value_or("nobody"));
    completions.push_back(std::move(completionHandler));
  }
  void _writerWithID(std::optional<std::string> writerID, std::optional<URL> didFinishWritingForURL) override {
    note("written " + didFinishWritingForURL->absoluteString() + " by " + writerID.value_or("nobody"));
  }

  std::vector<std::string> takeCalls() { return std::exchange(calls, {}); }

  std::shared_ptr<OperationQueue> queue;
  bool answersReaderForm = true;
  bool answersWriter = true;
  std::vector<std::string> calls;
  std::vector<Completion> completions;

 private:
  void note(std::string call) {
    EXPECT_EQ(OperationQueue::current(), queue.get());
    calls.push_back(std::move(call));
  }

  std::optional<URL> url_;
  std::string identifier_;
};

/// What one begin has come to.
struct Begun {
  std::optional<ClaimOutcome> outcome;

  [[nodiscard]] bool isHeld() const { return outcome && std::holds_alternative<ClaimIdentifier>(*outcome); }
  [[nodiscard]] ClaimIdentifier claim() const { return isHeld() ? std::get<ClaimIdentifier>(*outcome) : 0; }
  [[nodiscard]] std::optional<SXError> error() const {
    if (!outcome || !std::holds_alternative<SXError>(*outcome)) return std::nullopt;
    return std::get<SXError>(*outcome);
  }
  [[nodiscard]] std::optional<CoordinationFailure::Kind> failure() const {
    if (!outcome || !std::holds_alternative<CoordinationFailure>(*outcome)) return std::nullopt;
    return std::get<CoordinationFailure>(*outcome).kind;
  }
};

class FileCoordinationTest : public testing::Test {
 protected:
  FileCoordinationTest() : coordination_(std::make_unique<FileCoordination>(executor_, isProviderProcess())) {
    directory_.makeDirectory("storage");
    provider_ = makeProvider("storage");
    coordination_->addProvider(provider_);
    claims_ = coordination_->claimsOf(nullptr);
    others_ = coordination_->claimsOf(nullptr);
  }

  FileCoordination::IsProviderProcess isProviderProcess() {
    return [this](const std::string &identifier, pid_t process) {
      return identifier == ownProvider_ && process == ::getpid();
    };
  }

  std::shared_ptr<ScriptedProvider> makeProvider(const std::string &name, std::string identifier = "org.sample.docs") {
    return std::make_shared<ScriptedProvider>(executor_, urlOf(directory_ / name, true), std::move(identifier));
  }

  [[nodiscard]] URL file(const std::string &name) const { return urlOf(directory_ / name); }
  [[nodiscard]] std::string text(const std::string &name) const { return file(name).absoluteString(); }

  static ClaimHandler into(const std::shared_ptr<Begun> &begun) {
    return [begun](ClaimOutcome outcome) {
      EXPECT_FALSE(begun->outcome.has_value()) << "answered twice";
      begun->outcome = std::move(outcome);
    };
  }

  /// Both run all that can be run.
  std::shared_ptr<Begun> read(FileClaims &claims, const URL &url, std::optional<std::string> reader = std::nullopt) {
    auto begun = std::make_shared<Begun>();
    claims.beginRead(url, std::move(reader), into(begun));
    EXPECT_FALSE(begun->outcome) << "answered inside the call";
    executor_.runUntilIdle();
    return begun;
  }
  std::shared_ptr<Begun> write(FileClaims &claims, const URL &url, std::optional<std::string> writer = std::nullopt) {
    auto begun = std::make_shared<Begun>();
    claims.beginWrite(url, std::move(writer), into(begun));
    EXPECT_FALSE(begun->outcome) << "answered inside the call";
    executor_.runUntilIdle();
    return begun;
  }

  void answer(std::size_t question, const std::optional<SXError> &error) {
    provider_->completions.at(question)(error);
    executor_.runUntilIdle();
  }

  /// A peer that is this very process.
  static std::shared_ptr<const Peer> ownPeer() {
    static PeerTable table(std::make_shared<ApplicationManifests>(std::vector<std::string>()));
    int ends[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd one(ends[0]);
    const UniqueFd other(ends[1]);
    Result<std::shared_ptr<Peer>> peer = table.admit(one.get());
    EXPECT_TRUE(peer.ok());
    return peer ? peer.value() : nullptr;
  }

  TestDirectory directory_;
  ManualExecutor executor_;
  std::string ownProvider_;
  std::unique_ptr<FileCoordination> coordination_;
  std::shared_ptr<ScriptedProvider> provider_;
  std::unique_ptr<FileClaims> claims_;
  std::unique_ptr<FileClaims> others_;
};

// --- Claims

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
