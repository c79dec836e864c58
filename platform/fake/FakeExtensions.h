#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Extensions.h"
#include "platform/fake/FakeExtensionProcess.h"
#include "platform/fake/FakeThreads.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// What a bundle's registry record says.
struct FakeBundle {
  Dictionary info;
  std::map<std::string, URL> groupContainers;
};

/// An installed extension as a test describes it. Two records are equal when identifier, version and
/// bundle are.
struct FakeExtension {
  std::optional<std::string> identifier;
  std::string version = "1";
  std::optional<FakeBundle> bundle;
  /// For logs; none: the identifier and the version, "org.sample.docs version 1".
  std::optional<std::string> description;
  std::string extensionPoint = "com.tessel.storix-nonui";
};

/// A complete provider: its document group is "group." + identifier, that group's container
/// "file:///groups/group.<identifier>/". So its items lie below
/// "/groups/group.<identifier>/Storix Storage", a directory that nobody has made yet.
FakeExtension completeProvider(const std::string &identifier, std::string version = "1");

/// Installed extensions, their discovery and their requests. Requests are called "request-1",
/// "request-2", ... in the order in which they begin. Thread-safe.
class FakeExtensions {
 public:
  FakeExtensions(FakeExecutor &executor, Trace &trace);
  ~FakeExtensions();

  // --- What tests arrange

  /// Adds an extension at the end of the list, or puts it in the place of the one that has the same
  /// identifier. Nobody is told before `deliver`.
  void install(FakeExtension extension);
  /// Adds it at the end though another may have its identifier, as a host might that found it twice.
  void installBeside(FakeExtension extension);
  void remove(std::string_view identifier);

  /// Whether a discovery is told the list as it begins, without the test's doing; it is at first.
  void setDeliversAtFirst(bool delivers);
  /// Tells every discovery the list of now. May be called several times in a row.
  void deliver(std::optional<SXError> error = std::nullopt);

  /// A record of such an extension, installed or not.
  std::shared_ptr<ExtensionRecord> makeRecord(FakeExtension extension);
  /// The script of the extension with that identifier, whatever version is installed.
  FakeExtensionProcess &process(std::string_view identifier);

  /// Requests that have no context, or whose connection yields no proxy; they need not have begun.
  void removeContext(const std::string &request);
  void removeProxy(const std::string &request);
  /// Reports a failure of the request's connection, once to each proxy that was taken from it,
  /// whether or not its messages were answered.
  void reportConnectionFailure(const std::string &request, SXError error);

  [[nodiscard]] std::vector<std::string> openRequests() const;

  /// Ends every discovery and request and drops the answers that are held.
  void clear();

  // --- The platform's operations
  std::shared_ptr<ExtensionMatching> beginMatchingExtensions(const Dictionary &attributes,
                                                             ExtensionMatchingHandler handler);
  std::shared_ptr<BundleRecord> bundleRecordForIdentifier(const std::optional<std::string> &identifier);
  void registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass);

 private:
  friend class FakeExtensionRecord;
  friend class FakeAuxiliaryConnection;
  friend class FakeRemoteObject;
  class Matching;
  struct Request {
    std::string extension;
    std::shared_ptr<ExtensionContext> context;
    std::vector<ConnectionErrorHandler> errorHandlers;
  };

  void begin(const FakeExtension &extension, ExtensionRecord::BeginHandler completion);
  void cancel(const FakeExtension &extension, const RequestIdentifier &request);
  std::shared_ptr<ExtensionContext> context(const FakeExtension &extension, const RequestIdentifier &request);
  std::shared_ptr<RemoteObject> proxy(const RequestIdentifier &request, const ProtocolDescription &protocol,
                                      ConnectionErrorHandler errorHandler);
  /// Sends a message; when the request has ended that is a failure of the connection.
  void send(const RequestIdentifier &request, const OperationDescription &operation, const Arguments &arguments,
            ReplyHandler reply, const ConnectionErrorHandler &errorHandler);
  void deliverTo(const std::shared_ptr<Matching> &matching, std::optional<SXError> error);

  FakeExecutor &executor_;
  Trace &trace_;

  mutable std::mutex mutex_;
  bool deliversAtFirst_ = true;
  std::vector<FakeExtension> installed_;
  std::map<std::string, std::unique_ptr<FakeExtensionProcess>, std::less<>> processes_;
  std::vector<std::weak_ptr<Matching>> matchings_;
  std::map<std::string, ExtensionContextClass, std::less<>> contextClasses_;
  std::size_t requestCount_ = 0;
  std::map<std::string, Request> requests_;
  std::set<std::string> withoutContext_;
  std::set<std::string> withoutProxy_;
};

}  // namespace storix::fake
