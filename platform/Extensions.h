#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Protocol.h"
#include "platform/SXError.h"

namespace storix {

/// The UUID that the platform gives to one extension request, as text.
struct RequestIdentifier {
  std::string uuid;
  [[nodiscard]] const std::string &description() const { return uuid; }
  friend auto operator<=>(const RequestIdentifier &, const RequestIdentifier &) = default;
};

using ConnectionErrorHandler = std::function<void(SXError)>;

/// The connection to an extension's process for one request. Thread-safe.
class AuxiliaryConnection {
 public:
  virtual ~AuxiliaryConnection() = default;
  /// The object at the other end, or null. The handler runs on a thread of the platform's choosing,
  /// once for each message sent through this object that could not be delivered or whose reply the
  /// connection did not live to see; it may be empty.
  virtual std::shared_ptr<RemoteObject> remoteProxyWithErrorHandler(ConnectionErrorHandler errorHandler) = 0;
};

/// The host side of one extension request.
class ExtensionContext {
 public:
  explicit ExtensionContext(std::shared_ptr<AuxiliaryConnection> auxiliaryConnection)
      : auxiliaryConnection_(std::move(auxiliaryConnection)) {}
  virtual ~ExtensionContext() = default;
  [[nodiscard]] const std::shared_ptr<AuxiliaryConnection> &auxiliaryConnection() const { return auxiliaryConnection_; }

 private:
  std::shared_ptr<AuxiliaryConnection> auxiliaryConnection_;
};

/// The class side of a context: which interfaces a request's connection is built from, and how to
/// make the context. The platform finds it by its name when it makes the context of a request.
struct ExtensionContextClass {
  std::function<const LinkInterface &()> auxiliaryHostProtocol;
  std::function<const LinkInterface &()> auxiliaryVendorProtocol;
  std::function<std::shared_ptr<ExtensionContext>(std::shared_ptr<AuxiliaryConnection>)> make;
};

/// One installed application extension. Thread-safe and unchanging.
class ExtensionRecord {
 public:
  /// Gets the identifier of the request that was begun, or the error. On an error the identifier
  /// is that of the failed request, or absent.
  using BeginHandler = std::function<void(std::optional<RequestIdentifier>, std::optional<SXError>)>;

  virtual ~ExtensionRecord() = default;

  /// The bundle identifier, or absent.
  [[nodiscard]] virtual std::optional<std::string> identifier() const = 0;
  /// Whether both records denote the same state of the same extension.
  [[nodiscard]] virtual bool isEqual(const ExtensionRecord &other) const = 0;
  /// Text for logs.
  [[nodiscard]] virtual std::string description() const = 0;

  /// Starts a request, without input items; the extension's process is kept alive while it is open.
  /// The handler runs once, on a thread of the platform's choosing, never inside this call.
  virtual void beginExtensionRequest(BeginHandler completion) = 0;
  /// Ends that request. An identifier that is unknown or ended is ignored.
  virtual void cancelExtensionRequest(const RequestIdentifier &request) = 0;
  /// The context of an open request, or null.
  virtual std::shared_ptr<ExtensionContext> extensionContextForRequest(const RequestIdentifier &request) = 0;
};

/// Registry record of an installed extension bundle. Thread-safe and unchanging.
class BundleRecord {
 public:
  virtual ~BundleRecord() = default;
  /// The value of that key in the bundle's info dictionary; absent when there is none or it is of
  /// another kind.
  [[nodiscard]] virtual std::optional<Value> infoDictionaryValue(std::string_view key,
                                                                 ValueKind expectedKind) const = 0;
  /// Group identifier to the group's container directory (a directory URL).
  [[nodiscard]] virtual std::map<std::string, URL> groupContainerURLs() const = 0;
};

/// Keeps a discovery active as long as it lives.
class ExtensionMatching {
 public:
  virtual ~ExtensionMatching() = default;
};

/// Gets the complete current list, and an error where looking failed in part; an empty list where it
/// failed altogether.
using ExtensionMatchingHandler =
    std::function<void(std::vector<std::shared_ptr<ExtensionRecord>>, std::optional<SXError>)>;

/// The attribute of `beginMatchingExtensions` that names the extension point.
inline constexpr std::string_view extensionPointAttribute = "KTExtensionPointIdentifier";

}  // namespace storix
