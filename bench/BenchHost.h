#pragma once

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "platform/PlatformServices.h"
#include "platform/ThreadPool.h"
#include "platform/linux/files/Files.h"

namespace storix::bench {

/// A host for measuring the logic inside this process: real threads, real files and real directories,
/// and providers that are neither found on a disk nor have a process, but answer where they are asked.
/// Owned by a benchmark, longer than its process scope. Nobody connects: there are no peers.
class BenchHost final : public PlatformServices {
 public:
  /// Looks for the access-control file in that home.
  explicit BenchHost(std::filesystem::path home);
  ~BenchHost() override;

  /// From now on these providers are installed; their directories lie below `groups`. Waits until whoever
  /// looks for extensions has been told, if somebody does.
  void install(const std::vector<std::string> &identifiers, const std::filesystem::path &groups);

  /// No task runs or comes any more.
  void end();

  void runEventLoop() override {}
  std::string homeDirectory() override { return home_; }
  std::shared_ptr<ServiceListener> createServiceListener(std::string_view serviceName) override;
  std::optional<std::string> bundleIdentifierForAuditToken(const AuditToken &token) override;
  int checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                         const std::string &path) override;
  std::optional<std::string> issueSandboxExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                                   std::uint32_t flags) override;
  int deviceLockState() override { return deviceLockStateNoPasscode; }
  bool deviceUnlockedSinceBoot() override { return true; }
  void addSystemNotificationObserver(std::string_view name, std::function<void()> callback) override;
  bool fileExists(const std::string &path) override { return linuxhost::Files::fileExists(path); }
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
  FileCoordinationService &fileCoordinationService() override;
  std::shared_ptr<SerialQueue> createSerialQueue(std::string label) override;
  std::shared_ptr<ConcurrentQueue> createConcurrentQueue(std::string label) override;
  std::shared_ptr<OperationQueue> createOperationQueue(std::string name) override;
  const std::shared_ptr<ConcurrentQueue> &globalQueue() override { return globalQueue_; }
  void runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) override;
  LogSink &logSink() override;

 private:
  const std::string home_;
  ThreadPool pool_;
  const std::shared_ptr<ConcurrentQueue> globalQueue_;
  linuxhost::Files files_;
  const std::unique_ptr<FileCoordinationService> coordination_;
  const std::unique_ptr<LogSink> log_;
  std::vector<std::shared_ptr<ExtensionRecord>> records_;
  std::filesystem::path groups_;
  ExtensionMatchingHandler matching_;
};

}  // namespace storix::bench
