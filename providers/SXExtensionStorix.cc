#include "providers/SXExtensionStorix.h"

#include <map>
#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"

namespace storix {

namespace {

/// The directory "Storix Storage" in the group container that the extension's bundle names; absent,
/// with a line that says what is missing, where it cannot be derived.
std::optional<URL> derivedProvidedItemsURL(PlatformServices &platform,
                                           const std::shared_ptr<ExtensionRecord> &extension) {
  const std::shared_ptr<BundleRecord> bundle = platform.bundleRecordForIdentifier(extension->identifier());
  if (!bundle) {
    sx_default_log().fault("[ERROR] Cannot instantiate a Appdex proxy for %@", extension);
    return std::nullopt;
  }
  const std::optional<Value> information = bundle->infoDictionaryValue("KTExtension", ValueKind::dictionary);
  const Dictionary *dictionary = information ? information->dictionary() : nullptr;
  if (!dictionary) {
    sx_default_log().fault("[ERROR] Cannot read KTExtension dictionary from the Info.kvs of %@", extension);
    return std::nullopt;
  }
  const auto entry = dictionary->find("KTExtensionStorixDocumentGroup");
  const std::string *group = entry == dictionary->end() ? nullptr : entry->second.string();
  if (!group) {
    sx_default_log().fault("[ERROR] Cannot read KTExtensionStorixDocumentGroup key from the Info.kvs of %@", extension);
    return std::nullopt;
  }
  const std::map<std::string, URL> containers = bundle->groupContainerURLs();
  const auto container = containers.find(*group);
  if (container == containers.end()) {
    sx_default_log().fault("[ERROR] Cannot deduce the provided items URL for %@", extension);
    return std::nullopt;
  }
  return container->second.appendingPathComponent("Storix Storage", true);
}

}  // namespace

std::shared_ptr<SXExtensionStorix> SXExtensionStorix::initWithExtension(std::shared_ptr<ExtensionRecord> extension) {
  return std::shared_ptr<SXExtensionStorix>(new SXExtensionStorix(std::move(extension)));
}

SXExtensionStorix::SXExtensionStorix(std::shared_ptr<ExtensionRecord> extension)
    : memberQueueIdentifier_(extension->identifier()), memberQueueExtension_(std::move(extension)) {
  PlatformServices &platform = ProcessScope::current().platform();
  const std::string name = logDescription(memberQueueIdentifier_);
  operationQueue_ = platform.createOperationQueue("Operation queue for " + name);
  memberQueue_ = platform.createConcurrentQueue("SXExtensionStorix concurrent member queue for " + name);
  memberQueueProvidedItemsURL_ = derivedProvidedItemsURL(platform, memberQueueExtension_);
}

std::shared_ptr<ExtensionRecord> SXExtensionStorix::extension() {
  std::shared_ptr<ExtensionRecord> extension;
  memberQueue_->sync([this, &extension] { extension = memberQueueExtension_; });
  return extension;
}

void SXExtensionStorix::setExtension(std::shared_ptr<ExtensionRecord> extension) {
  memberQueue_->asyncBarrier(
      [self = shared_from_this(), extension = std::move(extension)] { self->memberQueueExtension_ = extension; });
}

SXExtensionStorix::Identifier SXExtensionStorix::identifier() {
  Identifier identifier;
  memberQueue_->sync([this, &identifier] {
    identifier = memberQueueIdentifier_ ? memberQueueIdentifier_ : memberQueueExtension_->identifier();
  });
  return identifier;
}

void SXExtensionStorix::setIdentifier(Identifier identifier) {
  memberQueue_->asyncBarrier(
      [self = shared_from_this(), identifier = std::move(identifier)] { self->memberQueueIdentifier_ = identifier; });
}

std::optional<URL> SXExtensionStorix::providedItemsURL() {
  std::optional<URL> url;
  memberQueue_->sync([this, &url] { url = memberQueueProvidedItemsURL_; });
  return url;
}

void SXExtensionStorix::setProvidedItemsURL(std::optional<URL> url) {
  memberQueue_->asyncBarrier(
      [self = shared_from_this(), url = std::move(url)] { self->memberQueueProvidedItemsURL_ = url; });
}

}  // namespace storix
