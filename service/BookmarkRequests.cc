// The requests of SXLinkServicer for the list of providers and for bookmarkable strings.

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "providers/SXExtensionStorix.h"
#include "service/BookmarkableString.h"
#include "service/ItemSandboxTokens.h"
#include "service/RequestSteps.h"
#include "service/SXLinkServicer.h"

namespace storix {

namespace {

/// Asks the provider where the item lies now and replies with tokens for the place.
void replyWithDocument(const std::shared_ptr<SXExtensionStorix> &provider, const BookmarkableString &bookmark,
                       const std::string &consumerID, SXDaemon::DocumentReply reply) {
  provider->URLForItemID(bookmark.itemIdentifier, [providerID = bookmark.providerIdentifier, consumerID,
                                                   reply = std::move(reply)](const std::optional<SXError> &error,
                                                                             const std::optional<URL> &url) {
    if (error) {
      replyHere(reply, std::nullopt, std::nullopt, std::nullopt, std::nullopt, SXSandboxExtensionFailedError(url));
      return;
    }
    std::optional<Data> tokenData;
    std::optional<URL> companionURL;
    std::optional<Data> companionTokenData;
    if (!issueItemSandboxTokens(url, &tokenData, &companionURL, &companionTokenData)) {
      sx_default_log().fault(
          "[ERROR] Failed to extend sandbox of URL %@ from provider ID %@ to consumer ID %@. Error: %@", url,
          providerID, consumerID, error);
      replyHere(reply, std::nullopt, std::nullopt, std::nullopt, std::nullopt, error);
      return;
    }
    sx_default_log().info("[INFO] Successfully extended sandbox of URL %@ from provider ID %@ to consumer ID %@.", url,
                          providerID, consumerID);
    replyHere(reply, url, std::move(tokenData), std::move(companionURL), std::move(companionTokenData), std::nullopt);
  });
}

}  // namespace

void SXLinkServicer::providers(ProvidersReply completionHandler) {
  sx_default_log().debug("[DEBUG] Serving: %@", providersName);
  if (!clientHasOneOfAllowedEntitlements(readOrWriteEntitlements())) {
    sx_default_log().debug("[DEBUG] %@: Client is missing entitlement", providersName);
    submitReply(std::move(completionHandler), SXClientLacksEntitlement(), std::nullopt);
    return;
  }
  ProcessScope::current().platform().globalQueue()->async(
      [reply = std::move(completionHandler), list = SXExtensionStorix::providersInfo()] {
        sx_default_log().debug("[DEBUG] %@: returning providers %@", providersName, list);
        replyHere(reply, std::nullopt, list);
      });
}

void SXLinkServicer::bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) {
  sx_default_log().debug("[DEBUG] Getting bookmarkable string for URL %@", url);
  const std::shared_ptr<SXExtensionStorix> provider = SXExtensionStorix::providerForURL(url);
  if (!provider) {
    sx_default_log().info("[INFO] Could not find the provider for URL %@", url);
    submitReply(std::move(completion), std::nullopt, std::nullopt);
    return;
  }
  provider->itemIDForURL(url, [provider, url, reply = std::move(completion)](std::optional<SXError> error,
                                                                             std::optional<std::string> itemID) {
    if (error) {
      replyHere(reply, std::nullopt, std::move(error));
      return;
    }
    if (!itemID) {
      sx_default_log().fault("[ERROR] Could not get Item ID for URL %@.", url);
      replyHere(reply, std::nullopt, std::nullopt);
      return;
    }
    std::string string = BookmarkableString{provider->identifier().value_or(""), std::move(*itemID)}.text();
    sx_default_log().debug("[DEBUG] Successfully generated bookmarkable string “%@” from URL %@.", string, url);
    replyHere(reply, std::move(string), std::nullopt);
  });
}

void SXLinkServicer::documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                                       DocumentReply completion) {
  sx_default_log().debug("[DEBUG] Getting URL from bookmarkable string: “%@”.", bookmarkableString);
  const auto fail = [&completion](SXError error) {
    submitReply(std::move(completion), std::nullopt, std::nullopt, std::nullopt, std::nullopt, std::move(error));
  };
  const std::optional<std::string> callerBundle = callerBundleIdentifier();
  if (!callerBundle) return fail(SXNotPermittedError());
  const std::optional<BookmarkableString> bookmark =
      bookmarkableString ? BookmarkableString::parse(*bookmarkableString) : std::nullopt;
  if (!bookmark) return fail(SXInvalidBookmarkableStringError());
  const auto &[providerID, itemID] = *bookmark;
  if (!SXAccessControlStore::sharedStore()->isProviderIdentifier(providerID, itemID, callerBundle)) {
    sx_default_log().fault("[ERROR] Provider ID %@ is not allowed to provide item ID “%@” to consumer ID %@",
                           providerID, itemID, callerBundle);
    return fail(SXNotPermittedError());
  }
  // Without such a provider the request is never answered; clients know.
  if (const std::shared_ptr<SXExtensionStorix> provider = SXExtensionStorix::providerWithIdentifier(providerID)) {
    replyWithDocument(provider, *bookmark, *callerBundle, std::move(completion));
  }
}

}  // namespace storix
