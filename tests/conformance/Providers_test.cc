#include "service/ServicerTest.h"

namespace storix {
namespace {

using ::testing::ElementsAreArray;

class ProvidersRequestTest : public ServicerTest {};

TEST_F(ProvidersRequestTest, AReaderGetsTheListOnTheGlobalQueue) {
  connect({{readEntitlement, true}});
  call(SXDaemon::providersName);
  const std::string list = "{org.a = {documentStorageURL = " + storageText("org.a") +
                           "; providerIdentifier = org.a}; org.b = {documentStorageURL = " + storageText("org.b") +
                           "; providerIdentifier = org.b}}";
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({served(SXDaemon::providersName, {}),
                                       {"entitlementValue peer 100 com.tessel.storix.acl-read",
                                        "log debug [DEBUG] providersCompletionHandler:: returning providers " + list,
                                        reply(SXDaemon::providersName, "((null), " + list + ")", global)}})));
}

TEST_F(ProvidersRequestTest, AClientWithoutEntitlementIsRefused) {
  connect({{readEntitlement, false}});
  call(SXDaemon::providersName);
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {served(SXDaemon::providersName, {}),
           {"entitlementValue peer 100 com.tessel.storix.acl-read",
            "entitlementValue peer 100 com.tessel.storix.acl-write", "peerProcessIdentifier peer 100",
            "log fault [ERROR] Rejecting request from PID 100 because it does not have any of these entitlements: "
            "(com.tessel.storix.acl-read, com.tessel.storix.acl-write)",
            "log debug [DEBUG] providersCompletionHandler:: Client is missing entitlement",
            reply(SXDaemon::providersName, "(" + text(SXClientLacksEntitlement()) + ", (null))", global)}})));
}

TEST_F(ProvidersRequestTest, TheListIsTakenAtOnce) {
  connect({{writeEntitlement, true}});
  platform().globalQueue()->suspend();
  const std::shared_ptr<fake::FakeReply> answered = client_->call(SXDaemon::providersName);
  runUntilIdle();
  platform().extensions().remove("org.a");
  platform().extensions().deliver();
  runUntilIdle();
  EXPECT_EQ(SXExtensionStorix::providerWithIdentifier("org.a"), nullptr);
  platform().globalQueue()->resume();
  runUntilIdle();
  EXPECT_EQ(answered->answer().values.at(1)->dictionary()->size(), 2U);
}

TEST_F(ProvidersRequestTest, WithoutAReplyHandlerTheListIsLoggedAllTheSame) {
  connect({{readEntitlement, true}});
  client_->callWithoutReply(SXDaemon::providersName);
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("log debug [DEBUG] providersCompletionHandler:: returning providers {org.a"), 1U);
  connect({});
  client_->callWithoutReply(SXDaemon::providersName);
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

}  // namespace
}  // namespace storix
