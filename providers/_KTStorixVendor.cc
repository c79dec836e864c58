#include "providers/_KTStorixVendor.h"

namespace storix {

namespace {

// The rows of the table, by their position in it.
enum Operation : std::size_t {
  performInitialSetup,
  providePlaceholder,
  startProviding,
  itemChanged,
  stopProviding,
  identifierForItem,
  URLForItem,
};

}  // namespace

const ProtocolTable<_KTStorixVendor> &_KTStorixVendorProtocol() {
  using Vendor = _KTStorixVendor;
  static const ProtocolTable<Vendor> table =
      ProtocolTable<Vendor>("_KTStorixVendor", "com.tessel.StorixVendor", "/com/tessel/StorixVendor")
          .row("_performInitialSetupWithCompletion:", "PerformInitialSetup",
               &Vendor::_performInitialSetupWithCompletion, {"string", "URL", "error"})
          .row("_providePlaceholderAtURL:completion:", "ProvidePlaceholderAtURL", &Vendor::_providePlaceholderAtURL,
               {"URL", "placeholderURL", "error"})
          .row("_startProvidingItemAtURL:completion:", "StartProvidingItemAtURL", &Vendor::_startProvidingItemAtURL,
               {"URL", "error"})
          .row("_itemChangedAtURL:completion:", "ItemChangedAtURL", &Vendor::_itemChangedAtURL, {"URL", "error"})
          .row("_stopProvidingItemAtURL:completion:", "StopProvidingItemAtURL", &Vendor::_stopProvidingItemAtURL,
               {"URL", "error"})
          .row("_identifierForItemAtURL:completion:", "IdentifierForItemAtURL", &Vendor::_identifierForItemAtURL,
               {"URL", "error", "itemIdentifier"})
          .row("_URLForItemIdentifier:completion:", "URLForItemIdentifier", &Vendor::_URLForItemIdentifier,
               {"itemIdentifier", "error", "URL"});
  return table;
}

void _KTStorixVendorProxy::_performInitialSetupWithCompletion(CompletionHandler<std::string, URL, SXError> completion) {
  remote_->send(performInitialSetup, {}, unpackingReply<std::string, URL, SXError>(std::move(completion)));
}

void _KTStorixVendorProxy::_providePlaceholderAtURL(std::optional<URL> url,
                                                    CompletionHandler<URL, SXError> completion) {
  remote_->send(providePlaceholder, packArguments(std::move(url)), unpackingReply<URL, SXError>(std::move(completion)));
}

void _KTStorixVendorProxy::_startProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) {
  remote_->send(startProviding, packArguments(std::move(url)), unpackingReply<SXError>(std::move(completion)));
}

void _KTStorixVendorProxy::_itemChangedAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) {
  remote_->send(itemChanged, packArguments(std::move(url)), unpackingReply<SXError>(std::move(completion)));
}

void _KTStorixVendorProxy::_stopProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) {
  remote_->send(stopProviding, packArguments(std::move(url)), unpackingReply<SXError>(std::move(completion)));
}

void _KTStorixVendorProxy::_identifierForItemAtURL(std::optional<URL> url,
                                                   CompletionHandler<SXError, std::string> completion) {
  remote_->send(identifierForItem, packArguments(std::move(url)),
                unpackingReply<SXError, std::string>(std::move(completion)));
}

void _KTStorixVendorProxy::_URLForItemIdentifier(std::optional<std::string> itemIdentifier,
                                                 CompletionHandler<SXError, URL> completion) {
  remote_->send(URLForItem, packArguments(std::move(itemIdentifier)),
                unpackingReply<SXError, URL>(std::move(completion)));
}

}  // namespace storix
