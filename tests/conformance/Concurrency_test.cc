// What happens when requests, refreshes, re-reads and ends of connections meet, on threads. Nothing here
// depends on who wins: each case says what must hold whoever does.

#include <algorithm>
#include <atomic>
#include <thread>

#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using Reply = std::shared_ptr<fake::FakeReply>;

constexpr const char *identify = "IdentifierForItemAtURL";
constexpr const char *file = "/home/u/Library/Storix/AccessControl.kvs";
constexpr int requestCount = 24;

/// The item's identifier is the last component of its URL.
VendorAnswer nameTheItem(const Arguments &arguments) {
  const std::string text = arguments.at(0)->url()->absoluteString();
  return VendorAnswer::values({Argument(), Argument(text.substr(text.rfind('/') + 1))});
}
VendorAnswer nameTheItemLater(const Arguments &arguments) { return nameTheItem(arguments).held(); }

class ConcurrencyTest : public ServicerTest {
 protected:
  ConcurrencyTest() : ServicerTest({fake::FakeExecutor::Kind::threads, "/home/u"}) {}

  void SetUp() override {
    ServicerTest::SetUp();
    for (const char *identifier : {"org.a", "org.b"}) process(identifier).setAnswer(identify, nameTheItem);
    connect({{writeEntitlement, true}}, "org.caller");
  }

  static std::string item(int number) { return "i" + std::to_string(number); }
  static Arguments request(int number, const char *provider = "org.a") {
    return arguments(itemURL(provider, item(number)), provider, "org.app");
  }

  /// One request for each item, none waited for.
  std::vector<Reply> callForEach(std::string_view name) {
    std::vector<Reply> replies;
    replies.reserve(requestCount);
    for (int i = 0; i < requestCount; ++i) replies.push_back(client_->call(name, request(i)));
    return replies;
  }
  static void expectOneAnswerEach(const std::vector<Reply> &replies, const std::optional<SXError> &error) {
    for (const Reply &reply : replies) {
      ASSERT_EQ(reply->answers().size(), 1U);
      EXPECT_EQ(reply->answer().refusal, std::nullopt);
      EXPECT_EQ(reply->error(0), error);
    }
  }

  /// Every item stands once in the file and in the store.
  void expectEveryGrant() {
    const std::optional<Value> content = platform().files().content(file);
    ASSERT_TRUE(content);
    const List &items =
        *content->dictionary()->at("org.a").dictionary()->at("org.app").dictionary()->at("AllowedItemIDs").list();
    EXPECT_EQ(items.size(), static_cast<std::size_t>(requestCount));
    for (int i = 0; i < requestCount; ++i) {
      EXPECT_EQ(std::count(items.begin(), items.end(), Value(item(i))), 1) << item(i);
      EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", item(i), "org.app")) << item(i);
    }
  }

  void grantAll() {
    for (int i = 0; i < requestCount; ++i) grant("org.a", item(i), "org.app");
  }

  [[nodiscard]] std::size_t placeOf(std::string_view line, std::size_t after = 0) {
    const std::vector<std::string> lines = platform().trace().lines();
    for (std::size_t i = after; i < lines.size(); ++i) {
      if (lines[i].starts_with(line)) return i;
    }
    ADD_FAILURE() << "no line \"" << line << "\"";
    return lines.size();
  }
};

TEST_F(ConcurrencyTest, GrantsOfOneClientSideBySideAreAllMadeAndAnsweredOnce) {
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::extendSandboxName);
  runUntilIdle();
  ASSERT_EQ(process("org.a").heldAnswerCount(), static_cast<std::size_t>(requestCount));
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  expectOneAnswerEach(replies, std::nullopt);
  expectEveryGrant();
  EXPECT_EQ(platform().files().writeCount(file), static_cast<std::size_t>(requestCount));
}

TEST_F(ConcurrencyTest, TheSameGrantManyTimesIsWrittenOnce) {
  process("org.a").setAnswer(identify, nameTheItemLater);
  std::vector<Reply> replies;
  replies.reserve(requestCount);
  for (int i = 0; i < requestCount; ++i) replies.push_back(client_->call(SXDaemon::extendSandboxName, request(0)));
  runUntilIdle();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  expectOneAnswerEach(replies, std::nullopt);
  EXPECT_EQ(platform().files().writeCount(file), 1U);
}

TEST_F(ConcurrencyTest, RequestsOfEveryKindSideBySideAreAnsweredOnceEach) {
  grantAll();
  std::vector<Reply> replies;
  for (int i = 0; i < requestCount; ++i) {
    platform().sandbox().allowAccess(client_->auditToken(), itemURL("org.a", item(i)).path());
    replies.push_back(client_->call(SXDaemon::wakeUpName));
    replies.push_back(client_->call(SXDaemon::startProvidingName, request(i)));
    replies.push_back(client_->call(SXDaemon::providersName));
    replies.push_back(client_->call(SXDaemon::providePlaceholderName, request(i)));
    replies.push_back(client_->call(SXDaemon::bookmarkableStringName, packArguments<URL>(itemURL("org.a", item(i)))));
    replies.push_back(client_->call(SXDaemon::extendBookmarkName,
                                    packArguments<URL, std::string>(itemURL("org.a", item(i)), "org.app")));
    replies.push_back(client_->call(SXDaemon::extendSandboxName, request(i)));
  }
  runUntilIdle();
  for (const Reply &reply : replies) {
    ASSERT_EQ(reply->answers().size(), 1U);
    EXPECT_EQ(reply->error(0), std::nullopt);
    EXPECT_EQ(reply->error(1), std::nullopt);
  }
  expectEveryGrant();
}

TEST_F(ConcurrencyTest, LookupsDuringRefreshesAlwaysFindAProviderThatStays) {
  std::atomic<bool> done = false;
  const auto lookUp = [&done] {
    const URL url = itemURL("org.a", "x");
    do {
      const std::shared_ptr<SXExtensionStorix> owner = SXExtensionStorix::providerForURL(url);
      EXPECT_TRUE(owner && owner->identifier() == "org.a");
      EXPECT_NE(SXExtensionStorix::providerWithIdentifier("org.a"), nullptr);
      EXPECT_EQ(SXExtensionStorix::providersInfo().count("org.a"), 1U);
    } while (!done);
  };
  std::thread one(lookUp);
  std::thread two(lookUp);
  for (int version = 2; version < 8; ++version) {
    platform().extensions().install(fake::completeProvider("org.a", std::to_string(version)));
    if (version % 2 == 0) {
      platform().extensions().remove("org.b");
    } else {
      platform().extensions().install(fake::completeProvider("org.b"));
    }
    platform().extensions().deliver();
    runUntilIdle();
  }
  done = true;
  one.join();
  two.join();
  // A lookup may have been what the last refresh was waiting for.
  runUntilIdle();
  EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 2U);
}

TEST_F(ConcurrencyTest, OfTwoRefreshesBackToBackTheSecondStartsWhenTheFirstHasRegistered) {
  platform().extensions().install(fake::completeProvider("org.c"));
  platform().extensions().deliver();
  platform().extensions().install(fake::completeProvider("org.d"));
  platform().extensions().remove("org.b");
  platform().extensions().deliver();
  runUntilIdle();
  const std::size_t first = placeOf("log info [INFO] Updating provider list.");
  const std::size_t registered = placeOf("log info [INFO] Registered storix provider extension org.c");
  const std::size_t second = placeOf("log info [INFO] Updating provider list.", first + 1);
  EXPECT_LT(first, registered);
  EXPECT_LT(registered, second);
  EXPECT_LT(second, placeOf("log info [INFO] Registered storix provider extension org.d"));
  EXPECT_EQ(platform().trace().count("addProvider"), 2U);
  EXPECT_EQ(platform().trace().count("removeProvider"), 1U);
  const Dictionary list = SXExtensionStorix::providersInfo();
  EXPECT_EQ(list.size(), 3U);
  EXPECT_EQ(list.count("org.b"), 0U);
}

TEST_F(ConcurrencyTest, RequestsInFlightKeepTheProviderThatIsReplaced) {
  grantAll();
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::startProvidingName);
  runUntilIdle();
  trace();
  platform().extensions().install(fake::completeProvider("org.a", "2"));
  platform().extensions().deliver();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  expectOneAnswerEach(replies, std::nullopt);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a version 1"), static_cast<std::size_t>(requestCount));
  // Its registration.
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a version 2"), 1U);

  process("org.a").setAnswer(identify, nameTheItem);
  trace();
  expectOneAnswerEach({call(SXDaemon::startProvidingName, request(0))}, std::nullopt);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a version 1"), 0U);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a version 2"), 2U);
}

TEST_F(ConcurrencyTest, AReadOfTheFileDuringGrantsLosesNone) {
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::extendSandboxName);
  runUntilIdle();
  std::thread reader([] {
    for (int i = 0; i < requestCount; ++i) store()->rereadAccessControl();
  });
  process("org.a").releaseAllAnswers();
  reader.join();
  runUntilIdle();
  expectOneAnswerEach(replies, std::nullopt);
  expectEveryGrant();
}

TEST_F(ConcurrencyTest, AClientGoneBeforeItsAnswersGetsNoneAndItsGrantsStay) {
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::extendSandboxName);
  runUntilIdle();
  client_->close();
  client_.reset();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  for (const Reply &reply : replies) EXPECT_FALSE(reply->isAnswered());
  expectEveryGrant();
}

TEST_F(ConcurrencyTest, AClientThatGoesWhileItIsAnsweredGetsAtMostOneAnswerEach) {
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::extendSandboxName);
  runUntilIdle();
  process("org.a").releaseAllAnswers();
  client_->close();
  client_.reset();
  runUntilIdle();
  for (const Reply &reply : replies) EXPECT_LE(reply->answers().size(), 1U);
  expectEveryGrant();
}

TEST_F(ConcurrencyTest, AServerThatGoesWithRequestsInFlightAllowsNothingMore) {
  grantAll();
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::startProvidingName);
  runUntilIdle();
  server_.reset();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  expectOneAnswerEach(replies, SXNotPermittedError());
}

TEST_F(ConcurrencyTest, AServerThatGoesWhileRequestsAreAnsweredAllowsOrRefusesEach) {
  grantAll();
  process("org.a").setAnswer(identify, nameTheItemLater);
  const std::vector<Reply> replies = callForEach(SXDaemon::startProvidingName);
  runUntilIdle();
  process("org.a").releaseAllAnswers();
  server_.reset();
  runUntilIdle();
  for (const Reply &reply : replies) {
    ASSERT_EQ(reply->answers().size(), 1U);
    EXPECT_TRUE(reply->error(0) == std::nullopt || reply->error(0) == SXNotPermittedError());
  }
}

}  // namespace
}  // namespace storix
