#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "access/SXAccessControlStore.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "service/SXLinkServicer.h"

// Steps that several requests of SXLinkServicer share.

namespace storix {

/// Submits the reply to the global queue; nothing without a handler.
template <class... Replies, class... Values>
void submitReply(CompletionHandler<Replies...> reply, Values... values) {
  if (!reply) return;
  ProcessScope::current().platform().globalQueue()->async(
      [reply = std::move(reply), ... values = std::move(values)] { reply(values...); });
}

/// Replies where the caller runs; nothing without a handler.
template <class... Replies, class... Values>
void replyHere(const CompletionHandler<Replies...> &reply, Values &&...values) {
  if (reply) reply(std::forward<Values>(values)...);
}

/// The entitlements that admit to everything guarded by one but handing out access.
const std::vector<std::string> &readOrWriteEntitlements();
/// The entitlement that admits to handing out access.
const std::vector<std::string> &writeEntitlement();

/// The error for the first that is absent, in this order; none when all are there.
std::optional<SXError> missingParameterError(const std::optional<URL> &url,
                                             const std::optional<std::string> &providerID,
                                             const std::optional<std::string> &consumerID);

/// The store of a server that may be gone. Null without one.
std::shared_ptr<SXAccessControlStore> accessControlStoreOf(const std::weak_ptr<AccessControlSource> &server);

}  // namespace storix
