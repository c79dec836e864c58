#include "storix/FileCoordinator.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <thread>
#include <vector>

#include "sdk/src/TestDaemon.h"
#include "storix/Client.h"
#include "wire/PlatformInterfaces.h"

namespace storix {
namespace {

using sdk::TestDaemon;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using Reply = wire::BusConnection::Reply;
using Outcome = std::optional<SXError>;

/// A daemon whose claims a test gives by hand, and what it has seen.
class FileCoordinatorTest : public ::testing::Test {
 protected:
  FileCoordinatorTest() {
    daemon_.daemon->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
    daemon_.onBeginRead = beginning("read");
    daemon_.onBeginWrite = beginning("write");
    daemon_.onEndRead = ending("end of read");
    daemon_.onEndWrite = ending("end of write");
    daemon_.onPlatformConnection = [this] { change([this] { ++connected_; }); };
    daemon_.onPlatformConnectionClosed = [this] { change([this] { ++closed_; }); };
  }

  ClientOptions options(milliseconds timeout = std::chrono::seconds(60)) { return {daemon_.directory(), timeout}; }

  /// From now on claims are given at once.
  void giveAtOnce() {
    change([this] { atOnce_ = true; });
  }

  static void give(const Reply &reply, std::uint64_t number) {
    wire::MethodValues values;
    values.emplace_back(std::optional<SXError>());
    values.emplace_back(std::optional<std::uint64_t>(number));
    reply.send(std::move(values));
  }

  static void fail(const Reply &reply, std::optional<SXError> error) {
    wire::MethodValues values;
    values.emplace_back(std::move(error));
    values.emplace_back(std::optional<std::uint64_t>());
    reply.send(std::move(values));
  }

  /// Waits until so many requests to begin are waiting, and takes them.
  std::vector<Reply> takeWaiting(std::size_t count) {
    waitUntil([this, count] { return waiting_.size() >= count; });
    const std::lock_guard lock(mutex_);
    return std::exchange(waiting_, {});
  }

  void waitUntil(const std::function<bool()> &condition) {
    std::unique_lock lock(mutex_);
    ASSERT_TRUE(changed_.wait_for(lock, std::chrono::seconds(60), condition));
  }
  void waitForEvents(std::size_t count) {
    waitUntil([this, count] { return events_.size() >= count; });
  }
  std::vector<std::string> events() {
    const std::lock_guard lock(mutex_);
    return events_;
  }

  void change(const std::function<void()> &change) {
    const std::lock_guard lock(mutex_);
    change();
    changed_.notify_all();
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  bool atOnce_ = false;
  bool endsAreAnswered_ = true;
  std::uint64_t lastNumber_ = 0;
  std::vector<Reply> waiting_;
  std::vector<std::string> events_;
  int connected_ = 0;
  int closed_ = 0;
  TestDaemon daemon_;
  const URL file_ = *URL::fileURLWithPath("/storage/a b");

 private:
  wire::BusConnection::MethodHandler beginning(const std::string &kind) {
    return [this, kind](const wire::MethodValues &values, const Reply &reply) {
      change([&] {
        events_.push_back(kind + " " + std::get<std::string>(values.at(0)) + " " +
                          std::get<std::optional<std::string>>(values.at(1)).value_or("nobody"));
        if (atOnce_) return give(reply, ++lastNumber_);
        waiting_.push_back(reply);
      });
    };
  }
  wire::BusConnection::MethodHandler ending(const std::string &kind) {
    return [this, kind](const wire::MethodValues &values, const Reply &reply) {
      change([&] {
        events_.push_back(kind + " " + std::to_string(std::get<std::uint64_t>(values.at(0))));
        if (endsAreAnswered_) reply.send({});
      });
    };
  }
};

TEST_F(FileCoordinatorTest, AReadIsAskedForAndEnded) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  auto claim = coordinator.read(file_, {.identifier = "org.sample.reader"});
  ASSERT_TRUE(claim.ok()) << claim.error().message();
  EXPECT_TRUE(claim.value().isHeld());
  EXPECT_FALSE(claim.value().lost());
  EXPECT_EQ(claim.value().end(), std::nullopt);
  EXPECT_FALSE(claim.value().isHeld());
  EXPECT_FALSE(claim.value().lost());
  EXPECT_THAT(events(), ElementsAre("read file:///storage/a%20b org.sample.reader", "end of read 1"));
}

TEST_F(FileCoordinatorTest, NothingIsAskedOfADaemonThatHasNotFoundItsProviders) {
  std::vector<CompletionHandler<>> woken;
  daemon_.daemon->onWakeUp = [&](const CompletionHandler<> &reply) {
    change([&] {
      events_.emplace_back("wake");
      woken.push_back(reply);
    });
  };
  giveAtOnce();
  FileCoordinator coordinator(options());
  std::promise<bool> given;
  coordinator.read(file_, {}, [&given](const Result<FileClaim> &claim) { given.set_value(claim.ok()); });
  EXPECT_EQ(coordinator.read(file_, {.deadline = milliseconds(1)}).error().code(),
            static_cast<std::int64_t>(ClientErrorCode::timedOut));
  waitForEvents(1);
  change([this] { events_.emplace_back("found"); });
  woken.at(0)();
  EXPECT_TRUE(given.get_future().get());
  EXPECT_TRUE(coordinator.read(file_).ok());
  const std::vector<std::string> seen = events();
  EXPECT_THAT((std::vector(seen.begin(), seen.begin() + 3)),
              ElementsAre("wake", "found", "read file:///storage/a%20b nobody"));
  EXPECT_EQ(woken.size(), 1U);
}

TEST_F(FileCoordinatorTest, TheNextDaemonIsWaitedForAgain) {
  daemon_.daemon->onWakeUp = [this](const CompletionHandler<> &reply) {
    change([this] { events_.emplace_back("wake"); });
    reply();
  };
  giveAtOnce();
  FileCoordinator coordinator(options());
  auto claim = coordinator.read(file_);
  ASSERT_TRUE(claim.ok());
  daemon_.closeConnections();
  EXPECT_TRUE(claim.value().end().has_value());
  EXPECT_TRUE(coordinator.read(file_).ok());
  EXPECT_THAT(events(), testing::Contains("wake").Times(2));
}

TEST_F(FileCoordinatorTest, AnExtensionDoesNotWaitForTheDaemonThatWaitsForIt) {
  daemon_.daemon->onWakeUp = nullptr;
  giveAtOnce();
  ASSERT_EQ(::setenv("STORIX_EXTENSION_FD", "3", 1), 0);
  FileCoordinator coordinator(options());
  ::unsetenv("STORIX_EXTENSION_FD");
  EXPECT_TRUE(coordinator.read(file_).ok());
}

TEST_F(FileCoordinatorTest, ADaemonThatCannotBeAskedIsNotWaitedFor) {
  std::filesystem::remove(daemon_.directory() + "/com.tessel.Storix");
  giveAtOnce();
  FileCoordinator coordinator(options());
  EXPECT_TRUE(coordinator.read(file_).ok());
}

TEST_F(FileCoordinatorTest, AWriteIsAskedForAndEnded) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  auto claim = coordinator.write(file_);
  ASSERT_TRUE(claim.ok()) << claim.error().message();
  EXPECT_EQ(claim.value().end(), std::nullopt);
  EXPECT_EQ(claim.value().end(), std::nullopt) << "nothing is held any more";
  EXPECT_THAT(events(), ElementsAre("write file:///storage/a%20b nobody", "end of write 1"));
}

TEST_F(FileCoordinatorTest, ScopesEndTheirClaimsAndMoveThem) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  {
    FileClaim outer;
    EXPECT_FALSE(outer.isHeld());
    EXPECT_EQ(outer.end(), std::nullopt);
    {
      auto claim = coordinator.write(file_);
      ASSERT_TRUE(claim.ok());
      outer = std::move(claim.value());
      EXPECT_FALSE(claim.value().isHeld());  // NOLINT(bugprone-use-after-move)
    }
    EXPECT_TRUE(outer.isHeld());
    auto second = coordinator.read(file_);
    ASSERT_TRUE(second.ok());
    outer = std::move(second.value());
    waitForEvents(3);
    EXPECT_THAT(events().back(), HasSubstr("end of write 1"));
  }
  waitForEvents(4);
  EXPECT_EQ(events().back(), "end of read 2");
}

TEST_F(FileCoordinatorTest, AClaimThatEndsJustBeforeTheCoordinatorIsEndedOnTheWire) {
  giveAtOnce();
  {
    FileCoordinator coordinator(options());
    ASSERT_TRUE(coordinator.write(file_).ok());
  }
  waitForEvents(2);
  EXPECT_EQ(events().back(), "end of write 1");
}

TEST_F(FileCoordinatorTest, ClaimsThatFollowEachOtherShareAConnection) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  for (int i = 0; i < 5; ++i) ASSERT_EQ(coordinator.read(file_).value().end(), std::nullopt);
  const std::lock_guard lock(mutex_);
  EXPECT_EQ(connected_, 1);
}

TEST_F(FileCoordinatorTest, TheProvidersErrorComesUnchanged) {
  FileCoordinator coordinator(options());
  std::promise<SXError> failed;
  coordinator.read(file_, {}, [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  const SXError error("org.sample", 7, {{"description", "no such item"}});
  fail(takeWaiting(1).front(), error);
  EXPECT_EQ(failed.get_future().get(), error);
}

TEST_F(FileCoordinatorTest, ARefusalSaysWhyWithItsName) {
  FileCoordinator coordinator(options());
  std::promise<SXError> failed;
  coordinator.write(file_, {}, [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  takeWaiting(1).front().fail(wire::platformError::unavailable, "too many links");
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::refused));
  EXPECT_EQ(error.stringDetail("name"), std::string(wire::platformError::unavailable));
  EXPECT_THAT(error.message(), HasSubstr("too many links"));
}

TEST_F(FileCoordinatorTest, AnAnswerWithNeitherClaimNorErrorIsIncomplete) {
  FileCoordinator coordinator(options());
  std::promise<SXError> failed;
  coordinator.read(file_, {}, [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  fail(takeWaiting(1).front(), std::nullopt);
  EXPECT_TRUE(isClientError(failed.get_future().get(), ClientErrorCode::incompleteAnswer));
}

TEST_F(FileCoordinatorTest, ADeadlineWithdrawsTheWaitingClaimByItsConnection) {
  FileCoordinator coordinator(options());
  const auto claim = coordinator.write(file_, {.deadline = milliseconds(200)});
  ASSERT_FALSE(claim.ok());
  EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::timedOut)) << claim.error().message();
  waitUntil([this] { return closed_ == connected_; });
}

TEST_F(FileCoordinatorTest, ADeadlineThatHasPassedAsksNothing) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  for (const Deadline past : {Deadline(milliseconds(0)), Deadline(milliseconds(-5)), Deadline(Deadline::Clock::now()),
                              Deadline(Deadline::Clock::time_point::min())}) {
    EXPECT_TRUE(isClientError(coordinator.read(file_, {.deadline = past}).error(), ClientErrorCode::timedOut));
  }
  EXPECT_TRUE(events().empty());
}

TEST_F(FileCoordinatorTest, ADeadlineTooFarAwayNeverPasses) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  for (const Deadline far : {Deadline(std::chrono::hours::max()), Deadline(std::chrono::duration<double>(1e300)),
                             Deadline(Deadline::Clock::time_point::max())}) {
    EXPECT_TRUE(coordinator.read(file_, {.deadline = far}).ok());
  }
}

TEST_F(FileCoordinatorTest, CancellationWithdrawsTheWaitingClaimByItsConnection) {
  FileCoordinator coordinator(options());
  std::stop_source stop;
  std::promise<SXError> failed;
  coordinator.read(file_, {.cancellation = stop.get_token()},
                   [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  (void)takeWaiting(1);
  stop.request_stop();
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::cancelled)) << error.message();
  waitUntil([this] { return closed_ == 1; });
}

TEST_F(FileCoordinatorTest, CancelledBeforeItIsAskedForNothingIsAsked) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  std::stop_source stop;
  stop.request_stop();
  const auto claim = coordinator.read(file_, {.cancellation = stop.get_token()});
  EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::cancelled));
  EXPECT_TRUE(events().empty());
}

TEST_F(FileCoordinatorTest, CancellationOfAClaimThatIsHeldChangesNothing) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  std::stop_source stop;
  auto claim = coordinator.read(file_, {.cancellation = stop.get_token()});
  ASSERT_TRUE(claim.ok());
  stop.request_stop();
  EXPECT_EQ(claim.value().end(), std::nullopt);
}

TEST_F(FileCoordinatorTest, GivingUpOneClaimLeavesTheOthersHeldAndWaiting) {
  FileCoordinator coordinator(options());
  std::promise<Result<FileClaim>> first;
  coordinator.read(file_, {}, [&](Result<FileClaim> claim) { first.set_value(std::move(claim)); });
  give(takeWaiting(1).front(), 11);
  auto held = first.get_future().get();
  ASSERT_TRUE(held.ok());

  std::promise<Result<FileClaim>> third;
  std::stop_source stop;
  std::promise<SXError> failed;
  coordinator.write(file_, {.cancellation = stop.get_token()},
                    [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  (void)takeWaiting(1);
  coordinator.read(file_, {}, [&](Result<FileClaim> claim) { third.set_value(std::move(claim)); });
  const auto waiting = takeWaiting(1);
  stop.request_stop();
  failed.get_future().wait();
  give(waiting.front(), 13);
  auto late = third.get_future().get();
  ASSERT_TRUE(late.ok());
  EXPECT_FALSE(held.value().lost());
  EXPECT_EQ(late.value().end(), std::nullopt);
  EXPECT_EQ(held.value().end(), std::nullopt);
}

TEST_F(FileCoordinatorTest, MoreClaimsThanConnectionsShareThemAndOneGivenUpEndsWhenItComes) {
  FileCoordinator coordinator(options());
  std::mutex mutex;
  std::vector<FileClaim> claims;
  std::promise<void> all;
  const std::size_t held = 2 * FileCoordinator::connectionsAtMost - 1;
  for (std::size_t i = 0; i < held; ++i) {
    coordinator.read(file_, {}, [&](Result<FileClaim> claim) {
      const std::lock_guard lock(mutex);
      ASSERT_TRUE(claim.ok()) << claim.error().message();
      claims.push_back(std::move(claim.value()));
      if (claims.size() == held) all.set_value();
    });
  }
  std::vector<Reply> waiting = takeWaiting(held);
  std::stop_source stop;
  std::promise<SXError> failed;
  coordinator.write(file_, {.cancellation = stop.get_token()},
                    [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  const auto last = takeWaiting(1);
  stop.request_stop();
  failed.get_future().wait();
  {
    const std::lock_guard lock(mutex_);
    EXPECT_EQ(connected_, static_cast<int>(FileCoordinator::connectionsAtMost));
    EXPECT_EQ(closed_, 0) << "another claim is on that connection";
  }
  const std::size_t before = events().size();
  give(last.front(), 999);
  waitForEvents(before + 1);
  EXPECT_EQ(events().back(), "end of write 999");
  std::uint64_t number = 0;
  for (const Reply &reply : waiting) give(reply, ++number);
  all.get_future().wait();
  for (const FileClaim &claim : claims) EXPECT_TRUE(claim.isHeld());
  claims.clear();
  waitForEvents(before + 1 + held);
  // A few connections are kept.
  waitUntil([this] { return closed_ == connected_ - 4; });
}

TEST_F(FileCoordinatorTest, AConnectionOnWhichEveryClaimWasGivenUpIsClosed) {
  FileCoordinator coordinator(options());
  std::stop_source stop;
  std::mutex mutex;
  std::size_t cancelled = 0;
  std::promise<void> all;
  const std::size_t count = 3 * FileCoordinator::connectionsAtMost;
  for (std::size_t i = 0; i < count; ++i) {
    coordinator.write(file_, {.cancellation = stop.get_token()}, [&](const Result<FileClaim> &claim) {
      const std::lock_guard lock(mutex);
      ASSERT_TRUE(isClientError(claim.error(), ClientErrorCode::cancelled));
      if (++cancelled == count) all.set_value();
    });
  }
  (void)takeWaiting(count);
  stop.request_stop();
  all.get_future().wait();
  waitUntil(
      [this] { return connected_ == static_cast<int>(FileCoordinator::connectionsAtMost) && closed_ == connected_; });
}

TEST_F(FileCoordinatorTest, ClaimsPastTheLimitAreRefusedWithASentence) {
  FileCoordinator coordinator(options());
  std::promise<SXError> failed;
  for (std::size_t i = 0; i < FileCoordinator::claimsAtMost; ++i) {
    coordinator.read(file_, {}, [](const Result<FileClaim> &) {});
  }
  coordinator.read(file_, {}, [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::tooManyClaims)) << error.message();
  EXPECT_THAT(error.message(), HasSubstr("4096"));
}

TEST_F(FileCoordinatorTest, LosingTheConnectionLosesTheClaimsAndFailsThoseThatWait) {
  FileCoordinator coordinator(options());
  std::promise<Result<FileClaim>> first;
  coordinator.write(file_, {}, [&](Result<FileClaim> claim) { first.set_value(std::move(claim)); });
  give(takeWaiting(1).front(), 1);
  auto claim = first.get_future().get();
  std::promise<SXError> failed;
  coordinator.read(file_, {}, [&](const Result<FileClaim> &waiting) { failed.set_value(waiting.error()); });
  (void)takeWaiting(1);
  daemon_.closeConnections();
  EXPECT_TRUE(isClientError(failed.get_future().get(), ClientErrorCode::connectionLost));
  const Outcome ended = claim.value().end();
  ASSERT_TRUE(ended.has_value());
  EXPECT_TRUE(isClientError(*ended, ClientErrorCode::connectionLost)) << ended->message();
  EXPECT_FALSE(claim.value().isHeld());
  EXPECT_TRUE(claim.value().lost());
  EXPECT_TRUE(claim.value().end().has_value()) << "it says so again";
  giveAtOnce();
  EXPECT_TRUE(coordinator.read(file_).ok()) << "and it connects again";
}

TEST_F(FileCoordinatorTest, AnEndThatStaysUnansweredTimesOut) {
  giveAtOnce();
  change([this] { endsAreAnswered_ = false; });
  FileCoordinator coordinator(options(milliseconds(50)));
  auto claim = coordinator.read(file_);
  ASSERT_TRUE(claim.ok());
  const Outcome ended = claim.value().end();
  ASSERT_TRUE(ended.has_value());
  EXPECT_TRUE(isClientError(*ended, ClientErrorCode::timedOut));
}

TEST_F(FileCoordinatorTest, ClaimsOutliveTheCoordinatorAndAreLost) {
  giveAtOnce();
  auto coordinator = std::make_unique<FileCoordinator>(options());
  auto claim = coordinator->write(file_);
  ASSERT_TRUE(claim.ok());
  coordinator.reset();
  EXPECT_TRUE(claim.value().lost());
  EXPECT_TRUE(isClientError(*claim.value().end(), ClientErrorCode::connectionLost));
}

TEST_F(FileCoordinatorTest, DestroyingTheCoordinatorAnswersWhatIsOpen) {
  std::promise<SXError> failed;
  {
    FileCoordinator coordinator(options());
    coordinator.read(file_, {}, [&](const Result<FileClaim> &claim) { failed.set_value(claim.error()); });
  }
  auto answered = failed.get_future();
  ASSERT_EQ(answered.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  EXPECT_TRUE(isClientError(answered.get(), ClientErrorCode::connectionLost));
}

TEST_F(FileCoordinatorTest, AHandlerMayDestroyTheCoordinatorAndKeepItsClaim) {
  giveAtOnce();
  auto coordinator = std::make_shared<FileCoordinator>(options());
  std::promise<FileClaim> kept;
  FileCoordinator &used = *coordinator;
  used.read(file_, {}, [&kept, coordinator = std::move(coordinator)](Result<FileClaim> claim) mutable {
    coordinator.reset();
    kept.set_value(std::move(claim.value()));
  });
  FileClaim claim = kept.get_future().get();
  waitUntil([this] { return closed_ == 1; });
  (void)claim.end();
  EXPECT_FALSE(claim.isHeld());
}

TEST_F(FileCoordinatorTest, WaitingInAHandlerIsAnErrorAndTheClaimEnds) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  std::promise<std::pair<Outcome, bool>> inner;
  coordinator.read(file_, {}, [&](Result<FileClaim> claim) {
    const bool refused = !coordinator.read(file_).ok();
    inner.set_value({claim.value().end(), refused});
  });
  const auto [ended, refused] = inner.get_future().get();
  EXPECT_TRUE(refused);
  ASSERT_TRUE(ended.has_value());
  EXPECT_EQ(ended->code(), EDEADLK);
  waitForEvents(2);
  EXPECT_EQ(events().back(), "end of read 1");
}

TEST_F(FileCoordinatorTest, AClaimThatNobodyTakesEnds) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  coordinator.write(file_, {}, nullptr);
  waitForEvents(2);
  EXPECT_EQ(events().back(), "end of write 1");
}

TEST_F(FileCoordinatorTest, ThreadsClaimAndCancelSideBySide) {
  giveAtOnce();
  FileCoordinator coordinator(options());
  std::vector<std::thread> threads;
  threads.reserve(4);
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&coordinator, this] {
      for (int j = 0; j < 50; ++j) {
        std::stop_source stop;
        std::thread stopper([&stop] { stop.request_stop(); });
        auto claim = coordinator.read(file_, {.cancellation = stop.get_token()});
        if (claim.ok()) {
          EXPECT_EQ(claim.value().end(), std::nullopt);
        } else {
          EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::cancelled)) << claim.error().message();
        }
        stopper.join();
      }
    });
  }
  for (auto &thread : threads) thread.join();
}

TEST(FileCoordinatorWithoutDaemon, SaysThatNobodyListens) {
  FileCoordinator coordinator({"/nonexistent", std::chrono::seconds(60)});
  const auto claim = coordinator.read(*URL::fileURLWithPath("/a"));
  EXPECT_TRUE(isClientError(claim.error(), ClientErrorCode::notReachable));
  EXPECT_THAT(claim.error().message(), HasSubstr("/nonexistent/com.tessel.Platform"));
}

TEST(FileCoordinatorPaths, OnlyAbsoluteOnesAreTaken) {
  EXPECT_EQ(FileCoordinator::fileURL("/a b").value().absoluteString(), "file:///a%20b");
  for (const std::string &path :
       {std::string("report"), std::string("./report"), std::string(), std::string("/a\0b", 4)}) {
    const auto url = FileCoordinator::fileURL(path);
    ASSERT_FALSE(url.ok()) << path;
    EXPECT_TRUE(isClientError(url.error(), ClientErrorCode::invalidPath));
    EXPECT_THAT(url.error().message(), HasSubstr("absolute path"));
  }
}

}  // namespace
}  // namespace storix
