#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "storix/Client.h"
#include "tests/e2e/Session.h"

namespace storix::e2e {

/// A session with a daemon that the test starts when it is ready, and a client of it. The test program
/// is the application "org.sample.files", which may hand out access.
class E2ETest : public testing::Test {
 protected:
  E2ETest() { session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": true})"); }

  /// Starts the daemon; providers that are installed already are registered when it answers.
  void start() { daemon = session.startDaemon(); }

  /// Ends the daemon as a service manager would, and expects a clean end.
  void stop() {
    daemon->signal(SIGTERM);
    EXPECT_EQ(0, daemon->wait());
  }

  /// A client with a connection of its own.
  [[nodiscard]] std::unique_ptr<Client> makeClient() const {
    ClientOptions options;
    options.runtimeDirectory = session.runtimeDirectory().string();
    options.timeout = deadline;
    return std::make_unique<Client>(options);
  }

  /// The URL of an item of a provider that `installProvider` made.
  [[nodiscard]] URL itemURL(const std::string &provider, const std::string &item) const {
    return *URL::fileURLWithPath((session.storage(provider) / item).string());
  }

  /// Grants the item to the consumer "org.sample.editor" and has it provided.
  void grantAndStart(Client &client, const std::string &provider, const std::string &item) const {
    const URL url = itemURL(provider, item);
    const Result<GrantedDocument> granted = client.extendSandbox(url, provider, "org.sample.editor");
    ASSERT_TRUE(granted) << granted.error().message();
    const Client::Outcome started = client.startProviding(url, provider, "org.sample.editor");
    ASSERT_FALSE(started) << started->message();
  }

  Session session;
  std::unique_ptr<Process> daemon;
};

}  // namespace storix::e2e
