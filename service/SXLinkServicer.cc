#include "service/SXLinkServicer.h"

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "service/RequestSteps.h"

namespace storix {

const std::vector<std::string> &readOrWriteEntitlements() {
  static const std::vector<std::string> names{"com.tessel.storix.acl-read", "com.tessel.storix.acl-write"};
  return names;
}

const std::vector<std::string> &writeEntitlement() {
  static const std::vector<std::string> names{"com.tessel.storix.acl-write"};
  return names;
}

std::optional<SXError> missingParameterError(const std::optional<URL> &url,
                                             const std::optional<std::string> &providerID,
                                             const std::optional<std::string> &consumerID) {
  if (!url) return SXInvalidParameterError("URL", std::nullopt);
  if (!providerID) return SXInvalidParameterError("providerID", std::nullopt);
  if (!consumerID) return SXInvalidParameterError("consumerID", std::nullopt);
  return std::nullopt;
}

std::shared_ptr<SXAccessControlStore> accessControlStoreOf(const std::weak_ptr<AccessControlSource> &server) {
  const std::shared_ptr<AccessControlSource> source = server.lock();
  return source ? source->accessControlStore() : nullptr;
}

bool SXLinkServicer::clientHasOneOfAllowedEntitlements(const std::vector<std::string> &names) const {
  for (const std::string &name : names) {
    const std::shared_ptr<ClientConnection> client = connection();
    const std::optional<Value> value = client ? client->entitlementValue(name) : std::nullopt;
    if (value && value->isTrueNumber()) return true;
  }
  const std::shared_ptr<ClientConnection> client = connection();
  const std::int32_t processIdentifier = client ? client->peerProcessIdentifier() : 0;
  sx_default_log().fault("[ERROR] Rejecting request from PID %d because it does not have any of these entitlements: %@",
                         processIdentifier, names);
  return false;
}

bool SXLinkServicer::clientHasSandboxAccessToFile(const std::optional<URL> &url) const {
  const std::string path = url ? url->fileSystemRepresentation() : std::string();
  return ProcessScope::current().platform().checkSandboxAccess(peerAuditToken(), "file-write-data",
                                                               SandboxFilter::pathNoReport, path) == 0;
}

AuditToken SXLinkServicer::peerAuditToken() const {
  const std::shared_ptr<ClientConnection> client = connection();
  return client ? client->peerAuditToken() : AuditToken{};
}

std::optional<std::string> SXLinkServicer::callerBundleIdentifier() const {
  return ProcessScope::current().platform().bundleIdentifierForAuditToken(peerAuditToken());
}

void SXLinkServicer::wakeUp(CompletionHandler<> completion) {
  sx_default_log().debug("[DEBUG] Serving: %@", wakeUpName);
  submitReply(std::move(completion));
}

}  // namespace storix
