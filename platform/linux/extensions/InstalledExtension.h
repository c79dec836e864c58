#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Executor.h"
#include "platform/Extensions.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/extensions/ExtensionProcess.h"

namespace storix::linuxhost {

/// What the records of all extensions share. Thread-safe; made and owned by `ExtensionHost`, and
/// outlived by records that somebody still holds.
class ExtensionSurroundings {
 public:
  virtual ~ExtensionSurroundings() = default;

  /// None when the class is unknown.
  virtual std::optional<ExtensionContextClass> contextClass(std::string_view name) = 0;

  /// Starts a process, and owns it until it is reaped. The handlers `ready` and `failed` are the
  /// caller's. Null when the daemon is ending.
  virtual std::shared_ptr<ExtensionProcess> startProcess(const ExtensionBundle &bundle, std::string executable,
                                                         ExtensionProcess::Handlers handlers) = 0;
};

/// The record of one installed bundle, and the life of its process: one at a time, started when a
/// request begins, shared by all open requests, ended when there has been none for a while. Thread-safe.
///
/// Begins that come while the process starts wait for it, so many at most; a further one fails at once.
/// A process that fails fails the begins that wait for it and the messages in flight. After three
/// failures in quick succession none is started for a while, and each begin fails at once.
///
/// For the life of the process a request has ended when it was cancelled or when its connection reported
/// a failure of one of its messages, since nobody may ever cancel it after that.
class InstalledExtension : public ExtensionRecord, public std::enable_shared_from_this<InstalledExtension> {
 public:
  static constexpr std::string_view contextClassName = "_KTStorixExtensionHostContext";
  static constexpr std::chrono::seconds idleTime{10};
  static constexpr std::chrono::seconds failureWindow{10};
  static constexpr std::chrono::seconds timeLeftAlone{10};
  static constexpr int failuresAtMost = 3;
  /// Begins that wait for a start, which may take until the login's time is over. As many as clients may
  /// be connected: whoever asks for a document waits, and who floods is told so.
  static constexpr std::size_t waitingAtMost = 1024;

  /// `executor` runs the begin handlers and gives the time; it must outlive the record. Requests of a
  /// record whose surroundings are gone fail.
  InstalledExtension(std::shared_ptr<const ExtensionBundle> bundle, Executor &executor,
                     std::weak_ptr<ExtensionSurroundings> surroundings);
  /// Ends the process, since nobody is left who could use it.
  ~InstalledExtension() override;

  [[nodiscard]] std::optional<std::string> identifier() const override { return bundle_->identifier; }
  [[nodiscard]] bool isEqual(const ExtensionRecord &other) const override;
  [[nodiscard]] std::string description() const override;

  void beginExtensionRequest(BeginHandler completion) override;
  void cancelExtensionRequest(const RequestIdentifier &request) override;
  std::shared_ptr<ExtensionContext> extensionContextForRequest(const RequestIdentifier &request) override;

 private:
  class Connection;

  using Process = std::shared_ptr<ExtensionProcess>;

  /// A begin that waits for its process.
  struct Waiting {
    Process process;
    BeginHandler completion;
    /// So that the handler runs even where nobody else holds the record any more.
    std::shared_ptr<InstalledExtension> record;
  };

  struct Request {
    Process process;
    std::shared_ptr<ExtensionContext> context;
  };

  [[nodiscard]] std::optional<SXError> startProcess();
  void openRequest(const Process &process, BeginHandler completion);
  void failBegin(BeginHandler completion, const SXError &error);
  void processIsReady(const Process &process);
  void processFailed(const Process &process, const SXError &error);
  [[nodiscard]] std::vector<Waiting> takeWaiting(const Process &process);
  void countFailure(const SXError &error);
  void watchIdleness(std::chrono::nanoseconds time);
  void endIfIdle();
  [[nodiscard]] bool hasRequests(const Process &process) const;

  const std::shared_ptr<const ExtensionBundle> bundle_;
  Executor &executor_;
  const std::weak_ptr<ExtensionSurroundings> surroundings_;

  std::mutex mutex_;
  /// The one that new requests use, or null.
  Process process_;
  bool isReady_ = false;
  std::vector<Waiting> waiting_;
  std::map<RequestIdentifier, Request> requests_;
  /// When the last request ended, and whether a task waits for the end of the idle time.
  std::chrono::steady_clock::time_point idleSince_;
  bool idlenessIsWatched_ = false;
  int recentFailures_ = 0;
  /// Goes up when the failures so far count no more.
  unsigned long failureRound_ = 0;
  std::optional<SXError> leftAloneBecause_;
};

}  // namespace storix::linuxhost
