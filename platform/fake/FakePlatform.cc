#include "platform/fake/FakePlatform.h"

#include <utility>

namespace storix::fake {

std::unique_ptr<FakePlatform> FakePlatform::create() { return create(Options()); }

std::unique_ptr<FakePlatform> FakePlatform::create(Options options) {
  return std::unique_ptr<FakePlatform>(new FakePlatform(std::move(options)));
}

FakePlatform::FakePlatform(Options options)
    : options_(std::move(options)),
      executor_(options_.queues),
      globalQueue_(ConcurrentQueue::create(executor_, globalQueueLabel)) {
  files_.makeDirectory(options_.homeDirectory);
}

FakePlatform::~FakePlatform() {
  endEventLoop();
  shutDown();
}

std::vector<FakePlatform::DelayedTask> FakePlatform::delayedTasks() const {
  const std::lock_guard lock(mutex_);
  std::vector<DelayedTask> tasks;
  tasks.reserve(delayed_.size());
  for (const auto &[number, delayed] : delayed_) tasks.push_back({delayed.nanoseconds, delayed.queue->label()});
  return tasks;
}

void FakePlatform::setDeviceLockState(int state) {
  const std::lock_guard lock(mutex_);
  lockState_ = state;
}

void FakePlatform::setDeviceUnlockedSinceBoot(bool unlocked) {
  const std::lock_guard lock(mutex_);
  unlockedSinceBoot_ = unlocked;
}

void FakePlatform::postNotification(const std::string &name) {
  if (executor_.kind() == FakeExecutor::Kind::manual) {
    executor_.runOnMainEventLoop([this, name] { deliverNotification(name); });
    return;
  }
  const std::lock_guard lock(mutex_);
  notifications_.push_back(name);
  eventLoopHasWork_.notify_all();
}

void FakePlatform::deliverNotification(const std::string &name) {
  trace_.add("notification " + name);
  std::vector<std::function<void()>> callbacks;
  {
    const std::lock_guard lock(mutex_);
    const auto [first, last] = observers_.equal_range(name);
    for (auto observer = first; observer != last; ++observer) callbacks.push_back(observer->second);
  }
  for (const std::function<void()> &callback : callbacks) callback();
}

void FakePlatform::endEventLoop() {
  const std::lock_guard lock(mutex_);
  eventLoopEnds_ = true;
  eventLoopHasWork_.notify_all();
}

void FakePlatform::shutDown() {
  // Twice, since what runs to its end may ask for more.
  for (int round = 0; round < 2; ++round) {
    connections_.closeAll();
    extensions_.clear();
    fileCoordination_.clear();
    std::map<std::uint64_t, Delayed> delayed;
    std::multimap<std::string, std::function<void()>, std::less<>> observers;
    {
      const std::lock_guard lock(mutex_);
      delayed.swap(delayed_);
      observers.swap(observers_);
    }
    delayed.clear();
    runUntilIdle();
  }
}

void FakePlatform::runEventLoop() {
  trace_.add("runEventLoop");
  if (executor_.kind() == FakeExecutor::Kind::manual) {
    runUntilIdle();
    return;
  }
  const ContextMark mark("main event loop");
  std::unique_lock lock(mutex_);
  while (true) {
    eventLoopHasWork_.wait(lock, [this] { return eventLoopEnds_ || !notifications_.empty(); });
    if (eventLoopEnds_) return;
    const std::string name = std::move(notifications_.front());
    notifications_.pop_front();
    lock.unlock();
    deliverNotification(name);
    lock.lock();
  }
}

std::string FakePlatform::homeDirectory() {
  trace_.add("homeDirectory");
  return options_.homeDirectory;
}

std::shared_ptr<ServiceListener> FakePlatform::createServiceListener(std::string_view serviceName) {
  return connections_.createServiceListener(serviceName);
}

std::optional<std::string> FakePlatform::bundleIdentifierForAuditToken(const AuditToken &token) {
  return connections_.bundleIdentifierForAuditToken(token);
}

int FakePlatform::checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                                     const std::string &path) {
  return sandbox_.checkSandboxAccess(token, operation, filter, path);
}

std::optional<std::string> FakePlatform::issueSandboxExtension(SandboxExtensionClass extensionClass,
                                                               const std::string &path, std::uint32_t flags) {
  return sandbox_.issueSandboxExtension(extensionClass, path, flags);
}

int FakePlatform::deviceLockState() {
  trace_.add("deviceLockState");
  const std::lock_guard lock(mutex_);
  return lockState_;
}

bool FakePlatform::deviceUnlockedSinceBoot() {
  trace_.add("deviceUnlockedSinceBoot");
  const std::lock_guard lock(mutex_);
  return unlockedSinceBoot_;
}

void FakePlatform::addSystemNotificationObserver(std::string_view name, std::function<void()> callback) {
  trace_.add("addSystemNotificationObserver " + std::string(name));
  const std::lock_guard lock(mutex_);
  observers_.emplace(std::string(name), std::move(callback));
}

bool FakePlatform::fileExists(const std::string &path) { return files_.fileExists(path); }

std::optional<SXError> FakePlatform::createDirectory(const std::string &path, bool withIntermediateDirectories) {
  return files_.createDirectory(path, withIntermediateDirectories);
}

std::unique_ptr<InputStream> FakePlatform::openFileInputStream(const std::string &path) {
  return files_.openFileInputStream(path);
}

Result<Value> FakePlatform::readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) {
  return files_.readKeyedValueStream(stream, mutability);
}

bool FakePlatform::writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) {
  return files_.writeKeyedValueFileAtomically(content, path);
}

Result<DirectoryRelationship> FakePlatform::directoryRelationship(const std::optional<URL> &directory,
                                                                  const std::optional<URL> &item) {
  return files_.directoryRelationship(directory, item);
}

std::shared_ptr<ExtensionMatching> FakePlatform::beginMatchingExtensions(const Dictionary &attributes,
                                                                         ExtensionMatchingHandler handler) {
  return extensions_.beginMatchingExtensions(attributes, std::move(handler));
}

std::shared_ptr<BundleRecord> FakePlatform::bundleRecordForIdentifier(const std::optional<std::string> &identifier) {
  return extensions_.bundleRecordForIdentifier(identifier);
}

void FakePlatform::registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) {
  extensions_.registerExtensionContextClass(name, std::move(contextClass));
}

std::shared_ptr<SerialQueue> FakePlatform::createSerialQueue(std::string label) {
  trace_.add("createSerialQueue " + label);
  return SerialQueue::create(executor_, std::move(label));
}

std::shared_ptr<ConcurrentQueue> FakePlatform::createConcurrentQueue(std::string label) {
  trace_.add("createConcurrentQueue " + label);
  return ConcurrentQueue::create(executor_, std::move(label));
}

std::shared_ptr<OperationQueue> FakePlatform::createOperationQueue(std::string name) {
  trace_.add("createOperationQueue " + name);
  return OperationQueue::create(executor_, std::move(name));
}

void FakePlatform::runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) {
  trace_.add("runAfterDelay " + std::to_string(nanoseconds) + " on queue " + queue->label());
  std::uint64_t number = 0;
  {
    const std::lock_guard lock(mutex_);
    number = nextDelayed_++;
    delayed_.emplace(number, Delayed{nanoseconds, queue, std::move(task)});
  }
  executor_.executeAfter(std::chrono::nanoseconds(nanoseconds), [this, number] { submitDelayed(number); });
}

void FakePlatform::submitDelayed(std::uint64_t number) {
  std::optional<Delayed> due;
  {
    const std::lock_guard lock(mutex_);
    const auto found = delayed_.find(number);
    if (found == delayed_.end()) return;
    due = std::move(found->second);
    delayed_.erase(found);
  }
  due->queue->async(std::move(due->task));
}

}  // namespace storix::fake
