#include "access/SXAccessControlStore.h"

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"

namespace storix {

namespace {

constexpr std::string_view firstUnlockNotification = "com.tessel.mobile.vaultkeepd.first_unlock";

struct AccessControlFile {
  std::string path;
};

// Works out where the file is and makes its directory, once per process.
std::shared_ptr<AccessControlFile> locateAccessControlFile() {
  PlatformServices &platform = ProcessScope::current().platform();
  const std::string directory = stringByAppendingPathComponent(platform.homeDirectory(), accessControlDirectory);
  if (!platform.fileExists(directory)) {
    if (const std::optional<SXError> error = platform.createDirectory(directory, true)) {
      sx_default_log().fault("[ERROR] Cannot create access control directory. Error: %@", *error);
    }
  }
  return std::make_shared<AccessControlFile>(
      AccessControlFile{stringByAppendingPathComponent(directory, accessControlFileName)});
}

const std::string &accessControlFilePath() {
  return ProcessScope::current().instance<AccessControlFile>(locateAccessControlFile)->path;
}

}  // namespace

std::shared_ptr<SXAccessControlStore> SXAccessControlStore::sharedStore() {
  return ProcessScope::current().instance<SXAccessControlStore>(&SXAccessControlStore::init);
}

std::shared_ptr<SXAccessControlStore> SXAccessControlStore::init() {
  return std::shared_ptr<SXAccessControlStore>(new SXAccessControlStore());
}

SXAccessControlStore::SXAccessControlStore() {
  PlatformServices &platform = ProcessScope::current().platform();
  syncQueue_ = platform.createSerialQueue("SXAccessControlStore sync queue");
  platform.addSystemNotificationObserver(firstUnlockNotification, [] { sharedStore()->rereadAccessControl(); });
  syncQueueReadAccessControl();
}

bool SXAccessControlStore::lookUp(const std::string &providerID, const std::string &itemID,
                                  const std::string &consumerID) {
  bool allowed = false;
  syncQueue_->sync([this, &providerID, &itemID, &consumerID, &allowed] {
    allowed = syncQueueAccessControlDict_.contains(providerID, itemID, consumerID);
  });
  return allowed;
}

bool SXAccessControlStore::isProviderWithIdentifier(const Identifier &providerID,
                                                    const Identifier &allowedToProvideItemID,
                                                    const Identifier &toConsumerWithIdentifier) {
  if (!providerID || !allowedToProvideItemID || !toConsumerWithIdentifier) return false;
  return lookUp(*providerID, *allowedToProvideItemID, *toConsumerWithIdentifier);
}

bool SXAccessControlStore::isProviderIdentifier(const Identifier &providerID, const Identifier &allowedToProvideItemID,
                                                const Identifier &toConsumerWithIdentifier) {
  if (!providerID || providerID->empty()) return false;
  if (!toConsumerWithIdentifier || !allowedToProvideItemID || allowedToProvideItemID->empty()) return false;
  return lookUp(*providerID, *allowedToProvideItemID, *toConsumerWithIdentifier);
}

void SXAccessControlStore::allowProviderWithIdentifier(const Identifier &providerID, const Identifier &toProvideItemID,
                                                       const Identifier &toConsumerWithIdentifier) {
  if (!providerID || !toProvideItemID || !toConsumerWithIdentifier) {
    endProcessForProgrammingError("a grant needs a provider, an item and a consumer");
  }
  syncQueue_->sync([this, &providerID, &toProvideItemID, &toConsumerWithIdentifier] {
    if (!syncQueueAccessControlDict_.add(*providerID, *toProvideItemID, *toConsumerWithIdentifier)) {
      sx_default_log().info("[INFO] Provider ID %@ is already allowed to provide item ID “%@” to consumer ID %@.",
                            *providerID, *toProvideItemID, *toConsumerWithIdentifier);
      return;
    }
    sx_default_log().info("[INFO] Allowing provider ID %@ to provide item ID “%@” to consumer ID %@", *providerID,
                          *toProvideItemID, *toConsumerWithIdentifier);
    syncQueueCommitAccessControl();
  });
}

void SXAccessControlStore::disallowProviderWithIdentifier(const Identifier &providerID,
                                                          const Identifier &fromProvidingItemWithID,
                                                          const Identifier &toConsumerWithIdentifier) {
  syncQueue_->sync([this, &providerID, &fromProvidingItemWithID, &toConsumerWithIdentifier] {
    if (!providerID || !fromProvidingItemWithID || !toConsumerWithIdentifier) return;
    if (!syncQueueAccessControlDict_.remove(*providerID, *fromProvidingItemWithID, *toConsumerWithIdentifier)) return;
    sx_default_log().info("[INFO] No longer allowing provider ID %@ to provide item ID “%@” to consumer ID %@",
                          *providerID, *fromProvidingItemWithID, *toConsumerWithIdentifier);
    syncQueueCommitAccessControl();
  });
}

void SXAccessControlStore::rereadAccessControl() {
  syncQueue_->async([self = shared_from_this()] { self->syncQueueReadAccessControl(); });
}

void SXAccessControlStore::syncQueueReadAccessControl() {
  PlatformServices &platform = ProcessScope::current().platform();
  const std::string &path = accessControlFilePath();
  if (!platform.fileExists(path)) return;
  const std::unique_ptr<InputStream> stream = platform.openFileInputStream(path);
  if (!stream) return;

  Result<Value> content = platform.readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
  Result<AccessControlMap> map =
      content ? AccessControlMap::fromValue(std::move(content.value())) : Result<AccessControlMap>(content.error());
  if (!map) {
    syncQueueAccessControlDict_ = AccessControlMap();
    sx_default_log().fault("[ERROR] Cannot read access control from disk. Error: %@", map.error());
    return;
  }
  syncQueueAccessControlDict_ = std::move(map.value());
  sx_default_log().info("[INFO] Successfully read access control from disk.");
}

void SXAccessControlStore::syncQueueCommitAccessControl() {
  sx_default_log().info("[INFO] Committing access control list");
  const std::string &path = accessControlFilePath();
  if (!ProcessScope::current().platform().writeKeyedValueFileAtomically(syncQueueAccessControlDict_.dictionary(),
                                                                        path)) {
    sx_default_log().fault("[ERROR] Could not write to %@", path);
  }
}

}  // namespace storix
