#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/PlatformServices.h"
#include "platform/fake/FakeConnections.h"
#include "platform/fake/FakeExtensions.h"
#include "platform/fake/FakeFileCoordination.h"
#include "platform/fake/FakeFiles.h"
#include "platform/fake/FakeLog.h"
#include "platform/fake/FakeSandbox.h"
#include "platform/fake/FakeThreads.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// The host in memory. The test that makes it plays everything outside the logic: the processes that
/// connect, the extensions, the files, the device and, with manual queues, the threads and the clock.
/// All that the logic does with it is in the trace.
///
/// With manual queues nothing runs until `runUntilIdle` or `runOne`. With threads everything runs by
/// itself, `runUntilIdle` waits for it, and delays take their time.
class FakePlatform final : public PlatformServices {
 public:
  struct Options {
    FakeExecutor::Kind queues = FakeExecutor::Kind::manual;
    std::string homeDirectory = "/home/u";
  };
  /// A task that was given to `runAfterDelay` and has not been submitted yet.
  struct DelayedTask {
    std::uint64_t nanoseconds;
    std::string queueLabel;
  };

  static std::unique_ptr<FakePlatform> create();
  static std::unique_ptr<FakePlatform> create(Options options);
  ~FakePlatform() override;

  // --- What tests use

  Trace &trace() { return trace_; }
  FakeLog &log() { return log_; }
  FakeFiles &files() { return files_; }
  FakeSandbox &sandbox() { return sandbox_; }
  FakeConnections &connections() { return connections_; }
  FakeExtensions &extensions() { return extensions_; }
  FakeFileCoordination &fileCoordination() { return fileCoordination_; }
  FakeExecutor &executor() { return executor_; }

  std::shared_ptr<FakeClientConnection> connect(std::string_view serviceName, FakePeer peer) {
    return connections_.connect(serviceName, std::move(peer));
  }

  void runUntilIdle() { executor_.runUntilIdle(); }
  bool runOne() { return executor_.runOne(); }
  /// Moves the clock of manual queues. What is due is submitted by the next `runUntilIdle`.
  void advance(std::chrono::nanoseconds time) { executor_.advance(time); }
  [[nodiscard]] std::vector<DelayedTask> delayedTasks() const;

  void setDeviceLockState(int state);
  void setDeviceUnlockedSinceBoot(bool unlocked);
  /// Delivered on the main event loop: with manual queues as a task like every other, with threads
  /// while `runEventLoop` runs.
  void postNotification(const std::string &name);
  /// Makes `runEventLoop` return (with threads; with manual queues it returns once all is idle).
  void endEventLoop();

  /// Ends what the outside does: closes the connections, ends discoveries, requests and file
  /// coordination, drops delayed tasks and observers, and lets what is left run. Before the process
  /// scope goes, so that nothing of the logic is held any more.
  void shutDown();

  // --- PlatformServices
  void runEventLoop() override;
  std::string homeDirectory() override;
  std::shared_ptr<ServiceListener> createServiceListener(std::string_view serviceName) override;
  std::optional<std::string> bundleIdentifierForAuditToken(const AuditToken &token) override;
  int checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                         const std::string &path) override;
  std::optional<std::string> issueSandboxExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                                   std::uint32_t flags) override;
  int deviceLockState() override;
  bool deviceUnlockedSinceBoot() override;
  void addSystemNotificationObserver(std::string_view name, std::function<void()> callback) override;
  bool fileExists(const std::string &path) override;
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
  LogSink &logSink() override { return log_; }

  /// The label of `globalQueue`, as it stands in traces.
  static constexpr const char *globalQueueLabel = "global queue";

 private:
  struct Delayed {
    std::uint64_t nanoseconds;
    std::shared_ptr<Queue> queue;
    Task task;
  };

  explicit FakePlatform(Options options);
  void submitDelayed(std::uint64_t number);
  void deliverNotification(const std::string &name);

  const Options options_;

  // Guarded by `mutex_`. They stand before the executor, whose threads may use them until it is gone.
  mutable std::mutex mutex_;
  int lockState_ = deviceLockStateNoPasscode;
  bool unlockedSinceBoot_ = true;
  std::multimap<std::string, std::function<void()>, std::less<>> observers_;
  std::uint64_t nextDelayed_ = 0;
  std::map<std::uint64_t, Delayed> delayed_;
  std::deque<std::string> notifications_;
  bool eventLoopEnds_ = false;
  std::condition_variable eventLoopHasWork_;

  FakeExecutor executor_;
  Trace trace_;
  FakeLog log_{trace_};
  FakeFiles files_{trace_};
  FakeSandbox sandbox_{trace_};
  FakeConnections connections_{executor_, trace_};
  FakeExtensions extensions_{executor_, trace_};
  FakeFileCoordination fileCoordination_{trace_};
  std::shared_ptr<ConcurrentQueue> globalQueue_;
};

}  // namespace storix::fake
