#include "platform/linux/extensions/InstalledExtension.h"

#include <systemd/sd-id128.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/linux/HostErrors.h"

namespace storix::linuxhost {

namespace {

std::optional<RequestIdentifier> newRequestIdentifier() {
  sd_id128_t identifier;
  if (sd_id128_randomize(&identifier) < 0) return std::nullopt;
  std::array<char, SD_ID128_UUID_STRING_MAX> text{};
  return RequestIdentifier{sd_id128_to_uuid_string(identifier, text.data())};
}

/// A crash, or anything else that a process should not do. A process that has nothing to do may go.
bool isFailureOfIdleProcess(const SXError &error) {
  const auto status = error.details().find("status");
  const std::int64_t *number = status == error.details().end() ? nullptr : status->second.integer();
  return !number || *number != 0;
}

}  // namespace

/// The connection of one request: the process's own, shared with the other requests, and an ear for
/// the failures of what is sent through it.
class InstalledExtension::Connection : public AuxiliaryConnection {
 public:
  Connection(std::weak_ptr<InstalledExtension> record, RequestIdentifier request, Process process,
             LinkInterface vendorInterface)
      : record_(std::move(record)),
        request_(std::move(request)),
        process_(std::move(process)),
        vendorInterface_(std::move(vendorInterface)) {}

  std::shared_ptr<RemoteObject> remoteProxyWithErrorHandler(ConnectionErrorHandler errorHandler) override {
    const std::shared_ptr<wire::BusConnection> connection = process_->connection();
    if (!connection) return nullptr;
    // Each message that is sent has a copy of the handler.
    const auto state = std::make_shared<const Failing>(Failing{record_, request_, process_, std::move(errorHandler)});
    return connection->remoteObject(vendorInterface_, [state](const SXError &error) { state->fail(error); });
  }

 private:
  struct Failing {
    std::weak_ptr<InstalledExtension> record;
    RequestIdentifier request;
    Process process;
    ConnectionErrorHandler errorHandler;

    void fail(const SXError &error) const {
      if (const auto extension = record.lock()) extension->cancelExtensionRequest(request);
      if (!errorHandler) return;
      const std::shared_ptr<wire::BusConnection> used = process->connection();
      if (used && used->isOpen()) {
        errorHandler(error);
      } else {
        process->whenCauseIsKnown(errorHandler);
      }
    }
  };

  const std::weak_ptr<InstalledExtension> record_;
  const RequestIdentifier request_;
  const Process process_;
  const LinkInterface vendorInterface_;
};

InstalledExtension::InstalledExtension(std::shared_ptr<const ExtensionBundle> bundle, Executor &executor,
                                       std::weak_ptr<ExtensionSurroundings> surroundings)
    : bundle_(std::move(bundle)), executor_(executor), surroundings_(std::move(surroundings)) {}

InstalledExtension::~InstalledExtension() {
  if (process_) process_->end();
}

bool InstalledExtension::isEqual(const ExtensionRecord &other) const {
  const auto *extension = dynamic_cast<const InstalledExtension *>(&other);
  return extension && *extension->bundle_ == *bundle_;
}

std::string InstalledExtension::description() const {
  return bundle_->identifier.value_or("(no identifier)") + " (" + bundle_->path + ")";
}

void InstalledExtension::beginExtensionRequest(BeginHandler completion) {
  std::optional<SXError> error;
  {
    const std::lock_guard lock(mutex_);
    if (!process_ || !process_->isUsable()) error = startProcess();
    if (!error && isReady_) {
      openRequest(process_, std::move(completion));
      return;
    }
    if (!error && waiting_.size() >= waitingAtMost) {
      error = hostError(HostErrorCode::tooManyRequests,
                        std::to_string(waitingAtMost) + " requests wait already until the process of the extension " +
                            description() + " has started; try again when it has.");
    }
    if (!error) {
      waiting_.push_back({process_, std::move(completion), shared_from_this()});
      return;
    }
  }
  failBegin(std::move(completion), *error);
}

/// With the mutex held, which keeps the new process's handlers waiting until it is in place.
std::optional<SXError> InstalledExtension::startProcess() {
  if (leftAloneBecause_) return leftAloneBecause_;
  const std::shared_ptr<ExtensionSurroundings> surroundings = surroundings_.lock();
  if (!surroundings) return hostError(HostErrorCode::hostEnding, "The daemon is ending.");
  Result<std::string> executable = bundle_->executablePath();
  if (!executable) return executable.error();
  isReady_ = false;
  ExtensionProcess::Handlers handlers;
  handlers.ready = [weak = weak_from_this()](const Process &process) {
    if (const auto self = weak.lock()) self->processIsReady(process);
  };
  handlers.failed = [weak = weak_from_this()](const Process &process, const SXError &error) {
    if (const auto self = weak.lock()) self->processFailed(process, error);
  };
  process_ = surroundings->startProcess(*bundle_, executable.value(), std::move(handlers));
  if (!process_) return hostError(HostErrorCode::hostEnding, "The daemon is ending.");
  return std::nullopt;
}

/// With the mutex held. The request counts at once; the rest happens on the executor.
void InstalledExtension::openRequest(const Process &process, BeginHandler completion) {
  std::optional<RequestIdentifier> request = newRequestIdentifier();
  if (!request) {
    failBegin(std::move(completion), posixError(EIO, "making the identifier of a request"));
    return;
  }
  requests_[*request] = {process, nullptr};
  executor_.execute(
      [self = shared_from_this(), process, request = std::move(request), completion = std::move(completion)]() mutable {
        const std::shared_ptr<ExtensionSurroundings> surroundings = self->surroundings_.lock();
        const std::optional<ExtensionContextClass> contextClass =
            surroundings ? surroundings->contextClass(contextClassName) : std::nullopt;
        // Without the class there is no connection, and so no context.
        if (contextClass && contextClass->auxiliaryVendorProtocol && contextClass->make) {
          std::shared_ptr<ExtensionContext> context = contextClass->make(
              std::make_shared<Connection>(self, *request, process, contextClass->auxiliaryVendorProtocol()));
          const std::lock_guard lock(self->mutex_);
          self->requests_[*request].context = std::move(context);
        }
        if (completion) completion(std::move(request), std::nullopt);
      });
}

void InstalledExtension::failBegin(BeginHandler completion, const SXError &error) {
  if (!completion) return;
  executor_.execute([completion = std::move(completion), error] { completion(std::nullopt, error); });
}

/// With the mutex held.
std::vector<InstalledExtension::Waiting> InstalledExtension::takeWaiting(const Process &process) {
  std::vector<Waiting> taken;
  for (Waiting &waiting : std::exchange(waiting_, {})) {
    (waiting.process == process ? taken : waiting_).push_back(std::move(waiting));
  }
  return taken;
}

void InstalledExtension::processIsReady(const Process &process) {
  std::vector<Waiting> begun;
  const std::lock_guard lock(mutex_);
  if (process == process_) isReady_ = true;
  begun = takeWaiting(process);
  for (Waiting &waiting : begun) openRequest(process, std::move(waiting.completion));
}

void InstalledExtension::processFailed(const Process &process, const SXError &error) {
  std::vector<Waiting> failed;
  {
    const std::lock_guard lock(mutex_);
    failed = takeWaiting(process);
    if (process == process_) {
      process_ = nullptr;
      isReady_ = false;
    }
    const bool wasIdle = failed.empty() && !hasRequests(process);
    if (!wasIdle || isFailureOfIdleProcess(error)) countFailure(error);
  }
  // The process goes with the last of them.
  for (Waiting &waiting : failed) {
    executor_.execute([failing = std::move(waiting), error] {
      if (failing.completion) failing.completion(std::nullopt, error);
    });
  }
}

/// With the mutex held.
void InstalledExtension::countFailure(const SXError &error) {
  if (++recentFailures_ < failuresAtMost) {
    executor_.executeAfter(failureWindow, [weak = weak_from_this(), round = failureRound_] {
      const auto self = weak.lock();
      if (!self) return;
      const std::lock_guard lock(self->mutex_);
      if (self->failureRound_ == round) --self->recentFailures_;
    });
    return;
  }
  recentFailures_ = 0;
  ++failureRound_;
  leftAloneBecause_ = SXError(
      std::string(platformErrorDomain), static_cast<std::int64_t>(HostErrorCode::startingTooOften),
      {{"description", "The extension " + description() + " failed three times within " +
                           std::to_string(failureWindow.count()) + " seconds and is not started again for " +
                           std::to_string(timeLeftAlone.count()) + " seconds. The last time: " + error.message()},
       {"underlyingError", error}});
  executor_.executeAfter(timeLeftAlone, [weak = weak_from_this()] {
    const auto self = weak.lock();
    if (!self) return;
    const std::lock_guard lock(self->mutex_);
    self->leftAloneBecause_.reset();
  });
}

void InstalledExtension::cancelExtensionRequest(const RequestIdentifier &request) {
  // What the request held goes when the mutex is no longer held.
  Request ended;
  const std::lock_guard lock(mutex_);
  const auto found = requests_.find(request);
  if (found == requests_.end()) return;
  ended = std::move(found->second);
  requests_.erase(found);
  if (ended.process != process_ || hasRequests(process_)) return;
  idleSince_ = executor_.now();
  if (!std::exchange(idlenessIsWatched_, true)) watchIdleness(idleTime);
}

/// With the mutex held. One task waits for all requests that end meanwhile, however many.
void InstalledExtension::watchIdleness(std::chrono::nanoseconds time) {
  executor_.executeAfter(time, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->endIfIdle();
  });
}

void InstalledExtension::endIfIdle() {
  Process idle;
  {
    const std::lock_guard lock(mutex_);
    idlenessIsWatched_ = false;
    // Whoever uses it or waits for it says so again at the end.
    if (!process_ || !isReady_ || hasRequests(process_)) return;
    const std::chrono::nanoseconds left = idleSince_ + idleTime - executor_.now();
    if (left > std::chrono::nanoseconds::zero()) {
      idlenessIsWatched_ = true;
      watchIdleness(left);
      return;
    }
    idle = std::exchange(process_, nullptr);
    isReady_ = false;
  }
  if (idle) idle->end();
}

bool InstalledExtension::hasRequests(const Process &process) const {
  return std::any_of(requests_.begin(), requests_.end(),
                     [&process](const auto &entry) { return entry.second.process == process; });
}

std::shared_ptr<ExtensionContext> InstalledExtension::extensionContextForRequest(const RequestIdentifier &request) {
  const std::lock_guard lock(mutex_);
  const auto found = requests_.find(request);
  return found == requests_.end() ? nullptr : found->second.context;
}

}  // namespace storix::linuxhost
