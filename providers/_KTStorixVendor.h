#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/ProtocolTable.h"

namespace storix {

// The protocol's own name begins with an underscore.
// NOLINTBEGIN(bugprone-reserved-identifier)

/// What every provider extension exports to the daemon. All operations answer through a handler; an
/// absent error means success. The error stands last in the replies of the first two operations and
/// first in those of the last two: that is part of the contract.
class _KTStorixVendor {
 public:
  virtual ~_KTStorixVendor() = default;

  /// string, URL, error. The daemon reads the error alone.
  virtual void _performInitialSetupWithCompletion(CompletionHandler<std::string, URL, SXError> completion) = 0;
  /// URL, error. The daemon reads the error alone.
  virtual void _providePlaceholderAtURL(std::optional<URL> url, CompletionHandler<URL, SXError> completion) = 0;
  virtual void _startProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) = 0;
  virtual void _itemChangedAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) = 0;
  virtual void _stopProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) = 0;
  /// error, item identifier
  virtual void _identifierForItemAtURL(std::optional<URL> url, CompletionHandler<SXError, std::string> completion) = 0;
  /// error, URL
  virtual void _URLForItemIdentifier(std::optional<std::string> itemIdentifier,
                                     CompletionHandler<SXError, URL> completion) = 0;
};

const ProtocolTable<_KTStorixVendor> &_KTStorixVendorProtocol();

/// A `_KTStorixVendor` that sends every operation to the extension at the other end of a connection.
class _KTStorixVendorProxy : public _KTStorixVendor {
 public:
  explicit _KTStorixVendorProxy(std::shared_ptr<RemoteObject> remote) : remote_(std::move(remote)) {}

  void _performInitialSetupWithCompletion(CompletionHandler<std::string, URL, SXError> completion) override;
  void _providePlaceholderAtURL(std::optional<URL> url, CompletionHandler<URL, SXError> completion) override;
  void _startProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override;
  void _itemChangedAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override;
  void _stopProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override;
  void _identifierForItemAtURL(std::optional<URL> url, CompletionHandler<SXError, std::string> completion) override;
  void _URLForItemIdentifier(std::optional<std::string> itemIdentifier,
                             CompletionHandler<SXError, URL> completion) override;

 private:
  std::shared_ptr<RemoteObject> remote_;
};

// NOLINTEND(bugprone-reserved-identifier)

}  // namespace storix
