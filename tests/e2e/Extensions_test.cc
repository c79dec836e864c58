// Extensions that come and go, die, hang and talk nonsense.

#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>

#include <future>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

using Extensions = E2ETest;

constexpr const char *consumer = "org.sample.editor";

/// An Info.kvs of the storix extension point.
std::string info(const std::string &identifier, const std::string &executable) {
  return R"({"KTBundleIdentifier": ")" + identifier + R"(", "KTBundleExecutable": ")" + executable +
         R"(", "KTBundleVersion": "1", "KTGroupContainers": ["group.)" + identifier +
         R"("], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
     "KTExtension": {"KTExtensionStorixDocumentGroup": "group.)" +
         identifier + R"("}})";
}

bool lists(Client &client, const std::string &identifier) {
  const auto providers = client.providers();
  EXPECT_TRUE(providers) << (providers ? "" : providers.error().message());
  if (!providers) return false;
  for (const ProviderDescription &provider : providers.value()) {
    if (provider.identifier == identifier) return true;
  }
  return false;
}

TEST_F(Extensions, ExtensionAddedWhileRunningIsServedAndOneRemovedIsNot) {
  start();
  const std::unique_ptr<Client> client = makeClient();
  ASSERT_FALSE(client->wakeUp());
  session.installProvider("org.sample.late");
  ASSERT_TRUE(daemon->waitForLine("[INFO] Registered storix provider extension org.sample.late"));
  grantAndStart(*client, "org.sample.late", "report");

  const std::size_t before = daemon->errorLines().size();
  session.removeBundle("org.sample.late");
  ASSERT_TRUE(daemon->waitForLine("[INFO] Updating provider list.", before));
  // The list changes soon after that line; each answer is a whole list.
  while (lists(*client, "org.sample.late")) {
  }
  const Client::Outcome outcome =
      client->startProviding(itemURL("org.sample.late", "report"), "org.sample.late", consumer);
  ASSERT_TRUE(outcome);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::notFound), outcome->code());
}

TEST_F(Extensions, ExtensionKilledInMidRequestFailsThatRequestAndTheNextOneIsServed) {
  session.installProvider("org.sample.docs", "start exit 3");
  start();
  const std::unique_ptr<Client> client = makeClient();
  const URL url = itemURL("org.sample.docs", "report");
  ASSERT_TRUE(client->extendSandbox(url, "org.sample.docs", consumer));

  const Client::Outcome outcome = client->startProviding(url, "org.sample.docs", consumer);
  ASSERT_TRUE(outcome);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::pluginOperationFailed), outcome->code());
  EXPECT_NE(nullptr, outcome->underlyingError());
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Cannot provide item at URL"));

  // A new process answers.
  const Result<GrantedDocument> again = client->extendSandbox(url, "org.sample.docs", consumer);
  EXPECT_TRUE(again) << again.error().message();
}

TEST_F(Extensions, HungExtensionDelaysNobodyElse) {
  session.installProvider("org.sample.hung", "identifier never");
  session.installProvider("org.sample.well");
  start();
  const std::unique_ptr<Client> waiting = makeClient();
  std::promise<Result<GrantedDocument>> answer;
  waiting->extendSandbox(itemURL("org.sample.hung", "report"), "org.sample.hung", consumer,
                         [&answer](Result<GrantedDocument> result) { answer.set_value(std::move(result)); });
  ASSERT_TRUE(daemon->waitForLine("called identifier"));

  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.well", "report");
  EXPECT_FALSE(waiting->wakeUp());
  stop();
  EXPECT_FALSE(answer.get_future().get());
}

TEST_F(Extensions, ExtensionThatFailsSaysWhyToTheClient) {
  session.installProvider("org.sample.docs", "start fail the cloud is grey");
  start();
  const std::unique_ptr<Client> client = makeClient();
  const URL url = itemURL("org.sample.docs", "report");
  ASSERT_TRUE(client->extendSandbox(url, "org.sample.docs", consumer));
  const Client::Outcome outcome = client->startProviding(url, "org.sample.docs", consumer);
  ASSERT_TRUE(outcome);
  ASSERT_NE(nullptr, outcome->underlyingError());
  EXPECT_EQ("the cloud is grey", outcome->underlyingError()->message());
}

TEST_F(Extensions, UnreadableInfoIsOneLineAndTheOthersWork) {
  session.installBundle("broken", R"({"KTBundleIdentifier": "org.sample.broken",)");
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  EXPECT_EQ(1U, daemon->countLines("broken.appdex"));
  EXPECT_FALSE(lists(*client, "org.sample.broken"));
}

TEST_F(Extensions, BundleWithoutIdentifierIsIgnoredWithANotice) {
  session.installBundle("nameless", R"({"KTBundleExecutable": "provider",
    "KTExtensionPointIdentifier": "com.tessel.storix-nonui", "KTExtension": {}})");
  start();
  ASSERT_FALSE(makeClient()->wakeUp());
  EXPECT_TRUE(daemon->waitForLine("has no identifier. Ignoring."));
}

TEST_F(Extensions, MissingExecutableFailsItsRegistrationAndTheOthersWork) {
  session.installBundle("a.missing", info("org.sample.a.missing", "nothing-there"));
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Could not register storix provider org.sample.a.missing."));
  EXPECT_TRUE(lists(*client, "org.sample.a.missing"));
}

TEST_F(Extensions, ExecutableThatExitsAtOnceFailsItsRegistrationAndTheOthersWork) {
  session.installBundle("a.exits", info("org.sample.a.exits", "provider"), "/bin/false");
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Could not register storix provider org.sample.a.exits."));
}

TEST_F(Extensions, ExecutableThatTalksNonsenseFailsItsRegistrationAndTheOthersWork) {
  session.installBundle("a.nonsense", info("org.sample.a.nonsense", "provider"), builtProgram("e2e_nonsense_provider"));
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Could not register storix provider org.sample.a.nonsense."));
}

TEST_F(Extensions, ExtensionsEndWithTheDaemonEvenWhenItIsKilled) {
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  const auto line = daemon->waitForLine("process ");
  ASSERT_TRUE(line);
  const std::string text = daemon->errorLines()[*line];
  const pid_t extension = std::stoi(text.substr(text.find("process ") + 8));
  const UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, extension, 0)));
  ASSERT_TRUE(pidfd);

  daemon->signal(SIGKILL);
  EXPECT_EQ(128 + SIGKILL, daemon->wait());
  pollfd ended{pidfd.get(), POLLIN, 0};
  EXPECT_EQ(1, ::poll(&ended, 1, static_cast<int>(std::chrono::milliseconds(deadline).count())));
}

}  // namespace
}  // namespace storix::e2e
