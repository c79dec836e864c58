#include "bench/BenchHost.h"

#include <condition_variable>
#include <map>
#include <mutex>
#include <utility>

#include "platform/linux/files/DirectoryRelationship.h"
#include "providers/_KTStorixVendor.h"

namespace storix::bench {

namespace {

const std::string documentGroupKey = "KTExtensionStorixDocumentGroup";

/// Whoever asks for a request gets this one's context.
const RequestIdentifier onlyRequest{"request"};

class SilentLog : public LogSink {
 public:
  [[nodiscard]] bool isEnabled(LogSeverity severity) const override { return severity >= LogSeverity::standard; }
  void write(LogSeverity /*severity*/, std::string_view /*message*/) override {}
};

class NoCoordination : public FileCoordinationService {
 public:
  void addProvider(std::shared_ptr<KTStorix> /*provider*/) override {}
  void removeProvider(const std::shared_ptr<KTStorix> & /*provider*/) override {}
};

class Matching : public ExtensionMatching {};

class Bundle : public BundleRecord {
 public:
  Bundle(std::string group, const std::filesystem::path &container)
      : group_(std::move(group)), container_(*URL::fileURLWithPath(container.string(), true)) {}
  [[nodiscard]] std::optional<Value> infoDictionaryValue(std::string_view /*key*/, ValueKind /*kind*/) const override {
    return Dictionary{{documentGroupKey, group_}};
  }
  [[nodiscard]] std::map<std::string, URL> groupContainerURLs() const override { return {{group_, container_}}; }

 private:
  const std::string group_;
  const URL container_;
};

/// Answers every operation with absent values, which is success.
class AnsweringExtension : public RemoteObject, public AuxiliaryConnection {
 public:
  explicit AnsweringExtension(Executor &executor) : executor_(executor) {}
  void send(std::size_t operation, Arguments /*arguments*/, ReplyHandler reply) override {
    const std::size_t values = _KTStorixVendorProtocol().description().operations.at(operation).replies.size();
    executor_.execute([values, reply = std::move(reply)] { reply(Arguments(values)); });
  }
  std::shared_ptr<RemoteObject> remoteProxyWithErrorHandler(ConnectionErrorHandler /*errorHandler*/) override {
    return std::make_shared<AnsweringExtension>(executor_);
  }

 private:
  Executor &executor_;
};

class Record : public ExtensionRecord {
 public:
  Record(Executor &executor, std::string identifier) : executor_(executor), identifier_(std::move(identifier)) {}
  [[nodiscard]] std::optional<std::string> identifier() const override { return identifier_; }
  [[nodiscard]] bool isEqual(const ExtensionRecord &other) const override { return other.identifier() == identifier_; }
  [[nodiscard]] std::string description() const override { return identifier_; }
  void beginExtensionRequest(BeginHandler completion) override {
    executor_.execute([completion = std::move(completion)] { completion(onlyRequest, std::nullopt); });
  }
  void cancelExtensionRequest(const RequestIdentifier & /*request*/) override {}
  std::shared_ptr<ExtensionContext> extensionContextForRequest(const RequestIdentifier & /*request*/) override {
    return std::make_shared<ExtensionContext>(std::make_shared<AnsweringExtension>(executor_));
  }

 private:
  Executor &executor_;
  const std::string identifier_;
};

}  // namespace

BenchHost::BenchHost(std::filesystem::path home)
    : home_(std::move(home)),
      globalQueue_(ConcurrentQueue::create(pool_, "global")),
      coordination_(std::make_unique<NoCoordination>()),
      log_(std::make_unique<SilentLog>()) {}

BenchHost::~BenchHost() { end(); }

void BenchHost::end() { pool_.end(); }

void BenchHost::install(const std::vector<std::string> &identifiers, const std::filesystem::path &groups) {
  groups_ = groups;
  records_.clear();
  for (const std::string &identifier : identifiers) records_.push_back(std::make_shared<Record>(pool_, identifier));
  if (matching_) matching_(records_, std::nullopt);
}

std::shared_ptr<ServiceListener> BenchHost::createServiceListener(std::string_view /*serviceName*/) { return nullptr; }

std::optional<std::string> BenchHost::bundleIdentifierForAuditToken(const AuditToken & /*token*/) {
  return std::nullopt;
}

int BenchHost::checkSandboxAccess(const AuditToken & /*token*/, std::string_view /*operation*/,
                                  SandboxFilter /*filter*/, const std::string & /*path*/) {
  return -1;
}

std::optional<std::string> BenchHost::issueSandboxExtension(SandboxExtensionClass /*extensionClass*/,
                                                            const std::string & /*path*/, std::uint32_t /*flags*/) {
  return std::nullopt;
}

void BenchHost::addSystemNotificationObserver(std::string_view /*name*/, std::function<void()> /*callback*/) {}

std::optional<SXError> BenchHost::createDirectory(const std::string &path, bool withIntermediateDirectories) {
  return linuxhost::Files::createDirectory(path, withIntermediateDirectories);
}

std::unique_ptr<InputStream> BenchHost::openFileInputStream(const std::string &path) {
  return files_.openFileInputStream(path);
}

Result<Value> BenchHost::readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) {
  return files_.readKeyedValueStream(stream, mutability);
}

bool BenchHost::writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) {
  return files_.writeKeyedValueFileAtomically(content, path);
}

Result<DirectoryRelationship> BenchHost::directoryRelationship(const std::optional<URL> &directory,
                                                               const std::optional<URL> &item) {
  return linuxhost::directoryRelationship(directory, item);
}

std::shared_ptr<ExtensionMatching> BenchHost::beginMatchingExtensions(const Dictionary & /*attributes*/,
                                                                      ExtensionMatchingHandler handler) {
  matching_ = std::move(handler);
  pool_.execute([this, records = records_] { matching_(records, std::nullopt); });
  return std::make_shared<Matching>();
}

std::shared_ptr<BundleRecord> BenchHost::bundleRecordForIdentifier(const std::optional<std::string> &identifier) {
  if (!identifier) return nullptr;
  const std::string group = "group." + *identifier;
  return std::make_shared<Bundle>(group, groups_ / group);
}

void BenchHost::registerExtensionContextClass(std::string_view /*name*/, ExtensionContextClass /*contextClass*/) {}

FileCoordinationService &BenchHost::fileCoordinationService() { return *coordination_; }

std::shared_ptr<SerialQueue> BenchHost::createSerialQueue(std::string label) {
  return SerialQueue::create(pool_, std::move(label));
}

std::shared_ptr<ConcurrentQueue> BenchHost::createConcurrentQueue(std::string label) {
  return ConcurrentQueue::create(pool_, std::move(label));
}

std::shared_ptr<OperationQueue> BenchHost::createOperationQueue(std::string name) {
  return OperationQueue::create(pool_, std::move(name));
}

void BenchHost::runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) {
  storix::runAfterDelay(pool_, nanoseconds, queue, std::move(task));
}

LogSink &BenchHost::logSink() { return *log_; }

}  // namespace storix::bench
