#include "providers/ProviderRegistry.h"

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

constexpr std::string_view extensionPoint = "com.tessel.storix-nonui";

constexpr std::int32_t registrationTries = 3;

/// A provider's entry in the list: what stands after the first absent value is left out.
Dictionary providerInfoRecord(SXExtensionStorix &provider) {
  Dictionary record;
  const std::optional<URL> url = provider._providedItemsURL();
  if (!url) return record;
  record.emplace("documentStorageURL", *url);
  if (std::optional<std::string> identifier = provider._fileReactorID()) {
    record.emplace("providerIdentifier", std::move(*identifier));
  }
  return record;
}

}  // namespace

std::shared_ptr<ProviderRegistry> ProviderRegistry::shared() {
  return ProcessScope::current().instance<ProviderRegistry>([] { return std::make_shared<ProviderRegistry>(); });
}

ProviderRegistry::ProviderRegistry() {
  PlatformServices &platform = ProcessScope::current().platform();
  refreshOperationsQueue_ = platform.createSerialQueue("SXExtensionStorix refresh operations queue");
  registryQueue_ = platform.createConcurrentQueue("SXExtensionStorix concurrent queue");
}

void ProviderRegistry::createInstancesCompletion(std::function<void()> completion) {
  PlatformServices &platform = ProcessScope::current().platform();
  bool alreadyStarted = true;
  startUp_.runOnce([this, &platform, &alreadyStarted, &completion] {
    alreadyStarted = false;
    pendingStartUpCompletion_ = completion;
    // Which error came with the list does not matter: the list counts as it is.
    discoveryHandle_ = platform.beginMatchingExtensions(
        {{std::string(extensionPointAttribute), extensionPoint}},
        [registry = weak_from_this()](Records records, const std::optional<SXError> & /*unused*/) {
          if (const std::shared_ptr<ProviderRegistry> self = registry.lock()) {
            self->extensionsChanged(std::move(records));
          }
        });
  });
  if (completion && alreadyStarted) platform.globalQueue()->async(std::move(completion));
}

void ProviderRegistry::extensionsChanged(Records records) {
  refreshOperationsQueue_->async(
      [self = shared_from_this(), records = std::move(records)] { self->beginRefresh(records); });
}

void ProviderRegistry::beginRefresh(Records records) {
  refreshOperationsQueue_->suspend();
  sx_default_log().info("[INFO] Updating provider list.");
  registryQueue_->asyncBarrier(
      [self = shared_from_this(), records = std::move(records)] { self->rewriteProviderMap(records); });
}

void ProviderRegistry::rewriteProviderMap(const Records &records) {
  std::map<std::string, Provider, std::less<>> newProviders;
  std::vector<Provider> toRegister;
  std::map<std::string, Provider, std::less<>> leftovers = providers_;

  for (const std::shared_ptr<ExtensionRecord> &record : records) {
    const std::optional<std::string> identifier = record->identifier();
    if (!identifier || identifier->empty()) {
      sx_default_log().notice("[NOTICE] Storix provider extension %@ has no identifier. Ignoring.", record);
      continue;
    }
    const auto known = leftovers.find(*identifier);
    if (known != leftovers.end() && known->second->extension()->isEqual(*record)) {
      newProviders[*identifier] = known->second;
      leftovers.erase(known);
      continue;
    }
    Provider provider = SXExtensionStorix::initWithExtension(record);
    toRegister.push_back(provider);
    newProviders[*identifier] = std::move(provider);
  }

  for (const auto &[identifier, provider] : leftovers) provider->unregisterFromFileCoordinator();
  if (providers_ != newProviders) providers_ = std::move(newProviders);

  ProcessScope::current().platform().globalQueue()->async(
      [self = shared_from_this(), toRegister = std::move(toRegister)] {
        self->refreshOperationsQueueRegisterProviders(toRegister, [self] { self->endRefresh(); });
      });
}

void ProviderRegistry::refreshOperationsQueueRegisterProviders(const std::vector<Provider> &providers,
                                                               std::function<void()> completion) {
  if (providers.empty()) {
    if (completion) ProcessScope::current().platform().globalQueue()->async(std::move(completion));
    return;
  }
  const Provider &first = providers.front();
  first->registerWithFileCoordinatorRetryCount(
      registrationTries,
      [self = shared_from_this(), first, rest = std::vector<Provider>(providers.begin() + 1, providers.end()),
       completion = std::move(completion)](const std::optional<SXError> &error) {
        if (error) {
          sx_default_log().fault("[ERROR] Could not register storix provider %@. Error: %@", first->identifier(),
                                 *error);
        }
        self->refreshOperationsQueueRegisterProviders(rest, completion);
      });
}

void ProviderRegistry::endRefresh() {
  // Taken while no other refresh can run, since the next one may end before this function does.
  const std::function<void()> completion = std::exchange(pendingStartUpCompletion_, nullptr);
  refreshOperationsQueue_->resume();
  if (completion) completion();
}

void ProviderRegistry::setStorixAccessControl(const std::shared_ptr<SXAccessControl> &accessControl) {
  accessControl_ = accessControl;
}

ProviderRegistry::Provider ProviderRegistry::providerForURL(const std::optional<URL> &url, bool *outExcludedURL) {
  Provider owner;
  bool excluded = false;
  registryQueue_->sync([this, &url, &owner, &excluded] {
    PlatformServices &platform = ProcessScope::current().platform();
    for (const auto &[identifier, provider] : providers_) {
      const std::optional<URL> directory = provider->providedItemsURL();
      const Result<DirectoryRelationship> relationship = platform.directoryRelationship(directory, url);
      if (!relationship) {
        const SXError &error = relationship.error();
        if (isFileNotFoundForReading(error) && directory && error.urlDetail("URL") == directory) {
          sx_default_log().debug(
              "[DEBUG] Storix provider %@ doesn't have a provided items directory; it may not have run so far.",
              provider->identifier());
        } else {
          sx_default_log().fault("[ERROR] Cannot get the relationship between URL %@ and %@. Error: %@", directory, url,
                                 error);
        }
      } else if (relationship.value() == DirectoryRelationship::same) {
        sx_default_log().debug("[DEBUG] Ignoring URLs that exactly match the document container folder");
        excluded = true;
        return;
      } else if (relationship.value() == DirectoryRelationship::contains) {
        sx_default_log().info("[INFO] Resolved URL to provider %@.", provider->identifier());
        owner = provider;
        return;
      }
    }
  });
  if (outExcludedURL) *outExcludedURL = excluded;
  return owner;
}

Dictionary ProviderRegistry::providersInfo() {
  Dictionary information;
  registryQueue_->sync([this, &information] {
    for (const auto &[identifier, provider] : providers_) {
      information.emplace(identifier, providerInfoRecord(*provider));
    }
  });
  return information;
}

ProviderRegistry::Provider ProviderRegistry::providerWithIdentifier(const std::optional<std::string> &identifier) {
  if (!identifier) return nullptr;
  Provider found;
  registryQueue_->sync([this, &identifier, &found] {
    const auto entry = providers_.find(*identifier);
    if (entry != providers_.end()) found = entry->second;
  });
  return found;
}

// The same, on the class side.

void SXExtensionStorix::createInstancesCompletion(std::function<void()> completion) {
  ProviderRegistry::shared()->createInstancesCompletion(std::move(completion));
}

void SXExtensionStorix::refreshOperationsQueueRegisterProviders(
    std::vector<std::shared_ptr<SXExtensionStorix>> providers, std::function<void()> completion) {
  ProviderRegistry::shared()->refreshOperationsQueueRegisterProviders(providers, std::move(completion));
}

void SXExtensionStorix::setStorixAccessControl(const std::shared_ptr<SXAccessControl> &accessControl) {
  ProviderRegistry::shared()->setStorixAccessControl(accessControl);
}

std::shared_ptr<SXExtensionStorix> SXExtensionStorix::providerForURL(const std::optional<URL> &url,
                                                                     bool *outExcludedURL) {
  return ProviderRegistry::shared()->providerForURL(url, outExcludedURL);
}

std::shared_ptr<SXExtensionStorix> SXExtensionStorix::providerForURL(const std::optional<URL> &url) {
  return providerForURL(url, nullptr);
}

Dictionary SXExtensionStorix::providersInfo() { return ProviderRegistry::shared()->providersInfo(); }

std::shared_ptr<SXExtensionStorix> SXExtensionStorix::providerWithIdentifier(const Identifier &identifier) {
  return ProviderRegistry::shared()->providerWithIdentifier(identifier);
}

}  // namespace storix
