// The request channel of SXExtensionStorix: how a conversation with the extension is opened.

#include <utility>

#include "platform/Log.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

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
  extension()->beginExtensionRequest([self = shared_from_this(), handler = std::move(handler)](
                                         std::optional<RequestIdentifier> request, std::optional<SXError> error) {
    // The extension is read when the request is cancelled, not now: it may have been replaced.
    const CancelRequest cancelRequest = [self, request] {
      if (request) self->extension()->cancelExtensionRequest(*request);
    };
    sx_default_log().debug("[DEBUG] Beginning extension request.");
    if (error) {
      sx_default_log().fault("[ERROR] Extension request failed. Error: %@", *error);
      handler(std::move(error), nullptr, cancelRequest);
      return;
    }
    std::shared_ptr<_KTStorixVendor> proxy =
        self->proxyForIdentifier(request, [handler, cancelRequest](SXError connectionError) {
          handler(std::move(connectionError), nullptr, cancelRequest);
        });
    if (!proxy) {
      sx_default_log().fault("[ERROR] Could not get proxy object for a request.");
      handler(SXProxyNotFoundError(self->identifier(), std::nullopt), nullptr, cancelRequest);
      return;
    }
    handler(std::nullopt, std::move(proxy), cancelRequest);
  });
}

}  // namespace storix
