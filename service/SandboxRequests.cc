// The requests of SXLinkServicer that hand a consumer access to an item.

#include <utility>

#include "platform/Log.h"
#include "providers/SXExtensionStorix.h"
#include "service/BookmarkableString.h"
#include "service/ItemSandboxTokens.h"
#include "service/RequestSteps.h"
#include "service/SXLinkServicer.h"

namespace storix {

void SXLinkServicer::extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                                             std::optional<std::string> toConsumerID, SandboxReply completionHandler) {
  sx_default_log().debug("[DEBUG] Serving: %@", extendSandboxName);
  if (!clientHasOneOfAllowedEntitlements(writeEntitlement())) {
    submitReply(std::move(completionHandler), SXClientLacksEntitlement(), std::nullopt, std::nullopt, std::nullopt);
    return;
  }

  std::optional<SXError> error = missingParameterError(fileURL, fromProviderID, toConsumerID);
  std::shared_ptr<SXExtensionStorix> provider;
  if (!error) {
    provider = SXExtensionStorix::providerWithIdentifier(fromProviderID);
    if (!provider) error = SXNotFoundError(fromProviderID);
  }
  if (error) {
    sx_default_log().fault(
        "[ERROR] Could not extend sandbox for URL %@ from provider ID %@ to consumer ID %@, error: %@", fileURL,
        fromProviderID, toConsumerID, *error);
    submitReply(std::move(completionHandler), std::move(*error), std::nullopt, std::nullopt, std::nullopt);
    return;
  }

  provider->itemIDForURL(
      fileURL, [server = server_, fileURL, fromProviderID, toConsumerID, reply = std::move(completionHandler)](
                   std::optional<SXError> providerError, const std::optional<std::string> &itemID) {
        if (providerError) {
          replyHere(reply, SXPluginOperationFailedError(std::move(providerError)), std::nullopt, std::nullopt,
                    std::nullopt);
          return;
        }
        if (const std::shared_ptr<SXAccessControlStore> store = accessControlStoreOf(server)) {
          store->allowProviderWithIdentifier(fromProviderID, itemID, toConsumerID);
        }
        // A token that could not be issued reaches the client as absent data in a successful reply.
        std::optional<Data> tokenData;
        std::optional<URL> companionURL;
        std::optional<Data> companionTokenData;
        if (!issueItemSandboxTokens(fileURL, &tokenData, &companionURL, &companionTokenData)) {
          sx_default_log().fault("[ERROR] Failed to extend sandbox for URL %@ from provider ID %@ to consumer ID %@.",
                                 fileURL, fromProviderID, toConsumerID);
          replyHere(reply, SXSandboxExtensionFailedError(fileURL), std::nullopt, std::nullopt, std::nullopt);
          return;
        }
        sx_default_log().info("[INFO] Successfully extended sandbox for URL %@ from provider ID %@ to consumer ID %@.",
                              fileURL, fromProviderID, toConsumerID);
        replyHere(reply, std::nullopt, std::move(tokenData), std::move(companionURL), std::move(companionTokenData));
      });
}

void SXLinkServicer::extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                              BookmarkReply completionHandler) {
  const std::optional<std::string> callerBundle = callerBundleIdentifier();
  sx_default_log().debug("[DEBUG] Extending bookmark privileges for URL: “%@” from bundle %@ to %@.", fileURL,
                         callerBundle, toConsumerID);

  std::optional<SXError> error;
  if (!toConsumerID || !callerBundle) error = SXNotPermittedError();
  if (!clientHasSandboxAccessToFile(fileURL)) error = SXNotPermittedError();
  std::shared_ptr<SXExtensionStorix> provider;
  if (!error) {
    provider = SXExtensionStorix::providerForURL(fileURL);
    if (!provider) error = SXNotFoundErrorURL(fileURL);
  }
  if (error) {
    sx_default_log().fault(
        "[ERROR] Could not extend bookmark privileges for URL %@ from bundle %@ to consumer ID %@, error: %@", fileURL,
        callerBundle, toConsumerID, *error);
    submitReply(std::move(completionHandler), std::nullopt, std::move(*error));
    return;
  }

  provider->itemIDForURL(
      fileURL, [server = server_, provider, fileURL, toConsumerID, reply = std::move(completionHandler)](
                   std::optional<SXError> providerError, const std::optional<std::string> &itemID) {
        if (providerError) {
          replyHere(reply, std::nullopt, SXPluginOperationFailedError(std::move(providerError)));
          return;
        }
        const std::optional<std::string> providerID = provider->identifier();
        if (const std::shared_ptr<SXAccessControlStore> store = accessControlStoreOf(server)) {
          store->allowProviderWithIdentifier(providerID, itemID, toConsumerID);
        }
        std::string string = BookmarkableString{providerID.value_or(""), itemID.value_or("")}.text();
        sx_default_log().debug("[DEBUG] Successfully generated bookmarkable string “%@” from URL %@.", string, fileURL);
        replyHere(reply, std::move(string), std::nullopt);
      });
}

}  // namespace storix
