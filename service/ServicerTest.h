#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "access/SXAccessControlStore.h"
#include "providers/ProvidersTest.h"
#include "service/SXLinkServicer.h"

namespace storix {

/// The server as the servicers see it, without one.
class StoreOwner : public AccessControlSource {
 public:
  [[nodiscard]] std::shared_ptr<SXAccessControlStore> accessControlStore() const override {
    return SXAccessControlStore::sharedStore();
  }
};

/// A client's connection with a servicer exported on it, and two providers, "org.a" and "org.b".
class ServicerTest : public ProvidersTest {
 protected:
  explicit ServicerTest(fake::FakePlatform::Options options = {}) : ProvidersTest(std::move(options)) {}

  using Text = std::optional<std::string>;

  static constexpr const char *readEntitlement = "com.tessel.storix.acl-read";
  static constexpr const char *writeEntitlement = "com.tessel.storix.acl-write";

  void SetUp() override {
    server_ = std::make_shared<StoreOwner>();
    SXAccessControlStore::sharedStore();
    startRegistry({"org.a", "org.b"});
    for (const char *identifier : {"org.a", "org.b"}) {
      process(identifier)
          .setAnswer("IdentifierForItemAtURL", fake::VendorAnswer::values({Argument(), Argument("f/i")}));
    }
    item_ = itemURL("org.a", "report.txt");
  }

  void TearDown() override {
    client_.reset();
    server_.reset();
    ProvidersTest::TearDown();
  }

  /// The peer 100 connects; what that did is not in the trace.
  void connect(Dictionary entitlements, Text bundleIdentifier = std::nullopt) {
    fake::FakePeer peer;
    peer.entitlements = std::move(entitlements);
    peer.bundleIdentifier = std::move(bundleIdentifier);
    client_ = platform().connections().makeConnection(std::move(peer));
    const auto servicer = std::make_shared<SXLinkServicer>();
    servicer->setServer(server_);
    servicer->setConnection(client_);
    client_->setExportedInterface(LinkInterface(SXDaemonProtocol().description()));
    client_->setExportedObject(std::make_shared<ProtocolExporter<SXDaemon>>(SXDaemonProtocol(), servicer));
    client_->resume();
    trace();
  }

  /// Sends a request, lets everything run, and gives what came back (in vain, if it has no answers).
  std::shared_ptr<fake::FakeReply> call(std::string_view name, Arguments arguments = {}) {
    const std::shared_ptr<fake::FakeReply> reply = client_->call(name, std::move(arguments));
    runUntilIdle();
    return reply;
  }

  /// The arguments (URL, provider, consumer) of most requests.
  static Arguments arguments(const std::optional<URL> &url, const Text &provider, const Text &consumer) {
    return packArguments<URL, std::string, std::string>(url, provider, consumer);
  }

  static std::shared_ptr<SXAccessControlStore> store() { return SXAccessControlStore::sharedStore(); }
  void grant(const std::string &provider, const std::string &item, const std::string &consumer) {
    store()->allowProviderWithIdentifier(provider, item, consumer);
    trace();
    platform().log().take();
  }

  [[nodiscard]] std::string itemText() const { return item_->absoluteString(); }
  static std::string token(const URL &url) { return "<" + fake::FakeSandbox::tokenFor(url.path()) + ">"; }

  /// Two lines: the request arrives, and is served.
  static std::vector<std::string> served(std::string_view name, const Arguments &arguments) {
    return {"request peer 100 " + std::string(name) + " " + fake::traced(arguments),
            "log debug [DEBUG] Serving: " + std::string(name)};
  }
  static std::string reply(std::string_view name, const std::string &values, const std::string &where) {
    return "reply peer 100 " + std::string(name) + " " + values + " on " + where;
  }
  static constexpr const char *global = "queue global queue";
  static constexpr const char *platformThread = "platform thread";

  static std::string compared(const std::string &provider, const URL &url) {
    return "directoryRelationship " + storageText(provider) + " " + url.absoluteString();
  }

  /// The registry finds the owner of the item.
  [[nodiscard]] std::vector<std::string> ownerFound() const {
    return {compared("org.a", *item_), "log info [INFO] Resolved URL to provider org.a."};
  }

  std::shared_ptr<StoreOwner> server_;
  std::shared_ptr<fake::FakeClientConnection> client_;
  std::optional<URL> item_;
};

}  // namespace storix
