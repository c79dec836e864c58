#include "platform/linux/coordination/FileCoordination.h"

#include <gmock/gmock.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/ThreadPool.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

URL urlOf(const std::string &path, bool isDirectory = false) { return *URL::fileURLWithPath(path, isDirectory); }

/// A provider whose callbacks the test holds back, and which withdraws itself if told to.
class ThreadedProvider : public KTStorix {
 public:
  ThreadedProvider(Executor &executor, URL url)
      : queue_(OperationQueue::create(executor, "threaded")), url_(std::move(url)) {}

  std::optional<URL> _providedItemsURL() override { return url_; }
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override { return queue_; }
  [[nodiscard]] bool answers(OptionalMember) const override { return false; }
  void _provideItemAtURL(std::optional<URL> /*url*/, Completion completionHandler) override {
    {
      std::unique_lock lock(mutex_);
      entered_ = true;
      changed_.notify_all();
      changed_.wait(lock, [this] { return !held_; });
    }
    if (withdraw) withdraw();
    ended_ = true;
    completionHandler(std::nullopt);
  }
  void hold() {
    const std::lock_guard lock(mutex_);
    held_ = true;
  }
  void letGo() {
    const std::lock_guard lock(mutex_);
    held_ = false;
    changed_.notify_all();
  }
  void waitUntilEntered() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return entered_; });
  }
  [[nodiscard]] bool hasEnded() const { return ended_; }

  std::function<void()> withdraw;

 private:
  std::shared_ptr<OperationQueue> queue_;
  URL url_;
  std::mutex mutex_;
  std::condition_variable changed_;
  bool held_ = false;
  bool entered_ = false;
  std::atomic<bool> ended_ = false;
};

/// Counts outcomes, and waits for them.
class Outcomes {
 public:
  ClaimHandler handler() {
    return [this](const ClaimOutcome &outcome) {
      const std::lock_guard lock(mutex_);
      outcomes_.push_back(outcome);
      changed_.notify_all();
    };
  }
  ClaimOutcome waitForOne() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return !outcomes_.empty(); });
    const ClaimOutcome outcome = outcomes_.front();
    outcomes_.erase(outcomes_.begin());
    return outcome;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<ClaimOutcome> outcomes_;
};

TEST(FileCoordinationThreads, WithdrawalWaitsForACallbackThatIsBeingMade) {
  const TestDirectory directory;
  ThreadPool pool(2);
  FileCoordination coordination(pool, nullptr);
  const auto provider = std::make_shared<ThreadedProvider>(pool, urlOf(directory.path(), true));
  coordination.addProvider(provider);
  provider->hold();
  Outcomes outcomes;
  const auto claims = coordination.claimsOf(nullptr);
  claims->beginRead(urlOf(directory / "one"), std::nullopt, outcomes.handler());
  provider->waitUntilEntered();
  std::thread withdrawing([&coordination, &provider] {
    coordination.removeProvider(provider);
    EXPECT_TRUE(provider->hasEnded());
  });
  provider->letGo();
  withdrawing.join();
  EXPECT_TRUE(std::holds_alternative<ClaimIdentifier>(outcomes.waitForOne()));
}

TEST(FileCoordinationThreads, ProviderMayWithdrawItselfInsideItsCallback) {
  const TestDirectory directory;
  ThreadPool pool(2);
  FileCoordination coordination(pool, nullptr);
  const auto provider = std::make_shared<ThreadedProvider>(pool, urlOf(directory.path(), true));
  provider->withdraw = [&coordination, weak = std::weak_ptr(provider)] { coordination.removeProvider(weak.lock()); };
  coordination.addProvider(provider);
  Outcomes outcomes;
  const auto claims = coordination.claimsOf(nullptr);
  claims->beginRead(urlOf(directory / "one"), std::nullopt, outcomes.handler());
  EXPECT_TRUE(std::holds_alternative<ClaimIdentifier>(outcomes.waitForOne()));
}

TEST(FileCoordinationThreads, ReadersAndWritersOfManyConnectionsExcludeEachOther) {
  const TestDirectory directory;
  ThreadPool pool(4);
  FileCoordination coordination(pool, nullptr);
  const auto provider = std::make_shared<ThreadedProvider>(pool, urlOf(directory.path(), true));
  std::atomic<int> readers = 0;
  std::atomic<int> writers = 0;
  std::vector<std::thread> threads;
  threads.reserve(4);
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&coordination, &directory, &readers, &writers, thread] {
      for (int i = 0; i < 200; ++i) {
        const auto claims = coordination.claimsOf(nullptr);
        Outcomes outcomes;
        if ((i + thread) % 3 == 0) {
          claims->beginWrite(urlOf(directory / "one"), std::nullopt, outcomes.handler());
          const ClaimOutcome outcome = outcomes.waitForOne();
          EXPECT_EQ(writers.fetch_add(1), 0);
          EXPECT_EQ(readers.load(), 0);
          writers.fetch_sub(1);
          if (i % 2 == 0) {
            EXPECT_EQ(claims->endWrite(std::get<ClaimIdentifier>(outcome)), std::nullopt);
          }
        } else {
          claims->beginRead(urlOf(directory / "one"), std::nullopt, outcomes.handler());
          const ClaimOutcome outcome = outcomes.waitForOne();
          readers.fetch_add(1);
          EXPECT_EQ(writers.load(), 0);
          readers.fetch_sub(1);
          if (i % 2 == 0) {
            EXPECT_EQ(claims->endRead(std::get<ClaimIdentifier>(outcome)), std::nullopt);
          }
        }
      }
    });
  }
  // Providers come and go meanwhile.
  for (int i = 0; i < 100; ++i) {
    coordination.addProvider(provider);
    coordination.removeProvider(provider);
  }
  for (std::thread &thread : threads) thread.join();
}

}  // namespace
}  // namespace storix::linuxhost
