#include "platform/FileCoordination.h"

namespace storix {

void KTStorix::_provideItemAtURL(std::optional<URL> /*url*/, std::optional<std::string> /*toReaderWithID*/,
                                 Completion completionHandler) {
  if (completionHandler) completionHandler(std::nullopt);
}

void KTStorix::_cancelProvidingItemAtURL(std::optional<URL> /*url*/, std::optional<std::string> /*toReaderWithID*/) {}

std::optional<URL> KTStorix::_physicalURLForURL(std::optional<URL> /*url*/) { return std::nullopt; }

void KTStorix::_writerWithID(std::optional<std::string> /*writerID*/, std::optional<URL> /*didFinishWritingForURL*/) {}

void KTStorix::_providedItemAtURLDidGainPresenterWithID(std::optional<URL> /*url*/,
                                                        std::optional<std::string> /*presenterID*/) {}

void KTStorix::_providedItemAtURLDidLosePresenterWithID(std::optional<URL> /*url*/,
                                                        std::optional<std::string> /*presenterID*/) {}

void KTStorix::_providedItemAtURLWithPresenterWithIDDidMoveToURL(std::optional<URL> /*url*/,
                                                                 std::optional<std::string> /*presenterID*/,
                                                                 std::optional<URL> /*newURL*/) {}

std::optional<std::string> KTStorix::_fileReactorID() { return std::nullopt; }

}  // namespace storix
