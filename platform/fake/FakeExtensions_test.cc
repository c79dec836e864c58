#include "platform/fake/FakeExtensions.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fake/FakeHostTest.h"
#include "platform/fake/FakeSampleProtocol.h"

namespace storix::fake {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

const Dictionary attributes{{std::string(extensionPointAttribute), "com.tessel.storix-nonui"}};
const SXError failure("org.test", 5);

class FakeExtensionsTest : public FakeHostTest {
 protected:
  FakeExtensions &extensions() { return platform().extensions(); }

  std::shared_ptr<ExtensionMatching> match() {
    return platform().beginMatchingExtensions(attributes, [this](std::vector<std::shared_ptr<ExtensionRecord>> records,
                                                                 const std::optional<SXError> & /*error*/) {
      std::vector<std::string> names;
      names.reserve(records.size());
      for (const auto &record : records) names.push_back(record->description());
      deliveries_.push_back(std::move(names));
      records_ = std::move(records);
    });
  }

  void registerContextClass() {
    platform().registerExtensionContextClass(
        "_KTStorixExtensionHostContext",
        {.auxiliaryHostProtocol = [this]() -> const LinkInterface & { return interface_; },
         .auxiliaryVendorProtocol = [this]() -> const LinkInterface & { return interface_; },
         .make =
             [](std::shared_ptr<AuxiliaryConnection> connection) {
               return std::make_shared<ExtensionContext>(std::move(connection));
             }});
  }

  /// The first begun request of "org.a".
  std::shared_ptr<ExtensionRecord> begun() {
    registerContextClass();
    const std::shared_ptr<ExtensionRecord> record = extensions().makeRecord(completeProvider("org.a"));
    record->beginExtensionRequest([this](std::optional<RequestIdentifier> request, std::optional<SXError> error) {
      begins_.emplace_back(std::move(request), std::move(error));
      contexts_.push_back(currentContext());
    });
    runUntilIdle();
    return record;
  }

  std::shared_ptr<RemoteObject> proxy(const std::shared_ptr<ExtensionRecord> &record) {
    const std::shared_ptr<ExtensionContext> context = record->extensionContextForRequest({"request-1"});
    if (!context) return nullptr;
    return context->auxiliaryConnection()->remoteProxyWithErrorHandler(
        [this](const SXError &error) { failures_.push_back(error); });
  }

  /// Sends one message and runs what comes of it.
  void greet(RemoteObject &remote) {
    remote.send(0, {"you"}, [this](Arguments values) {
      replies_.push_back(std::move(values));
      contexts_.push_back(currentContext());
    });
    runUntilIdle();
  }

  const LinkInterface interface_{sampleProtocol().description()};
  std::vector<std::vector<std::string>> deliveries_;
  std::vector<std::shared_ptr<ExtensionRecord>> records_;
  std::vector<std::pair<std::optional<RequestIdentifier>, std::optional<SXError>>> begins_;
  std::vector<Arguments> replies_;
  std::vector<SXError> failures_;
  std::vector<std::string> contexts_;
};

TEST_F(FakeExtensionsTest, ListIsDeliveredAtFirstAndWhenTheTestSays) {
  extensions().install(completeProvider("org.a"));
  const std::shared_ptr<ExtensionMatching> matching = match();
  EXPECT_THAT(deliveries_, IsEmpty());
  runUntilIdle();
  extensions().install(completeProvider("org.b"));
  extensions().deliver();
  extensions().remove("org.a");
  extensions().deliver();
  runUntilIdle();
  EXPECT_THAT(deliveries_,
              ElementsAre(ElementsAre("org.a version 1"), ElementsAre("org.a version 1", "org.b version 1"),
                          ElementsAre("org.b version 1")));
}

TEST_F(FakeExtensionsTest, FirstDeliveryCanWaitForTheTest) {
  extensions().setDeliversAtFirst(false);
  const std::shared_ptr<ExtensionMatching> matching = match();
  runUntilIdle();
  EXPECT_THAT(deliveries_, IsEmpty());
  extensions().deliver(failure);
  runUntilIdle();
  EXPECT_THAT(deliveries_, ElementsAre(IsEmpty()));
}

TEST_F(FakeExtensionsTest, NothingIsDeliveredOnceTheHandleIsGone) {
  std::shared_ptr<ExtensionMatching> matching = match();
  matching.reset();
  extensions().deliver();
  runUntilIdle();
  EXPECT_THAT(deliveries_, IsEmpty());
}

TEST_F(FakeExtensionsTest, OnlyTheExtensionPointAskedForIsDelivered) {
  FakeExtension other = completeProvider("org.b");
  other.extensionPoint = "org.other";
  extensions().install(std::move(other));
  const std::shared_ptr<ExtensionMatching> matching = match();
  runUntilIdle();
  EXPECT_THAT(deliveries_, ElementsAre(IsEmpty()));
}

TEST_F(FakeExtensionsTest, RecordsAreEqualWhenNothingOfTheExtensionChanged) {
  const auto record = extensions().makeRecord(completeProvider("org.a"));
  EXPECT_TRUE(record->isEqual(*extensions().makeRecord(completeProvider("org.a"))));
  EXPECT_FALSE(record->isEqual(*extensions().makeRecord(completeProvider("org.a", "2"))));
  EXPECT_FALSE(record->isEqual(*extensions().makeRecord(completeProvider("org.b"))));
  FakeExtension bare = completeProvider("org.a");
  bare.bundle.reset();
  EXPECT_FALSE(record->isEqual(*extensions().makeRecord(bare)));
}

TEST_F(FakeExtensionsTest, BundleRecordTellsInfoAndGroupContainers) {
  extensions().install(completeProvider("org.a"));
  const std::shared_ptr<BundleRecord> bundle = platform().bundleRecordForIdentifier("org.a");
  ASSERT_TRUE(bundle);
  EXPECT_TRUE(bundle->infoDictionaryValue("KTExtension", ValueKind::dictionary));
  EXPECT_FALSE(bundle->infoDictionaryValue("KTExtension", ValueKind::string));
  EXPECT_FALSE(bundle->infoDictionaryValue("absent", ValueKind::dictionary));
  EXPECT_EQ(bundle->groupContainerURLs().at("group.org.a").absoluteString(), "file:///groups/group.org.a/");
  EXPECT_FALSE(platform().bundleRecordForIdentifier("org.b"));
  EXPECT_FALSE(platform().bundleRecordForIdentifier(std::nullopt));
}

TEST_F(FakeExtensionsTest, RequestsAreNumberedAndBeginOutsideEveryQueue) {
  begun();
  begun();
  ASSERT_EQ(begins_.size(), 2U);
  EXPECT_EQ(begins_[0].first, RequestIdentifier{"request-1"});
  EXPECT_EQ(begins_[1].first, RequestIdentifier{"request-2"});
  EXPECT_FALSE(begins_[0].second);
  EXPECT_THAT(contexts_, ElementsAre("platform thread", "platform thread"));
  EXPECT_THAT(extensions().openRequests(), ElementsAre("request-1", "request-2"));
}

TEST_F(FakeExtensionsTest, ScriptedBeginFailureIsGivenAsOftenAsScripted) {
  extensions().process("org.a").queueBeginFailure(failure, 2);
  extensions().process("org.a").setFailedBeginHasIdentifier(false);
  begun();
  begun();
  begun();
  ASSERT_EQ(begins_.size(), 3U);
  EXPECT_EQ(begins_[0].second, failure);
  EXPECT_FALSE(begins_[0].first);
  EXPECT_EQ(begins_[1].second, failure);
  EXPECT_FALSE(begins_[2].second);
  EXPECT_EQ(begins_[2].first, RequestIdentifier{"request-3"});
  extensions().process("org.a").setBeginFailure(failure);
  extensions().process("org.a").setFailedBeginHasIdentifier(true);
  begun();
  EXPECT_EQ(begins_[3].second, failure);
  EXPECT_EQ(begins_[3].first, RequestIdentifier{"request-4"});
  EXPECT_THAT(extensions().openRequests(), ElementsAre("request-3"));
}

TEST_F(FakeExtensionsTest, HeldBeginWaitsForItsRelease) {
  extensions().process("org.a").setHoldsBegins(true);
  begun();
  EXPECT_THAT(begins_, IsEmpty());
  extensions().process("org.a").releaseBegins();
  runUntilIdle();
  EXPECT_EQ(begins_.size(), 1U);
}

TEST_F(FakeExtensionsTest, ContextIsThereWhileTheRequestIsOpen) {
  const auto record = begun();
  const auto context = record->extensionContextForRequest({"request-1"});
  EXPECT_TRUE(context);
  EXPECT_EQ(context, record->extensionContextForRequest({"request-1"}));
  EXPECT_FALSE(record->extensionContextForRequest({"request-9"}));
  record->cancelExtensionRequest({"request-1"});
  EXPECT_FALSE(record->extensionContextForRequest({"request-1"}));
  EXPECT_THAT(extensions().openRequests(), IsEmpty());
  record->cancelExtensionRequest({"request-1"});  // ignored
}

TEST_F(FakeExtensionsTest, ContextIsAbsentWhenNobodyRegisteredItsClass) {
  const auto record = extensions().makeRecord(completeProvider("org.a"));
  record->beginExtensionRequest([](const auto & /*request*/, const auto & /*error*/) {});
  runUntilIdle();
  EXPECT_FALSE(record->extensionContextForRequest({"request-1"}));
}

TEST_F(FakeExtensionsTest, ContextAndProxyCanBeTakenAway) {
  extensions().removeContext("request-1");
  EXPECT_FALSE(proxy(begun()));
  extensions().removeProxy("request-2");
  const auto record = begun();
  const auto context = record->extensionContextForRequest({"request-2"});
  ASSERT_TRUE(context);
  EXPECT_FALSE(context->auxiliaryConnection()->remoteProxyWithErrorHandler({}));
}

TEST_F(FakeExtensionsTest, MessageIsAnsweredAsScripted) {
  const auto record = begun();
  FakeExtensionProcess &process = extensions().process("org.a");
  process.setAnswer("Greet", [](const Arguments &arguments) {
    return VendorAnswer::values({"hello " + *arguments.at(0)->string()});
  });
  process.queueAnswer("greetName:completion:", VendorAnswer::values({"first"}));
  const auto remote = proxy(record);
  greet(*remote);
  greet(*remote);
  EXPECT_THAT(replies_, ElementsAre(Arguments{"first"}, Arguments{"hello you"}));
  EXPECT_THAT(failures_, IsEmpty());
  EXPECT_EQ(contexts_.back(), "platform thread");
}

TEST_F(FakeExtensionsTest, UnscriptedMessageIsAnsweredWithNothing) {
  greet(*proxy(begun()));
  EXPECT_THAT(replies_, ElementsAre(IsEmpty()));
}

TEST_F(FakeExtensionsTest, MessageThatIsNeverAnsweredCallsNobody) {
  extensions().process("org.a").setAnswer("Greet", VendorAnswer::never());
  greet(*proxy(begun()));
  EXPECT_THAT(replies_, IsEmpty());
  EXPECT_THAT(failures_, IsEmpty());
}

TEST_F(FakeExtensionsTest, ConnectionFailureComesInsteadOfOrAfterTheAnswer) {
  FakeExtensionProcess &process = extensions().process("org.a");
  process.queueAnswer("Greet", VendorAnswer::connectionFailure(failure));
  process.queueAnswer("Greet", VendorAnswer::valuesThenConnectionFailure({"hello"}, failure));
  const auto remote = proxy(begun());
  greet(*remote);
  EXPECT_THAT(replies_, IsEmpty());
  EXPECT_THAT(failures_, ElementsAre(failure));
  greet(*remote);
  EXPECT_THAT(replies_, ElementsAre(Arguments{"hello"}));
  EXPECT_THAT(failures_, ElementsAre(failure, failure));
}

TEST_F(FakeExtensionsTest, FailureCanBeReportedAtAnyTime) {
  const auto remote = proxy(begun());
  greet(*remote);
  extensions().reportConnectionFailure("request-1", failure);
  runUntilIdle();
  EXPECT_THAT(failures_, ElementsAre(failure));
}

TEST_F(FakeExtensionsTest, HeldAnswersWaitForTheirRelease) {
  FakeExtensionProcess &process = extensions().process("org.a");
  process.setAnswer("Greet", VendorAnswer::values({"late"}).held());
  const auto remote = proxy(begun());
  greet(*remote);
  greet(*remote);
  EXPECT_THAT(replies_, IsEmpty());
  EXPECT_EQ(process.heldAnswerCount(), 2U);
  EXPECT_TRUE(process.releaseAnswer());
  runUntilIdle();
  EXPECT_EQ(replies_.size(), 1U);
  process.releaseAllAnswers();
  runUntilIdle();
  EXPECT_EQ(replies_.size(), 2U);
  EXPECT_FALSE(process.releaseAnswer());
}

TEST_F(FakeExtensionsTest, MessageOfAnEndedRequestFails) {
  const auto record = begun();
  const auto remote = proxy(record);
  record->cancelExtensionRequest({"request-1"});
  greet(*remote);
  EXPECT_THAT(replies_, IsEmpty());
  EXPECT_EQ(failures_.size(), 1U);
}

TEST_F(FakeExtensionsTest, TraceTellsTheWholeStory) {
  const auto record = begun();
  greet(*proxy(record));
  record->cancelExtensionRequest({"request-1"});
  EXPECT_THAT(
      platform().trace().take(),
      ElementsAre("registerExtensionContextClass _KTStorixExtensionHostContext",
                  "beginExtensionRequest org.a version 1 request-1", "begun request-1",
                  "extensionContextForRequest org.a version 1 request-1", "remoteProxyWithErrorHandler request-1",
                  "send request-1 greetName:completion: (you)", "answer request-1 greetName:completion: ()",
                  "cancelExtensionRequest org.a version 1 request-1"));
}

}  // namespace
}  // namespace storix::fake
