#include <set>
#include <thread>

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;

/// What a handler got, one after another.
struct Call {
  std::optional<SXError> error;
  std::shared_ptr<_KTStorixVendor> vendor;
  CancelRequest cancelRequest;
};

class ExtensionRequestChannelTest : public ProvidersTest {
 protected:
  ExtensionRequestHandler collecting() {
    return [this](std::optional<SXError> error, std::shared_ptr<_KTStorixVendor> vendor, CancelRequest cancelRequest) {
      platform().trace().add(std::string("handler ") + (error ? text(*error) : "no error") + ", " +
                             (vendor ? "a proxy" : "no proxy") + " on " + fake::currentContext());
      calls_.push_back({std::move(error), std::move(vendor), std::move(cancelRequest)});
    };
  }

  void TearDown() override {
    calls_.clear();
    ProvidersTest::TearDown();
  }

  std::vector<Call> calls_;
};

TEST_F(ExtensionRequestChannelTest, ARequestBeginsAndDeliversAProxy) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  provider->performExtensionRequest(collecting());
  EXPECT_THAT(trace(), ElementsAre("beginExtensionRequest org.a version 1 request-1"));
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAre("begun request-1", "log debug [DEBUG] Beginning extension request.",
                          "extensionContextForRequest org.a version 1 request-1",
                          "remoteProxyWithErrorHandler request-1", "handler no error, a proxy on platform thread"));
  // The channel itself ends nothing.
  EXPECT_THAT(platform().extensions().openRequests(), ElementsAre("request-1"));
  calls_.front().cancelRequest();
  EXPECT_THAT(trace(), ElementsAre("cancelExtensionRequest org.a version 1 request-1"));
}

TEST_F(ExtensionRequestChannelTest, ABeginFailureReachesTheHandlerAsItIs) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAre("beginExtensionRequest org.a version 1 request-1", "begin failed request-1 " + text(error),
                          "log debug [DEBUG] Beginning extension request.",
                          "log fault [ERROR] Extension request failed. Error: " + text(error),
                          "handler " + text(error) + ", no proxy on platform thread"));
  EXPECT_EQ(calls_.front().error, error);
}

TEST_F(ExtensionRequestChannelTest, CancellingAFailedRequestWithoutIdentifierIsHarmless) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  process("org.a").setBeginFailure(someError("no process"));
  process("org.a").setFailedBeginHasIdentifier(false);
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  trace();
  calls_.front().cancelRequest();
  EXPECT_THAT(trace(), ::testing::IsEmpty());
}

TEST_F(ExtensionRequestChannelTest, AMissingContextIsAProxyThatWasNotFound) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  platform().extensions().removeContext("request-1");
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  const SXError error = SXProxyNotFoundError("org.a", std::nullopt);
  EXPECT_THAT(trace(), ElementsAre("beginExtensionRequest org.a version 1 request-1", "begun request-1",
                                   "log debug [DEBUG] Beginning extension request.",
                                   "extensionContextForRequest org.a version 1 request-1",
                                   "log fault [ERROR] Could not get extension context for request identifier request-1",
                                   "log fault [ERROR] Could not get proxy object for a request.",
                                   "handler " + text(error) + ", no proxy on platform thread"));
  EXPECT_EQ(calls_.front().error, error);
}

TEST_F(ExtensionRequestChannelTest, AConnectionWithoutProxyIsAProxyThatWasNotFound) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  platform().extensions().removeProxy("request-1");
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  const SXError error = SXProxyNotFoundError("org.a", std::nullopt);
  EXPECT_THAT(trace(), ElementsAre("beginExtensionRequest org.a version 1 request-1", "begun request-1",
                                   "log debug [DEBUG] Beginning extension request.",
                                   "extensionContextForRequest org.a version 1 request-1",
                                   "remoteProxyWithErrorHandler request-1",
                                   "log fault [ERROR] Could not get proxy object for a request.",
                                   "handler " + text(error) + ", no proxy on platform thread"));
}

TEST_F(ExtensionRequestChannelTest, ALateConnectionFailureCallsTheHandlerAgainWithTheSameCancel) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  trace();
  const SXError error = someError("the process ended");
  platform().extensions().reportConnectionFailure("request-1", error);
  runUntilIdle();
  EXPECT_THAT(
      trace(),
      ElementsAre("connection failed request-1 " + text(error),
                  "log fault [ERROR] Error getting remote proxy object for provider extension. Error: " + text(error),
                  "handler " + text(error) + ", no proxy on platform thread"));
  ASSERT_EQ(calls_.size(), 2U);
  EXPECT_NE(calls_[0].vendor, nullptr);
  EXPECT_EQ(calls_[1].error, error);
  calls_[1].cancelRequest();
  EXPECT_THAT(trace(), ElementsAre("cancelExtensionRequest org.a version 1 request-1"));
}

TEST_F(ExtensionRequestChannelTest, CancelGoesToTheRecordThatTheProviderHasThen) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  provider->setExtension(platform().extensions().makeRecord(fake::completeProvider("org.a", "2")));
  trace();
  calls_.front().cancelRequest();
  EXPECT_THAT(trace(), ElementsAre("cancelExtensionRequest org.a version 2 request-1"));
}

TEST_F(ExtensionRequestChannelTest, TheCancelCallbackKeepsTheProvider) {
  std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  const std::weak_ptr<SXExtensionStorix> observed = provider;
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  provider.reset();
  platform().extensions().clear();
  EXPECT_FALSE(observed.expired());
  calls_.clear();
  EXPECT_TRUE(observed.expired());
}

TEST_F(ExtensionRequestChannelTest, AProxyIsToBeHadWithoutAnErrorHandler) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  provider->performExtensionRequest(collecting());
  runUntilIdle();
  EXPECT_NE(provider->proxyForIdentifier(RequestIdentifier{"request-1"}, {}), nullptr);
  calls_.clear();
  platform().log().take();
  const SXError error = someError("gone");
  platform().extensions().reportConnectionFailure("request-1", error);
  runUntilIdle();
  const std::string line = "[ERROR] Error getting remote proxy object for provider extension. Error: " + text(error);
  EXPECT_THAT(logTexts(), ElementsAre(line, line));
  EXPECT_EQ(calls_.size(), 1U);
}

TEST_F(ExtensionRequestChannelTest, AnAbsentRequestIdentifierHasNoContext) {
  const std::shared_ptr<SXExtensionStorix> provider = makeProvider("org.a");
  bool called = false;
  EXPECT_EQ(provider->proxyForIdentifier(std::nullopt, [&called](const SXError &) { called = true; }), nullptr);
  EXPECT_THAT(logTexts(), ElementsAre("[ERROR] Could not get extension context for request identifier (null)"));
  EXPECT_FALSE(called);
}

TEST(KTStorixExtensionHostContext, NamesTheTwoProtocols) {
  EXPECT_EQ(_KTStorixExtensionHostContext::name, "_KTStorixExtensionHostContext");
  const ProtocolDescription &host = _KTStorixExtensionHostContext::_extensionAuxiliaryHostProtocol().protocol();
  EXPECT_EQ(host.name, "_KTStorixHostProtocol");
  EXPECT_EQ(host.interfaceName, "com.tessel.StorixHost");
  EXPECT_EQ(host.objectPath, "/com/tessel/StorixHost");
  EXPECT_TRUE(host.operations.empty());
  EXPECT_EQ(&_KTStorixExtensionHostContext::_extensionAuxiliaryVendorProtocol().protocol(),
            &_KTStorixVendorProtocol().description());
}

TEST(KTStorixExtensionHostContext, TheVendorProtocolHasItsOperationsInOrder) {
  using enum ValueKind;
  const std::vector<ExpectedRow> rows{
      {"_performInitialSetupWithCompletion:", {}, {string, ValueKind::URL, error}},
      {"_providePlaceholderAtURL:completion:", {ValueKind::URL}, {ValueKind::URL, error}},
      {"_startProvidingItemAtURL:completion:", {ValueKind::URL}, {error}},
      {"_itemChangedAtURL:completion:", {ValueKind::URL}, {error}},
      {"_stopProvidingItemAtURL:completion:", {ValueKind::URL}, {error}},
      {"_identifierForItemAtURL:completion:", {ValueKind::URL}, {error, string}},
      {"_URLForItemIdentifier:completion:", {string}, {error, ValueKind::URL}},
  };
  expectRows(_KTStorixVendorProtocol().description(), rows);
}

TEST(KTStorixExtensionHostContext, TheVendorProtocolHasItsWordsForTheWire) {
  const ProtocolDescription &description = _KTStorixVendorProtocol().description();
  EXPECT_EQ(description.name, "_KTStorixVendor");
  EXPECT_EQ(description.interfaceName, "com.tessel.StorixVendor");
  EXPECT_EQ(description.objectPath, "/com/tessel/StorixVendor");
  EXPECT_EQ(words(description),
            "PerformInitialSetup() -> (string, URL, error)\n"
            "ProvidePlaceholderAtURL(URL) -> (placeholderURL, error)\n"
            "StartProvidingItemAtURL(URL) -> (error)\n"
            "ItemChangedAtURL(URL) -> (error)\n"
            "StopProvidingItemAtURL(URL) -> (error)\n"
            "IdentifierForItemAtURL(URL) -> (error, itemIdentifier)\n"
            "URLForItemIdentifier(itemIdentifier) -> (error, URL)\n");
}

TEST(KTStorixExtensionHostContext, ConcurrentFirstCallsGetTheIdenticalInterface) {
  constexpr std::size_t threadCount = 8;
  std::vector<const LinkInterface *> vendors(threadCount);
  std::vector<const LinkInterface *> hosts(threadCount);
  std::vector<std::thread> threads;
  threads.reserve(threadCount);
  for (std::size_t i = 0; i < threadCount; ++i) {
    threads.emplace_back([&vendors, &hosts, i] {
      vendors[i] = &_KTStorixExtensionHostContext::_extensionAuxiliaryVendorProtocol();
      hosts[i] = &_KTStorixExtensionHostContext::_extensionAuxiliaryHostProtocol();
    });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(std::set<const LinkInterface *>(vendors.begin(), vendors.end()).size(), 1U);
  EXPECT_EQ(std::set<const LinkInterface *>(hosts.begin(), hosts.end()).size(), 1U);
}

}  // namespace
}  // namespace storix
