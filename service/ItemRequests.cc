// The requests of SXLinkServicer that ask the provider to act on an item for a consumer.

#include <functional>
#include <utility>

#include "platform/Log.h"
#include "platform/Result.h"
#include "providers/SXExtensionStorix.h"
#include "service/RequestSteps.h"
#include "service/SXLinkServicer.h"

namespace storix {

namespace {

using Provider = std::shared_ptr<SXExtensionStorix>;

/// What all three requests carry.
struct ItemRequest {
  std::optional<URL> url;
  std::optional<std::string> providerID;
  std::optional<std::string> consumerID;
  SXDaemon::ErrorReply reply;
};

using EarlyFailure = LogFormat<std::optional<URL>, std::optional<std::string>, std::optional<std::string>, SXError>;

/// Logs why the provider was not even asked, and replies.
void failEarly(const EarlyFailure &line, const ItemRequest &request, const SXError &error) {
  sx_default_log().fault(line, request.url, request.providerID, request.consumerID, error);
  submitReply(request.reply, error);
}

Result<Provider> providerByIdentifier(const ItemRequest &request) {
  if (std::optional<SXError> error = missingParameterError(request.url, request.providerID, request.consumerID)) {
    return std::move(*error);
  }
  Provider provider = SXExtensionStorix::providerWithIdentifier(request.providerID);
  if (!provider) return SXNotFoundError(request.providerID);
  return provider;
}

/// The owner of the URL, which must bear the identifier; `rejectedValue` goes into the error if not.
Result<Provider> providerByURL(const ItemRequest &request, const std::optional<std::string> &rejectedValue) {
  if (std::optional<SXError> error = missingParameterError(request.url, request.providerID, request.consumerID)) {
    return std::move(*error);
  }
  Provider provider = SXExtensionStorix::providerForURL(request.url);
  if (!provider) return SXNotFoundError(request.providerID);
  if (provider->identifier() != request.providerID) return SXInvalidParameterError("providerID", rejectedValue);
  return provider;
}

/// Asks the provider which item lies at the URL and, where the consumer has been granted it, hands
/// the client's reply handler itself to the provider's operation.
void forwardIfAllowed(const Provider &provider, ItemRequest request, std::weak_ptr<AccessControlSource> server,
                      void (SXExtensionStorix::*operation)(std::optional<URL>, SXDaemon::ErrorReply)) {
  const std::optional<URL> url = request.url;
  provider->itemIDForURL(url, [provider, request = std::move(request), server = std::move(server), operation](
                                  std::optional<SXError> error, const std::optional<std::string> &itemID) {
    if (error) {
      replyHere(request.reply, SXPluginOperationFailedError(std::move(error)));
      return;
    }
    const std::shared_ptr<SXAccessControlStore> store = accessControlStoreOf(server);
    if (!store || !store->isProviderWithIdentifier(request.providerID, itemID, request.consumerID)) {
      sx_default_log().fault("[ERROR] Consumer ID %@ is not allowed to access item ID “%@” from provider ID %@.",
                             request.consumerID, itemID, request.providerID);
      replyHere(request.reply, SXNotPermittedError());
      return;
    }
    ((*provider).*operation)(request.url, request.reply);
  });
}

}  // namespace

void SXLinkServicer::providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                                    std::optional<std::string> forConsumerID,
                                                    ErrorReply completionHandler) {
  sx_default_log().debug("[DEBUG] Serving: %@", providePlaceholderName);
  if (!clientHasOneOfAllowedEntitlements(readOrWriteEntitlements())) {
    submitReply(std::move(completionHandler), SXClientLacksEntitlement());
    return;
  }
  ItemRequest request{std::move(url), std::move(fromProviderID), std::move(forConsumerID),
                      std::move(completionHandler)};
  const Result<Provider> provider = providerByIdentifier(request);
  if (!provider) {
    failEarly("[ERROR] Could not provide placeholder for URL %@ from provider ID %@ to consumer ID %@. Error: %@",
              request, provider.error());
    return;
  }
  forwardIfAllowed(provider.value(), std::move(request), server_, &SXExtensionStorix::providePlaceholderForItemAtURL);
}

void SXLinkServicer::startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                             std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  sx_default_log().debug("[DEBUG] Serving: %@", startProvidingName);
  if (!clientHasOneOfAllowedEntitlements(readOrWriteEntitlements())) {
    submitReply(std::move(completionHandler), SXClientLacksEntitlement());
    return;
  }
  ItemRequest request{std::move(url), std::move(fromProviderID), std::move(forConsumerID),
                      std::move(completionHandler)};
  const Result<Provider> provider = providerByURL(request, request.providerID);
  if (!provider) {
    failEarly("[ERROR] Cannot provide item at URL %@ from provider ID %@ to consumer ID %@. Error: %@", request,
              provider.error());
    return;
  }
  forwardIfAllowed(provider.value(), std::move(request), server_, &SXExtensionStorix::startProvidingItemAtURL);
}

// Whoever may ask at all may stop: neither the item nor a grant is looked at.
void SXLinkServicer::stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                            std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  sx_default_log().debug("[DEBUG] Serving: %@", stopProvidingName);
  if (!clientHasOneOfAllowedEntitlements(readOrWriteEntitlements())) {
    submitReply(std::move(completionHandler), SXClientLacksEntitlement());
    return;
  }
  ItemRequest request{std::move(url), std::move(fromProviderID), std::move(forConsumerID),
                      std::move(completionHandler)};
  const Result<Provider> provider = providerByURL(request, std::nullopt);
  if (!provider) {
    failEarly("[ERROR] Could not stop providing item at URL %@ from provider ID %@ to consumer ID %@. Error: %@",
              request, provider.error());
    return;
  }
  const std::optional<URL> item = request.url;
  provider.value()->stopProvidingItemAtURL(item, [request = std::move(request)](std::optional<SXError> error) {
    if (error) {
      sx_default_log().fault("[ERROR] Could not ask provider ID %@ to stop providing item at URL %@. Error: %@",
                             request.providerID, request.url, *error);
    }
    // So the reply always carries an error; one without an underlying error means success.
    replyHere(request.reply, SXPluginOperationFailedError(std::move(error)));
  });
}

}  // namespace storix
