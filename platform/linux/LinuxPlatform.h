#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/PlatformServices.h"
#include "platform/Result.h"
#include "platform/ThreadPool.h"
#include "platform/linux/EventLoop.h"
#include "platform/linux/HostEnvironment.h"
#include "platform/linux/LockState.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/RuntimeDirectory.h"
#include "platform/linux/coordination/FileCoordination.h"
#include "platform/linux/extensions/ExtensionHost.h"
#include "platform/linux/files/Files.h"
#include "platform/linux/identity/Peers.h"
#include "platform/linux/identity/Sandbox.h"
#include "platform/linux/sockets/ConnectionLimit.h"
#include "platform/linux/sockets/IoLoop.h"
#include "platform/linux/sockets/NamedSockets.h"

namespace storix::linuxhost {

inline constexpr std::string_view serviceSocketName = "com.tessel.Storix";
inline constexpr std::string_view platformSocketName = "com.tessel.Platform";

/// A sentence for the log, where the service manager hands over one of the two sockets alone.
std::optional<std::string> missingSocketWarning(const ActivatedSockets &activated);

/// The Linux host: puts its facilities together, each of which has a file of its own, and hands every
/// call to the one it belongs to. `main` owns it; the process scope comes and goes within its life.
class LinuxPlatform final : public PlatformServices {
 public:
  /// Takes the runtime directory, makes the sockets (or uses those of `activated`, which must not hold
  /// any other) and serves the platform's. On the main thread, before any other thread starts. The error
  /// is a sentence that says what is wrong and what to do.
  static Result<std::unique_ptr<LinuxPlatform>> create(HostEnvironment environment, ActivatedSockets activated = {});
  ~LinuxPlatform() override;

  /// Ends all that is going on: requests, connections, extension processes and threads. When it returns
  /// nothing calls into the logic any more, so that the process scope may go. `runEventLoop` does it at
  /// its end; a second call does nothing. On the main thread.
  void shutDown();

  /// For whoever stands for the platform socket.
  Notifications &notifications() { return notifications_; }

  void runEventLoop() override;
  std::string homeDirectory() override { return environment_.homeDirectory; }
  /// Of "com.tessel.Storix"; null for any other name.
  std::shared_ptr<ServiceListener> createServiceListener(std::string_view serviceName) override;
  std::optional<std::string> bundleIdentifierForAuditToken(const AuditToken &token) override;
  int checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                         const std::string &path) override;
  std::optional<std::string> issueSandboxExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                                   std::uint32_t flags) override;
  int deviceLockState() override { return lockState_.lockState(); }
  bool deviceUnlockedSinceBoot() override { return lockState_.unlockedSinceBoot(); }
  void addSystemNotificationObserver(std::string_view name, std::function<void()> callback) override;
  bool fileExists(const std::string &path) override { return Files::fileExists(path); }
  std::optional<SXError> createDirectory(const std::string &path, bool withIntermediateDirectories) override;
  std::unique_ptr<InputStream> openFileInputStream(const std::string &path) override;
  Result<Value> readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) override;
  bool writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) override;
  Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                      const std::optional<URL> &item) override;
  std::shared_ptr<ExtensionMatching> beginMatchingExtensions(const Dictionary &attributes,
                                                             ExtensionMatchingHandler handler) override;
  std::shared_ptr<BundleRecord> bundleRecordForIdentifier(const std::optional<std::string> &identifier) override;
  void registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) override;
  FileCoordinationService &fileCoordinationService() override { return fileCoordination_; }
  std::shared_ptr<SerialQueue> createSerialQueue(std::string label) override;
  std::shared_ptr<ConcurrentQueue> createConcurrentQueue(std::string label) override;
  std::shared_ptr<OperationQueue> createOperationQueue(std::string name) override;
  const std::shared_ptr<ConcurrentQueue> &globalQueue() override { return globalQueue_; }
  void runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) override;
  LogSink &logSink() override { return *logSink_; }

 private:
  LinuxPlatform(HostEnvironment environment, std::unique_ptr<EventLoop> eventLoop,
                std::unique_ptr<RuntimeDirectory> runtimeDirectory, std::shared_ptr<PeerTable> peers,
                std::unique_ptr<Sandbox> sandbox);
  [[nodiscard]] std::optional<SXError> openSockets(ActivatedSockets activated);

  // What stands further down uses what stands above it.
  const HostEnvironment environment_;
  const std::unique_ptr<LogSink> logSink_;
  const std::unique_ptr<EventLoop> eventLoop_;
  const std::unique_ptr<RuntimeDirectory> runtimeDirectory_;
  ThreadPool pool_;
  const std::shared_ptr<ConcurrentQueue> globalQueue_;
  IoLoop ioLoop_;
  ConnectionLimit connectionLimit_;
  LockState lockState_;
  Notifications notifications_;
  Files files_;
  const std::shared_ptr<PeerTable> peers_;
  const std::unique_ptr<Sandbox> sandbox_;
  // Until `shutDown`.
  std::unique_ptr<ExtensionHost> extensions_;
  FileCoordination fileCoordination_;
  // Until `shutDown`.
  std::unique_ptr<NamedSocket> serviceSocket_;
  std::unique_ptr<NamedSocket> platformSocket_;
};

}  // namespace storix::linuxhost
