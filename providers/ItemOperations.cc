// The item operations of SXExtensionStorix: a request to the extension, one message, its reply.

#include <utility>

#include "platform/Log.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

/// One member of the family: what it calls itself, the message it sends and the lines it logs.
/// `Subject` is the argument; `Values` are what the reply carries besides the error.
template <class Subject, class... Values>
struct ItemOperation {
  using Identifier = std::optional<std::string>;
  using Reply = CompletionHandler<SXError, Values...>;

  std::string_view name;
  void (*send)(_KTStorixVendor &vendor, std::optional<Subject> subject, Reply reply);
  LogFormat<std::optional<Subject>, Identifier, SXError> requestFailed;
  LogFormat<std::optional<Subject>, Identifier, SXError> replyFailed;
  LogFormat<std::optional<Values>..., std::optional<Subject>, Identifier> succeeded;
};

/// One call of a member, which its callbacks share, so that none of them copies it.
template <class Subject, class... Values>
struct ItemCall {
  const ItemOperation<Subject, Values...> &operation;
  std::shared_ptr<SXExtensionStorix> provider;
  std::optional<Subject> subject;
  CompletionHandler<SXError, Values...> completion;

  void fail(const LogFormat<std::optional<Subject>, std::optional<std::string>, SXError> &line,
            std::optional<SXError> error) const {
    sx_default_log().fault(line, subject, provider->identifier(), *error);
    if (completion) completion(SXPluginOperationFailedError(std::move(error)), std::optional<Values>()...);
  }

  void succeed(std::optional<Values>... values) const {
    sx_default_log().debug(operation.succeeded, values..., subject, provider->identifier());
    if (completion) completion(std::nullopt, std::move(values)...);
  }
};

/// What the members have in common. `operation` must live as long as the process.
template <class Subject, class... Values>
void perform(const ItemOperation<Subject, Values...> &operation, std::shared_ptr<SXExtensionStorix> provider,
             std::optional<Subject> subject, CompletionHandler<SXError, Values...> completion) {
  sx_default_log().debug("[DEBUG] %s", operation.name);
  using Call = ItemCall<Subject, Values...>;
  const auto call =
      std::make_shared<const Call>(Call{operation, std::move(provider), std::move(subject), std::move(completion)});
  call->provider->performExtensionRequest([call](std::optional<SXError> error,
                                                 const std::shared_ptr<_KTStorixVendor> &vendor,
                                                 CancelRequest cancelRequest) {
    if (error) {
      // The request stays as it is: one that failed is not cancelled here.
      call->fail(call->operation.requestFailed, std::move(error));
      return;
    }
    call->operation.send(*vendor, call->subject,
                         [call, cancelRequest = std::move(cancelRequest)](std::optional<SXError> replyError,
                                                                          std::optional<Values>... values) {
                           if (replyError) {
                             call->fail(call->operation.replyFailed, std::move(replyError));
                           } else {
                             call->succeed(std::move(values)...);
                           }
                           cancelRequest();
                         });
  });
}

/// Sends a message whose reply has the shape that the completion has.
template <auto message, class Subject, class... Values>
void send(_KTStorixVendor &vendor, std::optional<Subject> subject, CompletionHandler<SXError, Values...> reply) {
  (vendor.*message)(std::move(subject), std::move(reply));
}

/// The extension answers a placeholder's URL, too, which nobody needs.
void sendProvidePlaceholder(_KTStorixVendor &vendor, std::optional<URL> url, CompletionHandler<SXError> reply) {
  vendor._providePlaceholderAtURL(
      std::move(url), [reply = std::move(reply)](const std::optional<URL> & /*unused*/, std::optional<SXError> error) {
        reply(std::move(error));
      });
}

constexpr ItemOperation<URL> providePlaceholderOperation{
    "-[SXExtensionStorix providePlaceholderForItemAtURL:completionHandler:]",
    &sendProvidePlaceholder,
    "[ERROR] Cannot provide placeholder for item at URL %@ for extension %@. Error: %@",
    "[ERROR] Proxy failed to provide placeholder at URL %@ for extension %@. Error: %@",
    "[DEBUG] Successfully provided placeholder at URL %@ for extension %@.",
};

constexpr ItemOperation<URL> startProvidingOperation{
    "-[SXExtensionStorix startProvidingItemAtURL:completionHandler:]",
    &send<&_KTStorixVendor::_startProvidingItemAtURL, URL>,
    "[ERROR] Cannot provide item at URL %@ for extension %@. Error: %@",
    "[ERROR] Proxy failed to start providing item at URL %@ for extension %@. Error: %@",
    "[DEBUG] Successfully provided item at URL %@ for extension %@.",
};

constexpr ItemOperation<URL> stopProvidingOperation{
    "-[SXExtensionStorix stopProvidingItemAtURL:completionHandler:]",
    &send<&_KTStorixVendor::_stopProvidingItemAtURL, URL>,
    "[ERROR] Cannot stop providing item at URL %@ for extension %@. Error: %@",
    "[ERROR] Proxy failed to stop providing item at URL %@ for extension %@. Error: %@",
    "[DEBUG] Successfully stopped providing item at URL %@ for extension %@.",
};

constexpr ItemOperation<URL, std::string> itemIDOperation{
    "-[SXExtensionStorix itemIDForURL:completionHandler:]",
    &send<&_KTStorixVendor::_identifierForItemAtURL, URL, std::string>,
    "[ERROR] Cannot get item ID for URL %@ for extension %@. Error: %@",
    "[ERROR] Proxy failed to get item ID for URL %@ for extension %@. Error: %@",
    "[DEBUG] Successfully got item ID “%@” for URL %@ from extension %@",
};

constexpr ItemOperation<std::string, URL> itemURLOperation{
    "-[SXExtensionStorix URLForItemID:completionHandler:]",
    &send<&_KTStorixVendor::_URLForItemIdentifier, std::string, URL>,
    "[ERROR] Cannot get URL for item ID “%@” for extension %@. Error: %@",
    "[ERROR] Proxy failed to get URL for item ID “%@” for extension %@. Error: %@",
    "[DEBUG] Successfully retrieved URL %@ for item ID “%@” from extension %@",
};

constexpr std::string_view itemChangedName = "-[SXExtensionStorix itemChangedAtURL:]";

}  // namespace

void SXExtensionStorix::providePlaceholderForItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler) {
  perform(providePlaceholderOperation, shared_from_this(), std::move(url), std::move(completionHandler));
}

void SXExtensionStorix::startProvidingItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler) {
  perform(startProvidingOperation, shared_from_this(), std::move(url), std::move(completionHandler));
}

void SXExtensionStorix::stopProvidingItemAtURL(std::optional<URL> url, ErrorCompletion completionHandler) {
  perform(stopProvidingOperation, shared_from_this(), std::move(url), std::move(completionHandler));
}

void SXExtensionStorix::itemIDForURL(std::optional<URL> url,
                                     CompletionHandler<SXError, std::string> completionHandler) {
  perform(itemIDOperation, shared_from_this(), std::move(url), std::move(completionHandler));
}

void SXExtensionStorix::URLForItemID(Identifier itemID, CompletionHandler<SXError, URL> completionHandler) {
  perform(itemURLOperation, shared_from_this(), std::move(itemID), std::move(completionHandler));
}

// Not of the family: nobody waits for it, and it ends its request on every path.
void SXExtensionStorix::itemChangedAtURL(std::optional<URL> url) {
  sx_default_log().debug("[DEBUG] %s", itemChangedName);
  performExtensionRequest([self = shared_from_this(), url = std::move(url)](
                              const std::optional<SXError> &error, const std::shared_ptr<_KTStorixVendor> &vendor,
                              const CancelRequest &cancelRequest) {
    if (error) {
      sx_default_log().fault("[ERROR] Cannot tell extension %@ that item at URL %@ has changed.", self->identifier(),
                             url);
      cancelRequest();
      return;
    }
    vendor->_itemChangedAtURL(url, [self, url, cancelRequest](const std::optional<SXError> &replyError) {
      if (replyError) {
        sx_default_log().fault("[ERROR] Could not tell extension %@ that item at URL %@ has changed. Error: %@",
                               self->identifier(), url, *replyError);
      }
      cancelRequest();
    });
  });
}

}  // namespace storix
