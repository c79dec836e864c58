// What the file coordination service asks of a registered SXExtensionStorix, and tells it.

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

constexpr std::string_view deprecatedProvideName = "_provideItemAtURL:completionHandler:";

}  // namespace

std::optional<URL> SXExtensionStorix::_providedItemsURL() { return providedItemsURL(); }

std::shared_ptr<OperationQueue> SXExtensionStorix::_providedItemsOperationQueue() { return operationQueue_; }

std::optional<std::string> SXExtensionStorix::_fileReactorID() { return identifier(); }

bool SXExtensionStorix::answers(OptionalMember member) const {
  return member == OptionalMember::provideItemAtURLToReaderWithID ||
         member == OptionalMember::writerWithIDDidFinishWritingForURL || member == OptionalMember::fileReactorID;
}

void SXExtensionStorix::_provideItemAtURL(std::optional<URL> url, Completion completionHandler) {
  sx_default_log().fault("[ERROR] Calling deprecated method: %@", deprecatedProvideName);
  _provideItemAtURL(std::move(url), std::nullopt, std::move(completionHandler));
}

void SXExtensionStorix::_provideItemAtURL(std::optional<URL> url, std::optional<std::string> toReaderWithID,
                                          Completion completionHandler) {
  sx_default_log().info("[INFO] KTFileCoordinator requested us to provide item at URL %@ for consumer %@", url,
                        toReaderWithID);
  // Asks whether the extension knows the item; which identifier it has is of no interest here.
  itemIDForURL(url, [self = shared_from_this(), url, toReaderWithID, completionHandler = std::move(completionHandler)](
                        std::optional<SXError> error, const std::optional<std::string> & /*unused*/) {
    if (error) {
      sx_default_log().fault("[ERROR] Could not provide item at URL %@ from extension %@ to reader %@. Error: %@", url,
                             self->identifier(), toReaderWithID, *error);
      if (completionHandler) completionHandler(std::move(error));
      return;
    }
    ProcessScope::current().platform().globalQueue()->async(
        [self, url, completionHandler] { self->startProvidingItemAtURL(url, completionHandler); });
  });
}

void SXExtensionStorix::_writerWithID(std::optional<std::string> writerID, std::optional<URL> didFinishWritingForURL) {
  const std::optional<URL> &url = didFinishWritingForURL;
  sx_default_log().info("[INFO] KTFileCoordinator is telling us the item at URL %@ was changed by writer ID %@.", url,
                        writerID);
  bool excluded = false;
  const std::shared_ptr<SXExtensionStorix> provider = providerForURL(url, &excluded);
  if (provider) {
    sx_default_log().debug("[DEBUG] The item at URL %@ is provided by the etxension %@", url, provider->identifier());
    provider->itemChangedAtURL(url);
    return;
  }
  if (!excluded) {
    sx_default_log().fault("[ERROR] Could not find any extension that provides an item at URL %@", url);
  }
}

}  // namespace storix
