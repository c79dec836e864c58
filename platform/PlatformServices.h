#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/AuditToken.h"
#include "platform/Connections.h"
#include "platform/Extensions.h"
#include "platform/FileCoordination.h"
#include "platform/Log.h"
#include "platform/OnceToken.h"
#include "platform/Protocol.h"
#include "platform/Queue.h"
#include "platform/Result.h"
#include "platform/SXError.h"
#include "platform/URL.h"
#include "platform/Value.h"

namespace storix {

/// A file opened for reading. Used by one thread at a time.
class InputStream {
 public:
  virtual ~InputStream() = default;
};

enum class DirectoryRelationship { contains = 0, same = 1, other = 2 };

enum class SandboxExtensionClass { readWrite };

/// What `checkSandboxAccess` compares, and how.
enum class SandboxFilter : unsigned { path = 1, noReport = 2, pathNoReport = path | noReport };

/// Which parts of what was read may be changed in place.
enum class KeyedValueMutability { immutable = 0, containers = 1, containersAndLeaves = 2 };

inline constexpr int deviceLockStateNoPasscode = 3;

/// The one door to the operating system: everything the logic wants from outside goes through here.
/// `platform/linux/` is the real host and `platform/fake/` the one in memory.
///
/// Every function may be called from any thread unless it says otherwise. None throws: what can fail
/// says so in its result. Handlers run on threads that the platform chooses, never inside the call
/// that takes them. Paths are bytes of the file system.
class PlatformServices {
 public:
  virtual ~PlatformServices() = default;

  // --- Process and event loop

  /// Runs the main thread's event loop, on which system notifications are delivered. Returns only
  /// when the process was asked to end. Call it on the main thread, once.
  virtual void runEventLoop() = 0;

  /// The home directory of the user that the daemon runs as.
  virtual std::string homeDirectory() = 0;

  // --- Named service (connections: Connections.h; interfaces: Protocol.h)

  /// A listener on that service, suspended.
  virtual std::shared_ptr<ServiceListener> createServiceListener(std::string_view serviceName) = 0;

  // --- Identity and sandbox

  /// The bundle identifier of that process; absent when it has none or is gone.
  virtual std::optional<std::string> bundleIdentifierForAuditToken(const AuditToken &token) = 0;

  /// 0 when the process may do `operation` ("file-write-data") on the path, else not 0.
  virtual int checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                                 const std::string &path) = 0;

  /// The text of a token that lets its bearer open the path, or none. `flags` is 0.
  virtual std::optional<std::string> issueSandboxExtension(SandboxExtensionClass extensionClass,
                                                           const std::string &path, std::uint32_t flags) = 0;

  // --- Device lock state and system notifications

  /// An integer of which only 3, a device without a passcode, has a meaning here.
  virtual int deviceLockState() = 0;
  virtual bool deviceUnlockedSinceBoot() = 0;

  /// Calls back, on the main event loop, on every delivery of the notification, for ever.
  virtual void addSystemNotificationObserver(std::string_view name, std::function<void()> callback) = 0;

  // --- Files

  /// True when anything, file or directory, is at the path.
  virtual bool fileExists(const std::string &path) = 0;

  /// Makes the directory and, if asked, those above it that are missing. None on success.
  virtual std::optional<SXError> createDirectory(const std::string &path, bool withIntermediateDirectories) = 0;

  /// Null when the file cannot be opened.
  virtual std::unique_ptr<InputStream> openFileInputStream(const std::string &path) = 0;

  /// Reads the stream to its end as keyed-value text.
  virtual Result<Value> readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) = 0;

  /// Writes the whole file or leaves it as it was; true when it is safely on the disk. A reader
  /// never sees half a file.
  virtual bool writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) = 0;

  /// How the item lies to the directory. The directory must exist, else `fileNotFoundForReading`
  /// with the directory's URL; the item need not. An absent URL is an error.
  virtual Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                              const std::optional<URL> &item) = 0;

  // --- Extensions (records and requests: Extensions.h)

  /// Finds the extensions with those attributes and calls the handler with the complete list, at
  /// first and again whenever the set changes, one call at a time. Discovery lasts as long as the
  /// handle.
  virtual std::shared_ptr<ExtensionMatching> beginMatchingExtensions(const Dictionary &attributes,
                                                                     ExtensionMatchingHandler handler) = 0;

  /// The record of the installed bundle, or null.
  virtual std::shared_ptr<BundleRecord> bundleRecordForIdentifier(const std::optional<std::string> &identifier) = 0;

  /// Makes a context class known by its name, before the first request begins.
  virtual void registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) = 0;

  // --- File coordination

  virtual FileCoordinationService &fileCoordinationService() = 0;

  // --- Concurrency (what queues promise: Queue.h; run once: OnceToken.h)

  virtual std::shared_ptr<SerialQueue> createSerialQueue(std::string label) = 0;
  virtual std::shared_ptr<ConcurrentQueue> createConcurrentQueue(std::string label) = 0;
  virtual std::shared_ptr<OperationQueue> createOperationQueue(std::string name) = 0;

  /// The shared default-priority concurrent queue.
  virtual const std::shared_ptr<ConcurrentQueue> &globalQueue() = 0;

  /// Submits the task to the queue when the delay has passed.
  virtual void runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) = 0;

  // --- Log (messages: Log.h)

  virtual LogSink &logSink() = 0;
};

}  // namespace storix
