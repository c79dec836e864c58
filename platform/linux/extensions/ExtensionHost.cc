#include "platform/linux/extensions/ExtensionHost.h"

#include <algorithm>
#include <chrono>
#include <csignal>
#include <map>
#include <mutex>
#include <set>
#include <utility>

#include "platform/linux/extensions/ExtensionDiscovery.h"
#include "platform/linux/extensions/ExtensionLauncher.h"
#include "platform/linux/extensions/ExtensionProcess.h"
#include "platform/linux/extensions/InstalledExtension.h"

namespace storix::linuxhost {

namespace {

constexpr std::chrono::seconds timeAfterTermination{2};
constexpr std::chrono::seconds timeAfterKill{5};

}  // namespace

struct ExtensionHost::Implementation : ExtensionSurroundings, std::enable_shared_from_this<Implementation> {
  Implementation(ExtensionPlaces initialPlaces, std::vector<std::string> initialEnvironment, Executor &initialExecutor,
                 IoLoop &initialLoop, std::unique_ptr<ExtensionConfinement> initialConfinement)
      : places(std::move(initialPlaces)),
        environment(std::move(initialEnvironment)),
        executor(initialExecutor),
        loop(initialLoop),
        confinement(std::move(initialConfinement)) {}

  std::optional<ExtensionContextClass> contextClass(std::string_view name) override {
    const std::lock_guard lock(mutex);
    const auto found = contextClasses.find(name);
    return found == contextClasses.end() ? std::nullopt : std::optional(found->second);
  }

  std::shared_ptr<ExtensionProcess> startProcess(const ExtensionBundle &bundle, std::string executable,
                                                 ExtensionProcess::Handlers handlers) override {
    LaunchDescription description;
    description.executable = std::move(executable);
    description.workingDirectory = bundle.path;
    std::optional<std::string> container = bundle.documentGroup();
    if (container) container = groupContainerPath(places, *container);
    description.environment = extensionProcessEnvironment(environment, bundle, container);
    if (confinement) {
      // The launcher goes before the confinement does.
      description.prepare = [this, confined = std::make_shared<const ExtensionBundle>(bundle)](
                                LaunchDescription &prepared) { return confinement->confine(prepared, *confined); };
    }
    const auto process = std::make_shared<ExtensionProcess>(ExtensionProcess::Surroundings{executor, loop, launcher},
                                                            bundle.identifier.value_or(bundle.path));
    handlers.gone = [weak = weak_from_this()](const std::shared_ptr<ExtensionProcess> &reaped) {
      const std::shared_ptr<Implementation> self = weak.lock();
      if (!self) return;
      const std::lock_guard lock(self->mutex);
      self->processes.erase(reaped);
    };
    const std::lock_guard lock(mutex);
    if (isEnding) return nullptr;
    processes.emplace(process, bundle.identifier);
    process->start(std::move(description), std::move(handlers));
    return process;
  }

  void endAllProcesses() {
    {
      const std::lock_guard lock(mutex);
      isEnding = true;
    }
    launcher.waitUntilIdle();
    std::set<std::shared_ptr<ExtensionProcess>> ending;
    {
      const std::lock_guard lock(mutex);
      for (const auto &[process, identifier] : processes) ending.insert(process);
      processes.clear();
    }
    for (const auto &process : ending) process->endNow(SIGTERM);
    waitFor(ending, timeAfterTermination);
    for (const auto &process : ending) process->endNow(SIGKILL);
    waitFor(ending, timeAfterKill);
  }

  static void waitFor(std::set<std::shared_ptr<ExtensionProcess>> &ending, std::chrono::milliseconds time) {
    const auto deadline = std::chrono::steady_clock::now() + time;
    std::erase_if(ending, [deadline](const std::shared_ptr<ExtensionProcess> &process) {
      return process->waitForExit(
          std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()));
    });
  }

  const ExtensionPlaces places;
  const std::vector<std::string> environment;
  Executor &executor;
  IoLoop &loop;
  const std::unique_ptr<ExtensionConfinement> confinement;
  ExtensionLauncher launcher;

  std::mutex mutex;
  bool isEnding = false;
  /// With the identifiers of their extensions.
  std::map<std::shared_ptr<ExtensionProcess>, std::optional<std::string>> processes;
  std::map<std::string, ExtensionContextClass, std::less<>> contextClasses;

  std::unique_ptr<ExtensionDiscovery> discovery;
};

ExtensionHost::ExtensionHost(ExtensionPlaces places, std::vector<std::string> environment, Executor &executor,
                             IoLoop &loop, std::unique_ptr<ExtensionConfinement> confinement)
    : implementation_(
          std::make_shared<Implementation>(places, std::move(environment), executor, loop, std::move(confinement))) {
  implementation_->discovery = std::make_unique<ExtensionDiscovery>(
      std::move(places), executor, loop,
      [&executor, weak = std::weak_ptr(implementation_)](std::shared_ptr<const ExtensionBundle> bundle) {
        return std::make_shared<InstalledExtension>(std::move(bundle), executor, weak);
      });
}

ExtensionHost::~ExtensionHost() {
  implementation_->discovery.reset();
  implementation_->endAllProcesses();
}

std::shared_ptr<ExtensionMatching> ExtensionHost::beginMatchingExtensions(const Dictionary &attributes,
                                                                          ExtensionMatchingHandler handler) {
  return implementation_->discovery->beginMatching(attributes, std::move(handler));
}

std::shared_ptr<BundleRecord> ExtensionHost::bundleRecordForIdentifier(const std::optional<std::string> &identifier) {
  if (!identifier) return nullptr;
  std::shared_ptr<const ExtensionBundle> bundle = implementation_->discovery->bundleForIdentifier(*identifier);
  return bundle ? makeBundleRecord(std::move(bundle), implementation_->places) : nullptr;
}

void ExtensionHost::registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass) {
  const std::lock_guard lock(implementation_->mutex);
  implementation_->contextClasses.insert_or_assign(std::string(name), std::move(contextClass));
}

bool ExtensionHost::isProcessOfExtension(std::string_view identifier, pid_t process) const {
  if (process <= 0) return false;
  const std::lock_guard lock(implementation_->mutex);
  return std::any_of(implementation_->processes.begin(), implementation_->processes.end(),
                     [identifier, process](const auto &entry) {
                       return entry.second == identifier && entry.first->processIdentifier() == process;
                     });
}

}  // namespace storix::linuxhost
