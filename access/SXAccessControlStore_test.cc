#include "access/SXAccessControlStore.h"

#include <gmock/gmock.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/fake/FakeHostTest.h"

namespace storix {
namespace {

using fake::FakeExecutor;
using fake::LogLine;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

constexpr const char *directory = "/home/u/Library/Storix";
constexpr const char *file = "/home/u/Library/Storix/AccessControl.kvs";
constexpr const char *firstUnlock = "com.tessel.mobile.vaultkeepd.first_unlock";

Dictionary grants(const std::string &provider, const std::string &consumer, List items) {
  return {{provider, Dictionary{{consumer, Dictionary{{"AllowedItemIDs", std::move(items)}}}}}};
}

class SXAccessControlStoreTest : public fake::FakeHostTest {
 protected:
  std::vector<std::string> trace() { return platform().trace().take(); }
  std::optional<Value> fileContent() { return platform().files().content(file); }

  std::shared_ptr<SXAccessControlStore> store() { return SXAccessControlStore::sharedStore(); }
};

TEST_F(SXAccessControlStoreTest, FirstUseObservesTheUnlockMakesTheDirectoryAndFindsNoFile) {
  store();
  EXPECT_THAT(trace(), ElementsAre("createSerialQueue SXAccessControlStore sync queue",
                                   std::string("addSystemNotificationObserver ") + firstUnlock, "homeDirectory",
                                   std::string("fileExists ") + directory,
                                   std::string("createDirectory ") + directory + " with intermediates",
                                   std::string("fileExists ") + file));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
  EXPECT_THAT(trace(), IsEmpty());
}

TEST_F(SXAccessControlStoreTest, AnExistingFileIsReadWithEverythingChangeable) {
  platform().files().writeFile(file, grants("p", "c", {"i"}));
  store();
  EXPECT_THAT(trace(), ElementsAre("createSerialQueue SXAccessControlStore sync queue",
                                   std::string("addSystemNotificationObserver ") + firstUnlock, "homeDirectory",
                                   std::string("fileExists ") + directory, std::string("fileExists ") + file,
                                   std::string("openFileInputStream ") + file,
                                   std::string("readKeyedValueStream ") + file + " containersAndLeaves",
                                   "log info [INFO] Successfully read access control from disk."));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, SharedStoreIsOneStore) {
  EXPECT_EQ(SXAccessControlStore::sharedStore(), SXAccessControlStore::sharedStore());
  EXPECT_EQ(platform().trace().count("createSerialQueue"), 1U);
  EXPECT_EQ(store()->syncQueue()->label(), "SXAccessControlStore sync queue");
}

TEST_F(SXAccessControlStoreTest, APlainFileInPlaceOfTheDirectoryCountsAsPresent) {
  platform().files().writeFile(directory, Dictionary());
  store();
  EXPECT_EQ(platform().trace().count("createDirectory"), 0U);
}

TEST_F(SXAccessControlStoreTest, ADirectoryThatCannotBeMadeIsReportedAndNotTriedAgain) {
  const SXError error("posix", 13, {{"description", "no room"}});
  platform().files().setCreateDirectoryError(directory, error);
  store();
  EXPECT_THAT(platform().log().take(),
              ElementsAre(LogLine{LogSeverity::fault,
                                  "[ERROR] Cannot create access control directory. Error: " + logDescription(error)}));
  trace();
  store()->allowProviderWithIdentifier("p", "i", "c");
  store()->syncQueueReadAccessControl();
  EXPECT_THAT(
      trace(),
      ElementsAre("log info [INFO] Allowing provider ID p to provide item ID “i” to consumer ID c",
                  "log info [INFO] Committing access control list", StartsWith("writeKeyedValueFileAtomically"),
                  std::string("log fault [ERROR] Could not write to ") + file, std::string("fileExists ") + file));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, AStreamThatCannotBeMadeLeavesTheMapAsItIs) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  platform().files().writeFile(file, grants("q", "c", {"i"}));
  platform().files().setUnopenable(file);
  trace();
  store()->syncQueueReadAccessControl();
  EXPECT_THAT(trace(), ElementsAre(std::string("fileExists ") + file, std::string("openFileInputStream ") + file));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, CorruptFileIsReportedAndLeftInPlaceUntilTheNextGrant) {
  platform().files().writeCorruptFile(file, "{ nonsense");
  store();
  EXPECT_THAT(
      platform().log().take(),
      ElementsAre(::testing::AllOf(
          ::testing::Field(&LogLine::severity, LogSeverity::fault),
          ::testing::Field(&LogLine::text, StartsWith("[ERROR] Cannot read access control from disk. Error: ")))));
  EXPECT_EQ(platform().files().corruptBytes(file), "{ nonsense");
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
  store()->allowProviderWithIdentifier("p", "i", "c");
  EXPECT_EQ(fileContent(), Value(grants("p", "c", {"i"})));
}

TEST_F(SXAccessControlStoreTest, AReadErrorEmptiesTheMapInMemory) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  const SXError error("posix", 5, {{"description", "the disk says no"}});
  platform().files().setReadError(file, error);
  platform().log().take();
  store()->syncQueueReadAccessControl();
  EXPECT_THAT(platform().log().texts(),
              ElementsAre("[ERROR] Cannot read access control from disk. Error: " + logDescription(error)));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, AFileOfAnotherShapeIsTreatedLikeAnUnreadableOne) {
  platform().files().writeFile(file, Dictionary{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", "i"}}}}}});
  store();
  EXPECT_THAT(platform().log().texts(),
              ElementsAre(::testing::AllOf(StartsWith("[ERROR] Cannot read access control from disk. Error: "),
                                           HasSubstr("a string as AllowedItemIDs for consumer “c” of provider “p”"))));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, AllowLogsCommitsAndWrites) {
  store();
  trace();
  store()->allowProviderWithIdentifier("org.p", "a/b", "org.c");
  EXPECT_THAT(trace(),
              ElementsAre("log info [INFO] Allowing provider ID org.p to provide item ID “a/b” to consumer ID org.c",
                          "log info [INFO] Committing access control list",
                          std::string("writeKeyedValueFileAtomically ") + file +
                              " {org.p = {org.c = {AllowedItemIDs = (a/b)}}}"));
  EXPECT_EQ(fileContent(), Value(grants("org.p", "org.c", {"a/b"})));
}

TEST_F(SXAccessControlStoreTest, AllowingTwiceSaysSoAndWritesOnce) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  trace();
  store()->allowProviderWithIdentifier("p", "i", "c");
  EXPECT_THAT(trace(),
              ElementsAre("log info [INFO] Provider ID p is already allowed to provide item ID “i” to consumer ID c."));
  EXPECT_EQ(platform().files().writeCount(file), 1U);
}

TEST_F(SXAccessControlStoreTest, AFailedWriteIsReportedAndTheGrantStaysInMemory) {
  platform().files().setUnwritable(file);
  store()->allowProviderWithIdentifier("p", "i", "c");
  EXPECT_TRUE(platform().log().contains(LogSeverity::fault, std::string("[ERROR] Could not write to ") + file));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
  platform().files().setUnwritable(file, false);
  store()->allowProviderWithIdentifier("p", "j", "c");
  EXPECT_EQ(fileContent(), Value(grants("p", "c", {"i", "j"})));
}

TEST_F(SXAccessControlStoreTest, AGrantIsForOneConsumerOneItemOneProvider) {
  store()->allowProviderWithIdentifier("p", "i", "c1");
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c1"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c2"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "j", "c1"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("q", "i", "c1"));
  EXPECT_TRUE(store()->isProviderIdentifier("p", "i", "c1"));
  EXPECT_FALSE(store()->isProviderIdentifier("p", "i", "c2"));
}

TEST_F(SXAccessControlStoreTest, AQueryWithAnAbsentIdentifierIsFalse) {
  store()->allowProviderWithIdentifier("", "", "");
  EXPECT_FALSE(store()->isProviderWithIdentifier(std::nullopt, "", ""));
  EXPECT_FALSE(store()->isProviderWithIdentifier("", std::nullopt, ""));
  EXPECT_FALSE(store()->isProviderWithIdentifier("", "", std::nullopt));
  store()->allowProviderWithIdentifier("p", "i", "");
  EXPECT_FALSE(store()->isProviderIdentifier(std::nullopt, "i", ""));
  EXPECT_FALSE(store()->isProviderIdentifier("p", std::nullopt, ""));
  EXPECT_FALSE(store()->isProviderIdentifier("p", "i", std::nullopt));
}

TEST_F(SXAccessControlStoreTest, AScreenedQueryDoesNotTouchTheQueue) {
  const std::shared_ptr<SXAccessControlStore> subject = store();
  subject->setSyncQueue(nullptr);
  EXPECT_FALSE(subject->isProviderWithIdentifier(std::nullopt, "i", "c"));
  EXPECT_FALSE(subject->isProviderIdentifier("", "i", "c"));
  EXPECT_FALSE(subject->isProviderIdentifier("p", "", "c"));
  EXPECT_FALSE(subject->isProviderIdentifier("p", "i", std::nullopt));
}

TEST_F(SXAccessControlStoreTest, EmptyIdentifiersAreLookedUpByOneQueryAndRefusedByTheOther) {
  store()->allowProviderWithIdentifier("", "i", "c");
  store()->allowProviderWithIdentifier("p", "", "c");
  store()->allowProviderWithIdentifier("p", "i", "");
  EXPECT_TRUE(store()->isProviderWithIdentifier("", "i", "c"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "", "c"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", ""));
  EXPECT_FALSE(store()->isProviderIdentifier("", "i", "c"));
  EXPECT_FALSE(store()->isProviderIdentifier("p", "", "c"));
  EXPECT_TRUE(store()->isProviderIdentifier("p", "i", ""));
}

TEST_F(SXAccessControlStoreTest, DisallowLogsPrunesAndCommits) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  trace();
  store()->disallowProviderWithIdentifier("p", "i", "c");
  EXPECT_THAT(trace(), ElementsAre("log info [INFO] No longer allowing provider ID p to provide item ID “i” to "
                                   "consumer ID c",
                                   "log info [INFO] Committing access control list",
                                   std::string("writeKeyedValueFileAtomically ") + file + " {}"));
  EXPECT_EQ(fileContent(), Value(Dictionary()));
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, DisallowingWhatIsNotGrantedDoesNothing) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  trace();
  store()->disallowProviderWithIdentifier("q", "i", "c");
  store()->disallowProviderWithIdentifier("p", "i", "d");
  store()->disallowProviderWithIdentifier("p", "j", "c");
  store()->disallowProviderWithIdentifier(std::nullopt, "i", "c");
  store()->disallowProviderWithIdentifier("p", std::nullopt, "c");
  store()->disallowProviderWithIdentifier("p", "i", std::nullopt);
  EXPECT_THAT(trace(), IsEmpty());
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, ARereadIsSubmittedAndReplacesMemory) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  platform().files().writeFile(file, grants("q", "c", {"i"}));
  trace();
  store()->rereadAccessControl();
  EXPECT_THAT(trace(), IsEmpty());
  // What is asked after it sees its outcome.
  EXPECT_FALSE(store()->isProviderWithIdentifier("p", "i", "c"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("q", "i", "c"));
}

TEST_F(SXAccessControlStoreTest, EveryFirstUnlockNotificationReadsTheFileAgain) {
  store();
  trace();
  for (const char *provider : {"p", "q"}) {
    platform().files().writeFile(file, grants(provider, "c", {"i"}));
    platform().postNotification(firstUnlock);
    runUntilIdle();
    EXPECT_TRUE(store()->isProviderWithIdentifier(provider, "i", "c"));
    EXPECT_THAT(trace(), ElementsAre(std::string("notification ") + firstUnlock, std::string("fileExists ") + file,
                                     std::string("openFileInputStream ") + file,
                                     std::string("readKeyedValueStream ") + file + " containersAndLeaves",
                                     "log info [INFO] Successfully read access control from disk."));
  }
}

TEST_F(SXAccessControlStoreTest, ARereadWithoutAFileKeepsTheGrantsAndTheNextGrantWritesThemBack) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  platform().files().remove(file);
  store()->rereadAccessControl();
  runUntilIdle();
  EXPECT_TRUE(store()->isProviderWithIdentifier("p", "i", "c"));
  store()->allowProviderWithIdentifier("p", "j", "c");
  EXPECT_EQ(fileContent(), Value(grants("p", "c", {"i", "j"})));
}

TEST_F(SXAccessControlStoreTest, GrantsOutliveTheStoreInTheFile) {
  store()->allowProviderWithIdentifier("p", "i", "c");
  const std::shared_ptr<SXAccessControlStore> another = SXAccessControlStore::init();
  EXPECT_TRUE(another->isProviderWithIdentifier("p", "i", "c"));
}

using SXAccessControlStoreDeathTest = SXAccessControlStoreTest;

TEST_F(SXAccessControlStoreDeathTest, AllowingWithAnAbsentIdentifierEndsTheProcess) {
  store();
  const char *message = "programming error.*a grant needs a provider, an item and a consumer";
  EXPECT_DEATH(store()->allowProviderWithIdentifier(std::nullopt, "i", "c"), message);
  EXPECT_DEATH(store()->allowProviderWithIdentifier("p", std::nullopt, "c"), message);
  EXPECT_DEATH(store()->allowProviderWithIdentifier("p", "i", std::nullopt), message);
}

class ThreadedAccessControlStoreTest : public fake::FakeHostTest {
 protected:
  ThreadedAccessControlStoreTest() : FakeHostTest({FakeExecutor::Kind::threads, "/home/u"}) {}
};

TEST_F(ThreadedAccessControlStoreTest, ConcurrentFirstCallersGetTheSameStore) {
  constexpr std::size_t threadCount = 8;
  std::vector<std::shared_ptr<SXAccessControlStore>> stores(threadCount);
  std::vector<std::thread> threads;
  threads.reserve(threadCount);
  for (std::size_t i = 0; i < threadCount; ++i) {
    threads.emplace_back([&stores, i] { stores[i] = SXAccessControlStore::sharedStore(); });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_THAT(stores, ::testing::Each(SXAccessControlStore::sharedStore()));
  EXPECT_EQ(platform().trace().count("createSerialQueue"), 1U);
}

TEST_F(ThreadedAccessControlStoreTest, GrantsQueriesAndRereadsFromManyThreadsAreAppliedOneByOne) {
  constexpr int threadCount = 4;
  constexpr int grantCount = 25;
  const std::shared_ptr<SXAccessControlStore> store = SXAccessControlStore::sharedStore();
  std::atomic<int> seen = 0;
  std::vector<std::thread> threads;
  threads.reserve(threadCount);
  for (int t = 0; t < threadCount; ++t) {
    threads.emplace_back([&store, &seen, t] {
      const std::string consumer = "c" + std::to_string(t);
      for (int i = 0; i < grantCount; ++i) {
        store->allowProviderWithIdentifier("p", std::to_string(i), consumer);
        // A grant is on the disk before its call returns, so a re-read cannot lose it.
        store->rereadAccessControl();
        if (store->isProviderIdentifier("p", std::to_string(i), consumer)) ++seen;
      }
    });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(seen, threadCount * grantCount);
  EXPECT_EQ(platform().files().writeCount(file), static_cast<std::size_t>(threadCount * grantCount));
}

}  // namespace
}  // namespace storix
