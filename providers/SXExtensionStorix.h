#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "access/SXAccessControl.h"
#include "platform/Extensions.h"
#include "platform/FileCoordination.h"
#include "platform/Queue.h"
#include "platform/SXError.h"
#include "platform/URL.h"
#include "providers/_KTStorixVendor.h"

namespace storix {

/// Ends the one extension request that it was made for.
using CancelRequest = std::function<void()>;

/// Gets an error, or the proxy to talk to, and what ends the request. Called a second time, with an
/// error, when the connection fails before a message's reply.
using ExtensionRequestHandler =
    std::function<void(std::optional<SXError>, std::shared_ptr<_KTStorixVendor>, CancelRequest)>;

/// One installed provider extension; and, on its class side, the registry of all of them.
///
/// The registry's map owns the objects, and so does every task and request in flight. Thread-safe,
/// but for the plain accessors of the fields. What fails in an extension comes back as an error in a
/// completion handler, on the thread on which the platform reports it; handlers may be empty. When a
/// connection fails late a completion can be called a second time: nothing here prevents it.
class SXExtensionStorix : public KTStorix, public std::enable_shared_from_this<SXExtensionStorix> {
 public:
  using Identifier = std::optional<std::string>;
  using ErrorCompletion = CompletionHandler<SXError>;

  // --- The registry (its state and how it works: ProviderRegistry.h)

  static void createInstancesCompletion(std::function<void()> completion);
  static void refreshOperationsQueueRegisterProviders(std::vector<std::shared_ptr<SXExtensionStorix>> providers,
                                                      std::function<void()> completion);
  static void setStorixAccessControl(const std::shared_ptr<SXAccessControl> &accessControl);
  /// The flag (which may be null) tells whether the URL is a provider's directory itself, which
  /// belongs to nobody.
  static std::shared_ptr<SXExtensionStorix> providerForURL(const std::optional<URL> &url, bool *outExcludedURL);
  static std::shared_ptr<SXExtensionStorix> providerForURL(const std::optional<URL> &url);
  static Dictionary providersInfo();
  static std::shared_ptr<SXExtensionStorix> providerWithIdentifier(const Identifier &identifier);

  // --- The object (SXExtensionStorix.cc)

  static std::shared_ptr<SXExtensionStorix> initWithExtension(std::shared_ptr<ExtensionRecord> extension);

  /// Each reads on the member queue; each setter returns before the value is stored.
  std::shared_ptr<ExtensionRecord> extension();
  void setExtension(std::shared_ptr<ExtensionRecord> extension);
  Identifier identifier();
  void setIdentifier(Identifier identifier);
  std::optional<URL> providedItemsURL();
  void setProvidedItemsURL(std::optional<URL> url);

  /// Plain, for tasks on the member queue; the two queues never change.
  [[nodiscard]] const std::shared_ptr<OperationQueue> &operationQueue() const { return operationQueue_; }
  void setOperationQueue(std::shared_ptr<OperationQueue> queue) { operationQueue_ = std::move(queue); }
  [[nodiscard]] const std::shared_ptr<ConcurrentQueue> &memberQueue() const { return memberQueue_; }
  void setMemberQueue(std::shared_ptr<ConcurrentQueue> queue) { memberQueue_ = std::move(queue); }
  [[nodiscard]] const Identifier &memberQueueIdentifier() const { return memberQueueIdentifier_; }
  void setMemberQueueIdentifier(Identifier identifier) { memberQueueIdentifier_ = std::move(identifier); }
  [[nodiscard]] const std::shared_ptr<ExtensionRecord> &memberQueueExtension() const { return memberQueueExtension_; }
  void setMemberQueueExtension(std::shared_ptr<ExtensionRecord> record) { memberQueueExtension_ = std::move(record); }
  [[nodiscard]] const std::optional<URL> &memberQueueProvidedItemsURL() const { return memberQueueProvidedItemsURL_; }
  void setMemberQueueProvidedItemsURL(std::optional<URL> url) { memberQueueProvidedItemsURL_ = std::move(url); }

  // --- The request channel (ExtensionRequestChannel.cc)

  /// Null when there is no context for that request or no proxy. `errorHandler` may be empty.
  std::shared_ptr<_KTStorixVendor> proxyForIdentifier(const std::optional<RequestIdentifier> &identifier,
                                                      ConnectionErrorHandler errorHandler);
  /// The request stays open until the handler, or whoever it tells, calls the cancel callback.
  void performExtensionRequest(ExtensionRequestHandler handler);

  // --- Registration with the file coordination service (FileCoordinatorRegistration.cc)

  /// `retryCount` tries at most, this one included, two seconds apart.
  void registerWithFileCoordinatorRetryCount(std::int32_t retryCount, ErrorCompletion completion);
  void retryRegisterWithFileCoordinatorRetryCount(std::int32_t retryCount, SXError lastError,
                                                  ErrorCompletion completion);
  void registerWithFileCoordinatorCompletion(ErrorCompletion completion);
  void unregisterFromFileCoordinator();

  // --- Item operations (ItemOperations.cc)

  void providePlaceholderForItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler);
  void startProvidingItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler);
  void stopProvidingItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler);
  void itemIDForURL(std::optional<URL> url, CompletionHandler<SXError, std::string> completionHandler);
  void URLForItemID(Identifier itemID, CompletionHandler<SXError, URL> completionHandler);
  void itemChangedAtURL(std::optional<URL> url);

  // --- What the file coordination service asks (FileCoordinatorCallbacks.cc)

  std::optional<URL> _providedItemsURL() override;
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override;
  std::optional<std::string> _fileReactorID() override;
  [[nodiscard]] bool answers(OptionalMember member) const override;
  void _provideItemAtURL(std::optional<URL> url, Completion completionHandler) override;
  void _provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                         Completion completionHandler) override;
  void _writerWithID(std::optional<std::string> writerID, std::optional<URL> didFinishWritingForURL) override;

 private:
  explicit SXExtensionStorix(std::shared_ptr<ExtensionRecord> extension);

  std::shared_ptr<OperationQueue> operationQueue_;
  std::shared_ptr<ConcurrentQueue> memberQueue_;
  // Guarded by the member queue.
  Identifier memberQueueIdentifier_;
  std::shared_ptr<ExtensionRecord> memberQueueExtension_;
  std::optional<URL> memberQueueProvidedItemsURL_;
};

}  // namespace storix
