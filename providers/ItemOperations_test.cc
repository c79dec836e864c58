#include <functional>
#include <ostream>

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

constexpr const char *url = "file:///x/report.txt";

/// One member of the family as its callers and the extension see it.
struct Member {
  const char *name;
  std::function<void(SXExtensionStorix &, ProvidersTest *, bool withCompletion)> call;
  std::string ownName;
  std::string message;
  std::string subject;
  /// The extension's answer on success and on an error, and what the completion gets then.
  std::function<Arguments(std::optional<SXError>)> answer;
  std::string successValues;
  std::function<std::string(const std::string &error)> failureValues;
  std::string requestFailed;
  std::string replyFailed;
  std::string succeeded;

  friend void PrintTo(const Member &member, std::ostream *out) { *out << member.name; }
};

Argument argument(std::optional<SXError> error) { return error ? Argument(*std::move(error)) : Argument(); }

class ItemOperationsTest : public ProvidersTest, public ::testing::WithParamInterface<Member> {
 public:
  using ProvidersTest::recording;

 protected:
  /// The line with its placeholders filled in turn.
  static std::string filled(std::string line, const std::vector<std::string> &arguments) {
    for (const std::string &argument : arguments) line.replace(line.find("%@"), 2, argument);
    return line;
  }

  void perform(bool withCompletion = true) { GetParam().call(*provider_, this, withCompletion); }

  void SetUp() override { provider_ = makeProvider("org.a"); }
  void TearDown() override {
    provider_.reset();
    ProvidersTest::TearDown();
  }

  [[nodiscard]] std::vector<std::string> begin() const {
    return {"log debug [DEBUG] " + GetParam().ownName, "beginExtensionRequest org.a version 1 request-1"};
  }
  [[nodiscard]] std::vector<std::string> beginAndSend() const {
    std::vector<std::string> lines = begin();
    lines.insert(lines.end(),
                 {"begun request-1", "log debug [DEBUG] Beginning extension request.",
                  "extensionContextForRequest org.a version 1 request-1", "remoteProxyWithErrorHandler request-1",
                  "send request-1 " + GetParam().message + " (" + GetParam().subject + ")"});
    return lines;
  }
  [[nodiscard]] std::string requestFailed(const SXError &error) const {
    return "log fault " + filled(GetParam().requestFailed, {GetParam().subject, "org.a", text(error)});
  }
  [[nodiscard]] std::string completionWith(const SXError &error) const {
    return "completion " + GetParam().failureValues(text(SXPluginOperationFailedError(error))) + " on platform thread";
  }
  static std::string cancel() { return "cancelExtensionRequest org.a version 1 request-1"; }

  std::shared_ptr<SXExtensionStorix> provider_;
};

/// The lines of `first` and then these.
std::vector<std::string> followedBy(std::vector<std::string> first, const std::vector<std::string> &rest) {
  first.insert(first.end(), rest.begin(), rest.end());
  return first;
}

TEST_P(ItemOperationsTest, Success) {
  const Arguments answer = GetParam().answer(std::nullopt);
  process("org.a").setAnswer(GetParam().message, VendorAnswer::values(answer));
  perform();
  EXPECT_THAT(platform().trace().lines(), ElementsAreArray(begin()));
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  beginAndSend(), {"answer request-1 " + GetParam().message + " " + fake::traced(answer),
                                   "log debug " + GetParam().succeeded,
                                   "completion " + GetParam().successValues + " on platform thread", cancel()})));
}

TEST_P(ItemOperationsTest, AnErrorInTheReplyIsWrappedAndEndsTheRequest) {
  const SXError error = someError("no such item");
  const Arguments answer = GetParam().answer(error);
  process("org.a").setAnswer(GetParam().message, VendorAnswer::values(answer));
  perform();
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(followedBy(
                           beginAndSend(),
                           {"answer request-1 " + GetParam().message + " " + fake::traced(answer),
                            "log fault " + filled(GetParam().replyFailed, {GetParam().subject, "org.a", text(error)}),
                            completionWith(error), cancel()})));
}

TEST_P(ItemOperationsTest, AFailedBeginIsWrappedAndLeavesTheRequestUncancelled) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  perform();
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  begin(), {"begin failed request-1 " + text(error), "log debug [DEBUG] Beginning extension request.",
                            "log fault [ERROR] Extension request failed. Error: " + text(error), requestFailed(error),
                            completionWith(error)})));
}

TEST_P(ItemOperationsTest, WithoutAProxyTheRequestStaysOpen) {
  platform().extensions().removeProxy("request-1");
  const SXError error = SXProxyNotFoundError("org.a", std::nullopt);
  perform();
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(begin(), {"begun request-1", "log debug [DEBUG] Beginning extension request.",
                                                    "extensionContextForRequest org.a version 1 request-1",
                                                    "remoteProxyWithErrorHandler request-1",
                                                    "log fault [ERROR] Could not get proxy object for a request.",
                                                    requestFailed(error), completionWith(error)})));
  EXPECT_THAT(platform().extensions().openRequests(), ElementsAre("request-1"));
}

TEST_P(ItemOperationsTest, AConnectionFailureInPlaceOfTheReplyIsWrappedAndLeavesTheRequestOpen) {
  const SXError error = someError("the process ended");
  process("org.a").setAnswer(GetParam().message, VendorAnswer::connectionFailure(error));
  perform();
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  beginAndSend(),
                  {"connection failed request-1 " + text(error),
                   "log fault [ERROR] Error getting remote proxy object for provider extension. Error: " + text(error),
                   requestFailed(error), completionWith(error)})));
  EXPECT_THAT(platform().extensions().openRequests(), ElementsAre("request-1"));
}

TEST_P(ItemOperationsTest, ALateConnectionFailureCallsTheCompletionAgain) {
  const SXError error = someError("the process ended");
  process("org.a").setAnswer(GetParam().message,
                             VendorAnswer::valuesThenConnectionFailure(GetParam().answer(std::nullopt), error));
  perform();
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("completion "), 2U);
  const std::vector<std::string> lines = trace();
  ASSERT_GE(lines.size(), 4U);
  EXPECT_EQ(lines[lines.size() - 2], requestFailed(error));
  EXPECT_EQ(lines.back(), completionWith(error));
}

TEST_P(ItemOperationsTest, WithoutACompletionEverythingElseHappens) {
  process("org.a").queueAnswer(GetParam().message, VendorAnswer::values(GetParam().answer(std::nullopt)));
  process("org.a").queueAnswer(GetParam().message, VendorAnswer::values(GetParam().answer(someError("no"))));
  perform(false);
  runUntilIdle();
  EXPECT_EQ(trace().back(), cancel());
  perform(false);
  runUntilIdle();
  EXPECT_EQ(trace().back(), "cancelExtensionRequest org.a version 1 request-2");
  process("org.a").setBeginFailure(someError("no process"));
  perform(false);
  runUntilIdle();
  EXPECT_EQ(trace().back(), requestFailed(someError("no process")));
}

const Member members[] = {
    {"providePlaceholder",
     [](SXExtensionStorix &provider, ProvidersTest *test, bool with) {
       auto *self = static_cast<ItemOperationsTest *>(test);
       provider.providePlaceholderForItemAtURL(
           *URL::fromString(url), with ? self->recording<SXError>("completion") : SXExtensionStorix::ErrorCompletion());
     },
     "-[SXExtensionStorix providePlaceholderForItemAtURL:completionHandler:]",
     "_providePlaceholderAtURL:completion:", url,
     [](std::optional<SXError> error) {
       return Arguments{Argument(*URL::fromString("file:///x/.report.txt")), argument(std::move(error))};
     },
     "((null))", [](const std::string &error) { return "(" + error + ")"; },
     "[ERROR] Cannot provide placeholder for item at URL %@ for extension %@. Error: %@",
     "[ERROR] Proxy failed to provide placeholder at URL %@ for extension %@. Error: %@",
     "[DEBUG] Successfully provided placeholder at URL file:///x/report.txt for extension org.a."},
    {"startProviding",
     [](SXExtensionStorix &provider, ProvidersTest *test, bool with) {
       auto *self = static_cast<ItemOperationsTest *>(test);
       provider.startProvidingItemAtURL(
           *URL::fromString(url), with ? self->recording<SXError>("completion") : SXExtensionStorix::ErrorCompletion());
     },
     "-[SXExtensionStorix startProvidingItemAtURL:completionHandler:]", "_startProvidingItemAtURL:completion:", url,
     [](std::optional<SXError> error) { return Arguments{argument(std::move(error))}; }, "((null))",
     [](const std::string &error) { return "(" + error + ")"; },
     "[ERROR] Cannot provide item at URL %@ for extension %@. Error: %@",
     "[ERROR] Proxy failed to start providing item at URL %@ for extension %@. Error: %@",
     "[DEBUG] Successfully provided item at URL file:///x/report.txt for extension org.a."},
    {"stopProviding",
     [](SXExtensionStorix &provider, ProvidersTest *test, bool with) {
       auto *self = static_cast<ItemOperationsTest *>(test);
       provider.stopProvidingItemAtURL(
           *URL::fromString(url), with ? self->recording<SXError>("completion") : SXExtensionStorix::ErrorCompletion());
     },
     "-[SXExtensionStorix stopProvidingItemAtURL:completionHandler:]", "_stopProvidingItemAtURL:completion:", url,
     [](std::optional<SXError> error) { return Arguments{argument(std::move(error))}; }, "((null))",
     [](const std::string &error) { return "(" + error + ")"; },
     "[ERROR] Cannot stop providing item at URL %@ for extension %@. Error: %@",
     "[ERROR] Proxy failed to stop providing item at URL %@ for extension %@. Error: %@",
     "[DEBUG] Successfully stopped providing item at URL file:///x/report.txt for extension org.a."},
    {"itemIDForURL",
     [](SXExtensionStorix &provider, ProvidersTest *test, bool with) {
       auto *self = static_cast<ItemOperationsTest *>(test);
       provider.itemIDForURL(*URL::fromString(url), with ? self->recording<SXError, std::string>("completion")
                                                         : CompletionHandler<SXError, std::string>());
     },
     "-[SXExtensionStorix itemIDForURL:completionHandler:]", "_identifierForItemAtURL:completion:", url,
     [](std::optional<SXError> error) {
       return Arguments{argument(std::move(error)), Argument(std::string("folder/report"))};
     },
     "((null), folder/report)", [](const std::string &error) { return "(" + error + ", (null))"; },
     "[ERROR] Cannot get item ID for URL %@ for extension %@. Error: %@",
     "[ERROR] Proxy failed to get item ID for URL %@ for extension %@. Error: %@",
     "[DEBUG] Successfully got item ID “folder/report” for URL file:///x/report.txt from extension org.a"},
    {"URLForItemID",
     [](SXExtensionStorix &provider, ProvidersTest *test, bool with) {
       auto *self = static_cast<ItemOperationsTest *>(test);
       provider.URLForItemID("folder/report",
                             with ? self->recording<SXError, URL>("completion") : CompletionHandler<SXError, URL>());
     },
     "-[SXExtensionStorix URLForItemID:completionHandler:]", "_URLForItemIdentifier:completion:", "folder/report",
     [](std::optional<SXError> error) {
       return Arguments{argument(std::move(error)), Argument(*URL::fromString(url))};
     },
     "((null), file:///x/report.txt)", [](const std::string &error) { return "(" + error + ", (null))"; },
     "[ERROR] Cannot get URL for item ID “%@” for extension %@. Error: %@",
     "[ERROR] Proxy failed to get URL for item ID “%@” for extension %@. Error: %@",
     "[DEBUG] Successfully retrieved URL file:///x/report.txt for item ID “folder/report” from extension org.a"},
};

INSTANTIATE_TEST_SUITE_P(Family, ItemOperationsTest, ::testing::ValuesIn(members),
                         [](const ::testing::TestParamInfo<Member> &member) { return member.param.name; });

class TranslatingOperationsTest : public ProvidersTest {};

TEST_F(TranslatingOperationsTest, AMissingIdentifierWithoutAnErrorIsSuccess) {
  makeProvider("org.a")->itemIDForURL(*URL::fromString(url), recording<SXError, std::string>("completion"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("completion ((null), (null))"), 1U);
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::debug,
      "[DEBUG] Successfully got item ID “(null)” for URL file:///x/report.txt from extension org.a"));
}

TEST_F(TranslatingOperationsTest, AnEmptyIdentifierIsHandedOnAsItIs) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  process("org.a").setAnswer("IdentifierForItemAtURL", VendorAnswer::values({Argument(), Argument("")}));
  provider->itemIDForURL(*URL::fromString(url), recording<SXError, std::string>("completion"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("completion ((null), ) on"), 1U);
}

TEST_F(TranslatingOperationsTest, AMissingURLWithoutAnErrorIsSuccess) {
  makeProvider("org.a")->URLForItemID("i", recording<SXError, URL>("completion"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("completion ((null), (null))"), 1U);
}

TEST_F(TranslatingOperationsTest, CallsDoNotShareRequests) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  provider->itemIDForURL(*URL::fromString(url), {});
  provider->startProvidingItemAtURL(*URL::fromString(url), {});
  EXPECT_EQ(platform().trace().count("beginExtensionRequest"), 2U);
}

class ItemChangedTest : public ProvidersTest {
 protected:
  void tell() {
    makeProvider("org.a")->itemChangedAtURL(*URL::fromString(url));
    runUntilIdle();
  }
  static std::vector<std::string> begin() {
    return {"log debug [DEBUG] -[SXExtensionStorix itemChangedAtURL:]",
            "beginExtensionRequest org.a version 1 request-1"};
  }
  static std::vector<std::string> beginAndSend() {
    return followedBy(begin(),
                      {"begun request-1", "log debug [DEBUG] Beginning extension request.",
                       "extensionContextForRequest org.a version 1 request-1", "remoteProxyWithErrorHandler request-1",
                       std::string("send request-1 _itemChangedAtURL:completion: (") + url + ")"});
  }
};

TEST_F(ItemChangedTest, SuccessLogsNothingAndEndsTheRequest) {
  tell();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(beginAndSend(), {"answer request-1 _itemChangedAtURL:completion: ()",
                                                           "cancelExtensionRequest org.a version 1 request-1"})));
}

TEST_F(ItemChangedTest, AnErrorInTheReplyIsLoggedAndEndsTheRequest) {
  const SXError error = someError("not now");
  process("org.a").setAnswer("ItemChangedAtURL", VendorAnswer::values({Argument(error)}));
  tell();
  EXPECT_THAT(trace(), ElementsAreArray(followedBy(
                           beginAndSend(), {"answer request-1 _itemChangedAtURL:completion: (" + text(error) + ")",
                                            "log fault [ERROR] Could not tell extension org.a that item at URL " +
                                                std::string(url) + " has changed. Error: " + text(error),
                                            "cancelExtensionRequest org.a version 1 request-1"})));
}

TEST_F(ItemChangedTest, AFailedRequestIsLoggedWithoutTheErrorAndEndedToo) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  tell();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  begin(), {"begin failed request-1 " + text(error), "log debug [DEBUG] Beginning extension request.",
                            "log fault [ERROR] Extension request failed. Error: " + text(error),
                            "log fault [ERROR] Cannot tell extension org.a that item at URL " + std::string(url) +
                                " has changed.",
                            "cancelExtensionRequest org.a version 1 request-1"})));
}

TEST_F(ItemChangedTest, AConnectionFailureInPlaceOfTheReplyEndsTheRequestToo) {
  const SXError error = someError("the process ended");
  process("org.a").setAnswer("ItemChangedAtURL", VendorAnswer::connectionFailure(error));
  tell();
  EXPECT_THAT(
      trace(),
      ElementsAreArray(followedBy(
          beginAndSend(),
          {"connection failed request-1 " + text(error),
           "log fault [ERROR] Error getting remote proxy object for provider extension. Error: " + text(error),
           "log fault [ERROR] Cannot tell extension org.a that item at URL " + std::string(url) + " has changed.",
           "cancelExtensionRequest org.a version 1 request-1"})));
}

}  // namespace
}  // namespace storix
