#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "access/SXAccessControlStore.h"
#include "platform/Connections.h"
#include "service/SXDaemon.h"

namespace storix {

/// Who gives a servicer the store: the server, as the servicers see it.
class AccessControlSource {
 public:
  virtual ~AccessControlSource() = default;
  /// Null when there is none.
  [[nodiscard]] virtual std::shared_ptr<SXAccessControlStore> accessControlStore() const = 0;
};

/// Answers the requests of one client connection.
///
/// The connection owns it; it holds the connection and the server weakly and keeps no state between
/// requests, which may come on several threads. Without a connection the peer has no entitlement, no
/// identifier and an all-zero audit token; without a server nothing is granted and nothing allowed.
///
/// Replies that the servicer makes itself are submitted to the global queue; those that follow an
/// extension's answer run where the provider object's completion runs, and need no servicer any more.
/// An empty handler is never called, but the work is done all the same.
class SXLinkServicer : public SXDaemon {
 public:
  [[nodiscard]] std::shared_ptr<AccessControlSource> server() const { return server_.lock(); }
  void setServer(const std::shared_ptr<AccessControlSource> &server) { server_ = server; }
  [[nodiscard]] std::shared_ptr<ClientConnection> connection() const { return connection_.lock(); }
  void setConnection(const std::shared_ptr<ClientConnection> &connection) { connection_ = connection; }

  // The client checks (SXLinkServicer.cc)

  /// Whether the client holds one of these with a true number or boolean as its value; says in the
  /// log when not.
  [[nodiscard]] bool clientHasOneOfAllowedEntitlements(const std::vector<std::string> &names) const;
  /// Whether the client itself may write the file.
  [[nodiscard]] bool clientHasSandboxAccessToFile(const std::optional<URL> &url) const;

  void wakeUp(CompletionHandler<> completion) override;

  // Handing out access (SandboxRequests.cc)

  void extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                               std::optional<std::string> toConsumerID, SandboxReply completionHandler) override;
  void extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                BookmarkReply completionHandler) override;

  // Asking the provider to act (ItemRequests.cc)

  void providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                      std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                               std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;
  void stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                              std::optional<std::string> forConsumerID, ErrorReply completionHandler) override;

  // The list, and bookmarkable strings (BookmarkRequests.cc)

  void providers(ProvidersReply completionHandler) override;
  void bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) override;
  /// Stays unanswered when the string names a provider that is not there.
  void documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                         DocumentReply completion) override;

 private:
  [[nodiscard]] AuditToken peerAuditToken() const;
  [[nodiscard]] std::optional<std::string> callerBundleIdentifier() const;

  std::weak_ptr<AccessControlSource> server_;
  std::weak_ptr<ClientConnection> connection_;
};

}  // namespace storix
