#include "platform/linux/LinuxPlatform.h"

#include <unistd.h>

#include <utility>

#include "platform/linux/HostErrors.h"
#include "platform/linux/LogSinks.h"
#include "platform/linux/files/DirectoryRelationship.h"
#include "platform/linux/files/PathText.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/sockets/ClientListener.h"
#include "platform/linux/sockets/PlatformSocket.h"

namespace storix::linuxhost {

namespace {

std::unique_ptr<LogSink> makeLogSink(const HostEnvironment &environment) {
  return environment.logsToJournal ? makeJournalLogSink(environment.logSeverity)
                                   : makeLineLogSink(environment.logSeverity, STDERR_FILENO);
}

}  // namespace

std::optional<std::string> missingSocketWarning(const ActivatedSockets &activated) {
  if (activated.empty()) return std::nullopt;
  for (const std::string_view name : {serviceSocketName, platformSocketName}) {
    if (activated.contains(name)) continue;
    return "The service manager hands over no socket with the name " + quotedPath(name) +
           "; the daemon makes that one itself. Enable both socket units.";
  }
  return std::nullopt;
}

Result<std::unique_ptr<LinuxPlatform>> LinuxPlatform::create(HostEnvironment environment, ActivatedSockets activated) {
  // First of all, since threads inherit which signals are blocked.
  Result<std::unique_ptr<EventLoop>> eventLoop = EventLoop::create();
  if (!eventLoop) return eventLoop.error();
  Result<std::unique_ptr<RuntimeDirectory>> directory = RuntimeDirectory::open(environment.runtimeDirectory);
  if (!directory) return directory.error();
  auto peers = std::make_shared<PeerTable>(std::make_shared<ApplicationManifests>(environment.applicationDirectories));
  Result<std::unique_ptr<Sandbox>> sandbox =
      Sandbox::create(peers, directory.value()->path(), environment.extensionPlaces.groupContainersDirectory);
  if (!sandbox) return sandbox.error();
  std::unique_ptr<LinuxPlatform> platform(new LinuxPlatform(std::move(environment), std::move(eventLoop.value()),
                                                            std::move(directory.value()), std::move(peers),
                                                            std::move(sandbox.value())));
  if (std::optional<SXError> error = platform->openSockets(std::move(activated))) return *std::move(error);
  return platform;
}

LinuxPlatform::LinuxPlatform(HostEnvironment environment, std::unique_ptr<EventLoop> eventLoop,
                             std::unique_ptr<RuntimeDirectory> runtimeDirectory, std::shared_ptr<PeerTable> peers,
                             std::unique_ptr<Sandbox> sandbox)
    : environment_(std::move(environment)),
      logSink_(makeLogSink(environment_)),
      eventLoop_(std::move(eventLoop)),
      runtimeDirectory_(std::move(runtimeDirectory)),
      globalQueue_(ConcurrentQueue::create(pool_, "global queue")),
      ioLoop_(pool_),
      connectionLimit_(ConnectionLimit::connectionsForThisProcess()),
      lockState_(runtimeDirectory_->path()),
      notifications_(*eventLoop_),
      peers_(std::move(peers)),
      sandbox_(std::move(sandbox)),
      extensions_(std::make_unique<ExtensionHost>(
          environment_.extensionPlaces, environment_.extensionEnvironment, pool_, ioLoop_,
          std::make_unique<ExtensionConfinement>(environment_.confinementPlaces(), environment_.confinement))),
      fileCoordination_(pool_, [this](const std::string &identifier, pid_t process) {
        return extensions_->isProcessOfExtension(identifier, process);
      }) {}

std::optional<SXError> LinuxPlatform::openSockets(ActivatedSockets activated) {
  const ServingContext context{pool_, ioLoop_, *peers_, connectionLimit_};
  using wire::BusConnection;
  Result<std::unique_ptr<NamedSocket>> service = NamedSocket::open(
      context, *runtimeDirectory_, activated, std::string(serviceSocketName), BusConnection::Descriptors::refused);
  if (!service) return service.error();
  serviceSocket_ = std::move(service.value());
  Result<std::unique_ptr<NamedSocket>> platform = NamedSocket::open(
      context, *runtimeDirectory_, activated, std::string(platformSocketName), BusConnection::Descriptors::passed);
  if (!platform) return platform.error();
  platformSocket_ = std::move(platform.value());
  if (!activated.empty()) {
    return hostError(
        HostErrorCode::cannotStart,
        "The service manager hands over a socket with the name " + quotedPath(activated.begin()->first) +
            ", which nothing here serves; its unit must say FileDescriptorName=" + std::string(serviceSocketName) +
            " or FileDescriptorName=" + std::string(platformSocketName) + ".");
  }
  servePlatformSocket(*platformSocket_, {fileCoordination_, *sandbox_, notifications_});
  return std::nullopt;
}

LinuxPlatform::~LinuxPlatform() { shutDown(); }

void LinuxPlatform::shutDown() {
  // Threads first: then nobody is left who could call into what goes.
  ioLoop_.end();
  pool_.end();
  platformSocket_.reset();
  serviceSocket_.reset();
  extensions_.reset();
}

void LinuxPlatform::runEventLoop() {
  eventLoop_->run();
  shutDown();
}

std::shared_ptr<ServiceListener> LinuxPlatform::createServiceListener(std::string_view serviceName) {
  if (serviceName != serviceSocketName || !serviceSocket_) return nullptr;
  return std::make_shared<ClientListener>(*serviceSocket_);
}

std::optional<std::string> LinuxPlatform::bundleIdentifierForAuditToken(const AuditToken &token) {
  const std::shared_ptr<Peer> peer = peers_->find(token);
  if (!peer || !peer->isAlive()) return std::nullopt;
  return peer->bundleIdentifier();
}

int LinuxPlatform::checkSandboxAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                                      const std::string &path) {
  return sandbox_->checkAccess(token, operation, filter, path);
}

std::optional<std::string> LinuxPlatform::issueSandboxExtension(SandboxExtensionClass extensionClass,
                                                                const std::string &path, std::uint32_t flags) {
  return sandbox_->issueExtension(extensionClass, path, flags);
}

void LinuxPlatform::addSystemNotificationObserver(std::string_view name, std::function<void()> callback) {
  notifications_.addObserver(name, std::move(callback));
}

std::optional<SXError> LinuxPlatform::createDirectory(const std::string &path, bool withIntermediateDirectories) {
  return Files::createDirectory(path, withIntermediateDirectories);
}

std::unique_ptr<InputStream> LinuxPlatform::openFileInputStream(const std::string &path) {
  return files_.openFileInputStream(path);
}

Result<Value> LinuxPlatform::readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) {
  const BlockingScope waitsForTheDisk(pool_);
  return files_.readKeyedValueStream(stream, mutability);
}

bool LinuxPlatform::writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) {
  const BlockingScope waitsForTheDisk(pool_);
  return files_.writeKeyedValueFileAtomically(content, path);
}

Result<DirectoryRelationship> LinuxPlatform::directoryRelationship(const std::optional<URL> &directory,
                                                                   const std::optional<URL> &item) {
  return linuxhost::directoryRelationship(directory, item);
}

std::shared_ptr<ExtensionMatching> LinuxPlatform::beginMatchingExtensions(const Dictionary &attributes,
                                                                          ExtensionMatchingHandler handler) {
  if (!extensions_) return nullptr;
  return extensions_->beginMatchingExtensions(attributes, std::move(handler));
}

std::shared_ptr<BundleRecord> LinuxPlatform::bundleRecordForIdentifier(const std::optional<std::string> &identifier) {
  if (!extensions_) return nullptr;
  return extensions_->bundleRecordForIdentifier(identifier);
}

void LinuxPlatform::registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) {
  if (extensions_) extensions_->registerExtensionContextClass(name, std::move(contextClass));
}

std::shared_ptr<SerialQueue> LinuxPlatform::createSerialQueue(std::string label) {
  return SerialQueue::create(pool_, std::move(label));
}

std::shared_ptr<ConcurrentQueue> LinuxPlatform::createConcurrentQueue(std::string label) {
  return ConcurrentQueue::create(pool_, std::move(label));
}

std::shared_ptr<OperationQueue> LinuxPlatform::createOperationQueue(std::string name) {
  return OperationQueue::create(pool_, std::move(name));
}

void LinuxPlatform::runAfterDelay(std::uint64_t nanoseconds, const std::shared_ptr<Queue> &queue, Task task) {
  storix::runAfterDelay(pool_, nanoseconds, queue, std::move(task));
}

}  // namespace storix::linuxhost
