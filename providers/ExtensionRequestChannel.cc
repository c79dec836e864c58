// The request channel of SXExtensionStorix: how a conversation with the extension is opened.

#include <utility>

#include "platform/Log.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

/// What the callbacks of one request share, so that none of them copies it.
struct Conversation {
  std::shared_ptr<SXExtensionStorix> provider;
  ExtensionRequestHandler handler;
  std::optional<RequestIdentifier> request;  ///< Once it has begun.
};

/// The extension is read when the request is cancelled, not before: it may have been replaced.
CancelRequest cancelling(std::shared_ptr<const Conversation> conversation) {
  return [conversation = std::move(conversation)] {
    if (conversation->request) conversation->provider->extension()->cancelExtensionRequest(*conversation->request);
  };
}

}  // namespace

std::shared_ptr<_KTStorixVendor> SXExtensionStorix::proxyForIdentifier(
    const std::optional<RequestIdentifier> &identifier, ConnectionErrorHandler errorHandler) {
  const std::shared_ptr<ExtensionContext> context =
      identifier ? extension()->extensionContextForRequest(*identifier) : nullptr;
  if (!context) {
    sx_default_log().fault("[ERROR] Could not get extension context for request identifier %@", identifier);
    return nullptr;
  }
  const std::shared_ptr<AuxiliaryConnection> &connection = context->auxiliaryConnection();
  if (!connection) return nullptr;
  std::shared_ptr<RemoteObject> remote =
      connection->remoteProxyWithErrorHandler([errorHandler = std::move(errorHandler)](SXError error) {
        sx_default_log().fault("[ERROR] Error getting remote proxy object for provider extension. Error: %@", error);
        if (errorHandler) errorHandler(std::move(error));
      });
  if (!remote) return nullptr;
  return std::make_shared<_KTStorixVendorProxy>(std::move(remote));
}

void SXExtensionStorix::performExtensionRequest(ExtensionRequestHandler handler) {
  const auto conversation = std::make_shared<Conversation>(Conversation{shared_from_this(), std::move(handler), {}});
  extension()->beginExtensionRequest(
      [conversation](std::optional<RequestIdentifier> request, std::optional<SXError> error) {
        conversation->request = std::move(request);
        SXExtensionStorix &self = *conversation->provider;
        const ExtensionRequestHandler &handle = conversation->handler;
        sx_default_log().debug("[DEBUG] Beginning extension request.");
        if (error) {
          sx_default_log().fault("[ERROR] Extension request failed. Error: %@", *error);
          handle(std::move(error), nullptr, cancelling(conversation));
          return;
        }
        std::shared_ptr<_KTStorixVendor> proxy =
            self.proxyForIdentifier(conversation->request, [conversation](SXError connectionError) {
              conversation->handler(std::move(connectionError), nullptr, cancelling(conversation));
            });
        if (!proxy) {
          sx_default_log().fault("[ERROR] Could not get proxy object for a request.");
          handle(SXProxyNotFoundError(self.identifier(), std::nullopt), nullptr, cancelling(conversation));
          return;
        }
        handle(std::nullopt, std::move(proxy), cancelling(conversation));
      });
}

}  // namespace storix
