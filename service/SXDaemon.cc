#include "service/SXDaemon.h"

namespace storix {

namespace {

// The rows of the table, by their position in it.
enum Operation : std::size_t {
  wakeUpOperation,
  extendSandboxOperation,
  providePlaceholderOperation,
  startProvidingOperation,
  stopProvidingOperation,
  providersOperation,
  extendBookmarkOperation,
  bookmarkableStringOperation,
  documentURLOperation,
};

}  // namespace

const ProtocolTable<SXDaemon> &SXDaemonProtocol() {
  static const ProtocolTable<SXDaemon> table =
      ProtocolTable<SXDaemon>("SXDaemon", "com.tessel.Storix.Daemon", "/com/tessel/Storix")
          .row(SXDaemon::wakeUpName, "WakeUp", &SXDaemon::wakeUp, {})
          .row(SXDaemon::extendSandboxName, "ExtendSandboxForFileURL", &SXDaemon::extendSandboxForFileURL,
               {"fileURL", "providerID", "consumerID", "error", "tokenData", "companionURL", "companionTokenData"})
          .row(SXDaemon::providePlaceholderName, "ProvidePlaceholderForItemAtURL",
               &SXDaemon::providePlaceholderForItemAtURL, {"URL", "providerID", "consumerID", "error"})
          .row(SXDaemon::startProvidingName, "StartProvidingItemAtURL", &SXDaemon::startProvidingItemAtURL,
               {"URL", "providerID", "consumerID", "error"})
          .row(SXDaemon::stopProvidingName, "StopProvidingItemAtURL", &SXDaemon::stopProvidingItemAtURL,
               {"URL", "providerID", "consumerID", "error"})
          .row(SXDaemon::providersName, "Providers", &SXDaemon::providers, {"error", "providers"})
          .row(SXDaemon::extendBookmarkName, "ExtendBookmarkForFileURL", &SXDaemon::extendBookmarkForFileURL,
               {"fileURL", "consumerID", "bookmarkableString", "error"})
          .row(SXDaemon::bookmarkableStringName, "BookmarkableStringFromDocumentURL",
               &SXDaemon::bookmarkableStringFromDocumentURL, {"URL", "bookmarkableString", "error"})
          .row(SXDaemon::documentURLName, "DocumentURLFromBookmarkableString",
               &SXDaemon::documentURLFromBookmarkableString,
               {"bookmarkableString", "URL", "tokenData", "companionURL", "companionTokenData", "error"});
  return table;
}

void SXDaemonProxy::wakeUp(CompletionHandler<> completion) {
  remote_->send(wakeUpOperation, {}, unpackingReply(std::move(completion)));
}

void SXDaemonProxy::extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                                            std::optional<std::string> toConsumerID, SandboxReply completionHandler) {
  remote_->send(extendSandboxOperation,
                packArguments(std::move(fileURL), std::move(fromProviderID), std::move(toConsumerID)),
                unpackingReply<SXError, Data, URL, Data>(std::move(completionHandler)));
}

void SXDaemonProxy::providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                                   std::optional<std::string> forConsumerID,
                                                   ErrorReply completionHandler) {
  remote_->send(providePlaceholderOperation,
                packArguments(std::move(url), std::move(fromProviderID), std::move(forConsumerID)),
                unpackingReply<SXError>(std::move(completionHandler)));
}

void SXDaemonProxy::startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                            std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  remote_->send(startProvidingOperation,
                packArguments(std::move(url), std::move(fromProviderID), std::move(forConsumerID)),
                unpackingReply<SXError>(std::move(completionHandler)));
}

void SXDaemonProxy::stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                           std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  remote_->send(stopProvidingOperation,
                packArguments(std::move(url), std::move(fromProviderID), std::move(forConsumerID)),
                unpackingReply<SXError>(std::move(completionHandler)));
}

void SXDaemonProxy::providers(ProvidersReply completionHandler) {
  remote_->send(providersOperation, {}, unpackingReply<SXError, Dictionary>(std::move(completionHandler)));
}

void SXDaemonProxy::extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                             BookmarkReply completionHandler) {
  remote_->send(extendBookmarkOperation, packArguments(std::move(fileURL), std::move(toConsumerID)),
                unpackingReply<std::string, SXError>(std::move(completionHandler)));
}

void SXDaemonProxy::bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) {
  remote_->send(bookmarkableStringOperation, packArguments(std::move(url)),
                unpackingReply<std::string, SXError>(std::move(completion)));
}

void SXDaemonProxy::documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                                      DocumentReply completion) {
  remote_->send(documentURLOperation, packArguments(std::move(bookmarkableString)),
                unpackingReply<URL, Data, URL, Data, SXError>(std::move(completion)));
}

}  // namespace storix
