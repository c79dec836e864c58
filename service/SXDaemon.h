#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/ProtocolTable.h"

namespace storix {

/// The request protocol that clients speak to the daemon over the service "com.tessel.Storix". Every
/// operation answers at most once through its handler, on whatever thread has the answer; arguments
/// and reply values may be absent. Replies of the operations from `extendBookmarkForFileURL` on carry
/// the error last, those before it carry it first.
class SXDaemon {
 public:
  static constexpr std::string_view wakeUpName = "wakeUpCompletion:";
  static constexpr std::string_view extendSandboxName =
      "extendSandboxForFileURL:fromProviderID:toConsumerID:completionHandler:";
  static constexpr std::string_view providePlaceholderName =
      "providePlaceholderForItemAtURL:fromProviderID:forConsumerID:completionHandler:";
  static constexpr std::string_view startProvidingName =
      "startProvidingItemAtURL:fromProviderID:forConsumerID:completionHandler:";
  static constexpr std::string_view stopProvidingName =
      "stopProvidingItemAtURL:fromProviderID:forConsumerID:completionHandler:";
  static constexpr std::string_view providersName = "providersCompletionHandler:";
  static constexpr std::string_view extendBookmarkName = "extendBookmarkForFileURL:toConsumerID:completionHandler:";
  static constexpr std::string_view bookmarkableStringName = "bookmarkableStringFromDocumentURL:completion:";
  static constexpr std::string_view documentURLName = "documentURLFromBookmarkableString:completion:";

  /// error
  using ErrorReply = CompletionHandler<SXError>;
  /// error, token data for the URL, companion URL, token data for the companion URL
  using SandboxReply = CompletionHandler<SXError, Data, URL, Data>;
  /// error, provider identifier -> provider record
  using ProvidersReply = CompletionHandler<SXError, Dictionary>;
  /// bookmarkable string, error
  using BookmarkReply = CompletionHandler<std::string, SXError>;
  /// URL, token data for it, companion URL, token data for the companion URL, error
  using DocumentReply = CompletionHandler<URL, Data, URL, Data, SXError>;

  virtual ~SXDaemon() = default;

  virtual void wakeUp(CompletionHandler<> completion) = 0;
  virtual void extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                                       std::optional<std::string> toConsumerID, SandboxReply completionHandler) = 0;
  virtual void providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                              std::optional<std::string> forConsumerID,
                                              ErrorReply completionHandler) = 0;
  virtual void startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                       std::optional<std::string> forConsumerID, ErrorReply completionHandler) = 0;
  virtual void stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                      std::optional<std::string> forConsumerID, ErrorReply completionHandler) = 0;
  virtual void providers(ProvidersReply completionHandler) = 0;
  virtual void extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                        BookmarkReply completionHandler) = 0;
  virtual void bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) = 0;
  virtual void documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                                 DocumentReply completion) = 0;
};

const ProtocolTable<SXDaemon> &SXDaemonProtocol();

/// An `SXDaemon` that sends every operation to the object at the other end of a connection.
class SXDaemonProxy : public SXDaemon {
 public:
  explicit SXDaemonProxy(std::shared_ptr<RemoteObject> remote) : remote_(std::move(remote)) {}

  void wakeUp(CompletionHandler<> completion) override;
  void extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                               std::optional<std::string> toConsumerID, SandboxReply completionHandler) override;
  void providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                      std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                               std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                              std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void providers(ProvidersReply completionHandler) override;
  void extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                BookmarkReply completionHandler) override;
  void bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) override;
  void documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                         DocumentReply completion) override;

 private:
  std::shared_ptr<RemoteObject> remote_;
};

}  // namespace storix
