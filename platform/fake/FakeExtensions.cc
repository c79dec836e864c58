#include "platform/fake/FakeExtensions.h"

#include <algorithm>
#include <utility>

#include "platform/Log.h"

namespace storix::fake {
namespace {

/// The name under which the context class of requests is looked up.
constexpr std::string_view contextClassName = "_KTStorixExtensionHostContext";

std::string nameOf(const FakeExtension &extension) {
  if (extension.description) return *extension.description;
  return extension.identifier.value_or("an extension without identifier") + " version " + extension.version;
}

bool areEqual(const std::optional<FakeBundle> &a, const std::optional<FakeBundle> &b) {
  if (!a || !b) return !a && !b;
  return a->info == b->info && a->groupContainers == b->groupContainers;
}

class FakeBundleRecord : public BundleRecord {
 public:
  FakeBundleRecord(Trace &trace, std::string identifier, FakeBundle bundle)
      : trace_(trace), identifier_(std::move(identifier)), bundle_(std::move(bundle)) {}

  [[nodiscard]] std::optional<Value> infoDictionaryValue(std::string_view key, ValueKind expectedKind) const override {
    trace_.add("infoDictionaryValue " + identifier_ + " " + std::string(key) + " " +
               std::string(valueKindName(expectedKind)));
    const auto found = bundle_.info.find(key);
    if (found == bundle_.info.end() || found->second.kind() != expectedKind) return std::nullopt;
    return found->second;
  }

  [[nodiscard]] std::map<std::string, URL> groupContainerURLs() const override {
    trace_.add("groupContainerURLs " + identifier_);
    return bundle_.groupContainers;
  }

 private:
  Trace &trace_;
  const std::string identifier_;
  const FakeBundle bundle_;
};

}  // namespace

class FakeExtensionRecord : public ExtensionRecord {
 public:
  FakeExtensionRecord(FakeExtensions &extensions, FakeExtension extension)
      : extensions_(extensions), extension_(std::move(extension)) {}

  [[nodiscard]] std::optional<std::string> identifier() const override { return extension_.identifier; }

  [[nodiscard]] bool isEqual(const ExtensionRecord &other) const override {
    const auto *record = dynamic_cast<const FakeExtensionRecord *>(&other);
    return record && record->extension_.identifier == extension_.identifier &&
           record->extension_.version == extension_.version && areEqual(record->extension_.bundle, extension_.bundle);
  }

  [[nodiscard]] std::string description() const override { return nameOf(extension_); }

  void beginExtensionRequest(BeginHandler completion) override { extensions_.begin(extension_, std::move(completion)); }
  void cancelExtensionRequest(const RequestIdentifier &request) override { extensions_.cancel(extension_, request); }
  std::shared_ptr<ExtensionContext> extensionContextForRequest(const RequestIdentifier &request) override {
    return extensions_.context(extension_, request);
  }

 private:
  FakeExtensions &extensions_;
  const FakeExtension extension_;
};

class FakeAuxiliaryConnection : public AuxiliaryConnection {
 public:
  FakeAuxiliaryConnection(FakeExtensions &extensions, RequestIdentifier request, const ProtocolDescription &protocol)
      : extensions_(extensions), request_(std::move(request)), protocol_(protocol) {}

  std::shared_ptr<RemoteObject> remoteProxyWithErrorHandler(ConnectionErrorHandler errorHandler) override {
    return extensions_.proxy(request_, protocol_, std::move(errorHandler));
  }

 private:
  FakeExtensions &extensions_;
  const RequestIdentifier request_;
  const ProtocolDescription &protocol_;
};

class FakeRemoteObject : public RemoteObject {
 public:
  FakeRemoteObject(FakeExtensions &extensions, RequestIdentifier request, const ProtocolDescription &protocol,
                   ConnectionErrorHandler errorHandler)
      : extensions_(extensions),
        request_(std::move(request)),
        protocol_(protocol),
        errorHandler_(std::move(errorHandler)) {}

  void send(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
    extensions_.send(request_, protocol_.operations.at(operation), arguments, std::move(reply), errorHandler_);
  }

 private:
  FakeExtensions &extensions_;
  const RequestIdentifier request_;
  const ProtocolDescription &protocol_;
  const ConnectionErrorHandler errorHandler_;
};

class FakeExtensions::Matching : public ExtensionMatching {
 public:
  Matching(FakeExecutor &executor, std::optional<std::string> extensionPoint, ExtensionMatchingHandler handler)
      : extensionPoint_(std::move(extensionPoint)), handler_(std::move(handler)), lane_(executor) {}

  [[nodiscard]] bool matches(const FakeExtension &extension) const {
    return extensionPoint_ == extension.extensionPoint;
  }
  [[nodiscard]] const ExtensionMatchingHandler &handler() const { return handler_; }
  PlatformLane &lane() { return lane_; }

 private:
  const std::optional<std::string> extensionPoint_;
  const ExtensionMatchingHandler handler_;
  PlatformLane lane_;
};

FakeExtension completeProvider(const std::string &identifier, std::string version) {
  const std::string group = "group." + identifier;
  FakeBundle bundle;
  bundle.info.emplace("KTExtension", Dictionary{{"KTExtensionStorixDocumentGroup", group}});
  bundle.groupContainers.emplace(group, *URL::fileURLWithPath("/groups/" + group, true));
  FakeExtension extension;
  extension.identifier = identifier;
  extension.version = std::move(version);
  extension.bundle = std::move(bundle);
  return extension;
}

FakeExtensions::FakeExtensions(FakeExecutor &executor, Trace &trace) : executor_(executor), trace_(trace) {}

FakeExtensions::~FakeExtensions() = default;

void FakeExtensions::install(FakeExtension extension) {
  const std::lock_guard lock(mutex_);
  const auto found = std::find_if(installed_.begin(), installed_.end(), [&extension](const FakeExtension &known) {
    return known.identifier && known.identifier == extension.identifier;
  });
  if (found == installed_.end()) {
    installed_.push_back(std::move(extension));
  } else {
    *found = std::move(extension);
  }
}

void FakeExtensions::installBeside(FakeExtension extension) {
  const std::lock_guard lock(mutex_);
  installed_.push_back(std::move(extension));
}

void FakeExtensions::remove(std::string_view identifier) {
  const std::lock_guard lock(mutex_);
  std::erase_if(installed_, [identifier](const FakeExtension &known) { return known.identifier == identifier; });
}

void FakeExtensions::setDeliversAtFirst(bool delivers) {
  const std::lock_guard lock(mutex_);
  deliversAtFirst_ = delivers;
}

void FakeExtensions::deliver(std::optional<SXError> error) {
  std::vector<std::weak_ptr<Matching>> matchings;
  {
    const std::lock_guard lock(mutex_);
    matchings = matchings_;
  }
  for (const std::weak_ptr<Matching> &weakMatching : matchings) {
    if (const std::shared_ptr<Matching> matching = weakMatching.lock()) deliverTo(matching, error);
  }
}

void FakeExtensions::deliverTo(const std::shared_ptr<Matching> &matching, std::optional<SXError> error) {
  std::vector<std::shared_ptr<ExtensionRecord>> records;
  std::string line = "deliver extensions (";
  {
    const std::lock_guard lock(mutex_);
    for (const FakeExtension &extension : installed_) {
      if (!matching->matches(extension)) continue;
      line += (records.empty() ? "" : ", ") + nameOf(extension);
      records.push_back(makeRecord(extension));
    }
  }
  line += ")";
  if (error) line += " error " + escapedForLog(logDescription(*error));
  matching->lane().submit([this, line = std::move(line), weakMatching = std::weak_ptr(matching),
                           records = std::move(records), error = std::move(error)] {
    const std::shared_ptr<Matching> alive = weakMatching.lock();
    if (!alive) return;
    trace_.add(line);
    alive->handler()(records, error);
  });
}

std::shared_ptr<ExtensionRecord> FakeExtensions::makeRecord(FakeExtension extension) {
  return std::make_shared<FakeExtensionRecord>(*this, std::move(extension));
}

FakeExtensionProcess &FakeExtensions::process(std::string_view identifier) {
  const std::lock_guard lock(mutex_);
  std::unique_ptr<FakeExtensionProcess> &process = processes_[std::string(identifier)];
  if (!process) process = std::make_unique<FakeExtensionProcess>();
  return *process;
}

void FakeExtensions::removeContext(const std::string &request) {
  const std::lock_guard lock(mutex_);
  withoutContext_.insert(request);
}

void FakeExtensions::removeProxy(const std::string &request) {
  const std::lock_guard lock(mutex_);
  withoutProxy_.insert(request);
}

void FakeExtensions::reportConnectionFailure(const std::string &request, SXError error) {
  std::vector<ConnectionErrorHandler> handlers;
  {
    const std::lock_guard lock(mutex_);
    const auto found = requests_.find(request);
    if (found != requests_.end()) handlers = found->second.errorHandlers;
  }
  for (ConnectionErrorHandler &handler : handlers) {
    executor_.runOnPlatformThread([this, request, error, handler = std::move(handler)] {
      trace_.add("connection failed " + request + " " + escapedForLog(logDescription(error)));
      if (handler) handler(error);
    });
  }
}

std::vector<std::string> FakeExtensions::openRequests() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> open;
  open.reserve(requests_.size());
  for (const auto &[identifier, request] : requests_) open.push_back(identifier);
  return open;
}

void FakeExtensions::clear() {
  std::map<std::string, Request> dropped;
  std::vector<FakeExtensionProcess *> processes;
  {
    const std::lock_guard lock(mutex_);
    matchings_.clear();
    dropped.swap(requests_);
    for (const auto &[identifier, process] : processes_) processes.push_back(process.get());
  }
  for (FakeExtensionProcess *process : processes) process->clear();
}

std::shared_ptr<ExtensionMatching> FakeExtensions::beginMatchingExtensions(const Dictionary &attributes,
                                                                           ExtensionMatchingHandler handler) {
  trace_.add("beginMatchingExtensions " + escapedForLog(logDescription(attributes)));
  const auto attribute = attributes.find(extensionPointAttribute);
  const std::string *point = attribute == attributes.end() ? nullptr : attribute->second.string();
  auto matching =
      std::make_shared<Matching>(executor_, point ? std::optional(*point) : std::nullopt, std::move(handler));
  bool deliversAtFirst = false;
  {
    const std::lock_guard lock(mutex_);
    matchings_.push_back(matching);
    deliversAtFirst = deliversAtFirst_;
  }
  if (deliversAtFirst) deliverTo(matching, std::nullopt);
  return matching;
}

std::shared_ptr<BundleRecord> FakeExtensions::bundleRecordForIdentifier(const std::optional<std::string> &identifier) {
  trace_.add("bundleRecordForIdentifier " + traced(identifier));
  if (!identifier) return nullptr;
  const std::lock_guard lock(mutex_);
  for (const FakeExtension &extension : installed_) {
    if (extension.identifier != identifier || !extension.bundle) continue;
    return std::make_shared<FakeBundleRecord>(trace_, *identifier, *extension.bundle);
  }
  return nullptr;
}

void FakeExtensions::registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) {
  trace_.add("registerExtensionContextClass " + std::string(name));
  const std::lock_guard lock(mutex_);
  contextClasses_.insert_or_assign(std::string(name), std::move(contextClass));
}

void FakeExtensions::begin(const FakeExtension &extension, ExtensionRecord::BeginHandler completion) {
  const std::string identifier = extension.identifier.value_or("");
  FakeExtensionProcess &extensionProcess = process(identifier);
  FakeExtensionProcess::BeginOutcome outcome = extensionProcess.nextBegin();
  RequestIdentifier request;
  {
    const std::lock_guard lock(mutex_);
    request.uuid = "request-" + std::to_string(++requestCount_);
    if (!outcome.error) requests_.insert_or_assign(request.uuid, Request{identifier, nullptr, {}});
  }
  trace_.add("beginExtensionRequest " + nameOf(extension) + " " + request.uuid);
  extensionProcess.whenBeginsAreReleased(
      [this, request, outcome = std::move(outcome), completion = std::move(completion)] {
        executor_.runOnPlatformThread([this, request, outcome, completion] {
          trace_.add(outcome.error ? "begin failed " + request.uuid + " " + escapedForLog(logDescription(outcome.error))
                                   : "begun " + request.uuid);
          completion(outcome.hasIdentifier ? std::optional(request) : std::nullopt, outcome.error);
        });
      });
}

void FakeExtensions::cancel(const FakeExtension &extension, const RequestIdentifier &request) {
  trace_.add("cancelExtensionRequest " + nameOf(extension) + " " + request.uuid);
  const std::lock_guard lock(mutex_);
  const auto found = requests_.find(request.uuid);
  if (found != requests_.end() && found->second.extension == extension.identifier) requests_.erase(found);
}

std::shared_ptr<ExtensionContext> FakeExtensions::context(const FakeExtension &extension,
                                                          const RequestIdentifier &request) {
  trace_.add("extensionContextForRequest " + nameOf(extension) + " " + request.uuid);
  ExtensionContextClass contextClass;
  {
    const std::lock_guard lock(mutex_);
    const auto found = requests_.find(request.uuid);
    if (found == requests_.end() || found->second.extension != extension.identifier) return nullptr;
    if (withoutContext_.contains(request.uuid)) return nullptr;
    if (found->second.context) return found->second.context;
    const auto known = contextClasses_.find(contextClassName);
    if (known == contextClasses_.end()) return nullptr;
    contextClass = known->second;
  }
  // The connection is built from both interfaces, as on a real host; the host's one is not used here.
  (void)contextClass.auxiliaryHostProtocol();
  const ProtocolDescription &vendor = contextClass.auxiliaryVendorProtocol().protocol();
  std::shared_ptr<ExtensionContext> made =
      contextClass.make(std::make_shared<FakeAuxiliaryConnection>(*this, request, vendor));
  const std::lock_guard lock(mutex_);
  const auto found = requests_.find(request.uuid);
  if (found == requests_.end()) return nullptr;
  if (!found->second.context) found->second.context = std::move(made);
  return found->second.context;
}

std::shared_ptr<RemoteObject> FakeExtensions::proxy(const RequestIdentifier &request,
                                                    const ProtocolDescription &protocol,
                                                    ConnectionErrorHandler errorHandler) {
  trace_.add("remoteProxyWithErrorHandler " + request.uuid);
  const std::lock_guard lock(mutex_);
  if (withoutProxy_.contains(request.uuid)) return nullptr;
  const auto found = requests_.find(request.uuid);
  if (found != requests_.end()) found->second.errorHandlers.push_back(errorHandler);
  return std::make_shared<FakeRemoteObject>(*this, request, protocol, std::move(errorHandler));
}

void FakeExtensions::send(const RequestIdentifier &request, const OperationDescription &operation,
                          const Arguments &arguments, ReplyHandler reply, const ConnectionErrorHandler &errorHandler) {
  const std::string what = request.uuid + " " + std::string(operation.name) + " ";
  trace_.add("send " + what + traced(arguments));
  std::optional<std::string> extension;
  {
    const std::lock_guard lock(mutex_);
    const auto found = requests_.find(request.uuid);
    if (found != requests_.end()) extension = found->second.extension;
  }
  VendorAnswer answer = VendorAnswer::connectionFailure(
      SXError(std::string(filesErrorDomain), 2, {{"description", "The extension request has ended."}}));
  if (extension) answer = process(*extension).answerFor(operation.name, operation.method, arguments);
  if (!answer.reply && !answer.failure) return;
  const bool isHeld = answer.isHeld;
  Task deliverAnswer = [this, what, request, answer = std::move(answer), reply = std::move(reply), errorHandler] {
    executor_.runOnPlatformThread([this, what, request, answer, reply, errorHandler] {
      if (answer.reply) {
        trace_.add("answer " + what + traced(*answer.reply));
        if (reply) reply(*answer.reply);
      }
      if (answer.failure) {
        trace_.add("connection failed " + request.uuid + " " + escapedForLog(logDescription(*answer.failure)));
        if (errorHandler) errorHandler(*answer.failure);
      }
    });
  };
  if (isHeld) {
    process(*extension).hold(std::move(deliverAnswer));
  } else {
    deliverAnswer();
  }
}

}  // namespace storix::fake
