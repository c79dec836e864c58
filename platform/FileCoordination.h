#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/Queue.h"
#include "platform/SXError.h"
#include "platform/URL.h"

namespace storix {

/// What the file coordination service asks of a registered provider. The callbacks are called on
/// `_providedItemsOperationQueue`.
class KTStorix {
 public:
  /// Absent on success.
  using Completion = std::function<void(std::optional<SXError>)>;

  /// Members that a provider may leave out.
  enum class OptionalMember {
    provideItemAtURLToReaderWithID,
    cancelProvidingItemAtURLToReaderWithID,
    physicalURLForURL,
    writerWithIDDidFinishWritingForURL,
    providedItemAtURLDidGainPresenterWithID,
    providedItemAtURLDidLosePresenterWithID,
    providedItemAtURLWithPresenterWithIDDidMoveToURL,
    fileReactorID,
  };

  virtual ~KTStorix() = default;

  virtual std::optional<URL> _providedItemsURL() = 0;
  virtual std::shared_ptr<OperationQueue> _providedItemsOperationQueue() = 0;
  /// `completionHandler` may be called on any thread, and more than once; the first call counts.
  virtual void _provideItemAtURL(std::optional<URL> url, Completion completionHandler) = 0;

  /// Whether the provider answers an optional member. The service asks before it calls one.
  [[nodiscard]] virtual bool answers(OptionalMember member) const = 0;

  // Optional members. A provider that answers one overrides it.
  virtual void _provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                                 Completion completionHandler);
  virtual void _cancelProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID);
  virtual std::optional<URL> _physicalURLForURL(std::optional<URL> url);
  virtual void _writerWithID(std::optional<std::string> writerID, std::optional<URL> didFinishWritingForURL);
  virtual void _providedItemAtURLDidGainPresenterWithID(std::optional<URL> url, std::optional<std::string> presenterID);
  virtual void _providedItemAtURLDidLosePresenterWithID(std::optional<URL> url, std::optional<std::string> presenterID);
  virtual void _providedItemAtURLWithPresenterWithIDDidMoveToURL(std::optional<URL> url,
                                                                 std::optional<std::string> presenterID,
                                                                 std::optional<URL> newURL);
  virtual std::optional<std::string> _fileReactorID();
};

/// The cross-process file coordination service. Thread-safe.
class FileCoordinationService {
 public:
  virtual ~FileCoordinationService() = default;
  /// From now on coordinated reads and writes, by any process, of files below the provider's
  /// `_providedItemsURL` call it back. The service holds the provider until it is removed.
  virtual void addProvider(std::shared_ptr<KTStorix> provider) = 0;
  /// Withdraws it; no callback starts after this has returned. One that was never added is ignored.
  virtual void removeProvider(const std::shared_ptr<KTStorix> &provider) = 0;
};

}  // namespace storix
