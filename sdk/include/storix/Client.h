#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/SXError.h"
#include "platform/URL.h"
#include "platform/Value.h"
#include "storix/ClientOptions.h"
#include "storix/FileClaim.h"
#include "wire/UniqueFd.h"

namespace storix {

struct ProviderDescription {
  std::string identifier;
  /// Where the provider's documents appear. Absent for a provider that has no such directory.
  std::optional<URL> documentStorageURL;
};

/// A document that was granted, with the tokens that open it and its companion: the hidden file beside
/// it, "." before the name. A token that could not be issued is absent.
struct GrantedDocument {
  URL url;
  std::optional<Data> token;
  std::optional<URL> companionURL;
  std::optional<Data> companionToken;
};

/// A document that was opened from its bookmarkable string.
struct OpenedDocument {
  GrantedDocument document;
  /// Open for reading and writing.
  UniqueFd descriptor;
  /// Held when it was opened for writing: end it when all is written, so that the provider hears of
  /// the change. Nothing when it was opened for reading.
  FileClaim claim;
};

/// An application's side of the document broker. Make one and keep it: it connects when the first
/// request is made, again when the connection was lost, and stays connected.
///
/// Thread-safe. Each request has two forms. The one with a handler returns at once; the handler runs
/// exactly once, on the client's own thread, never inside the call, and must neither wait for long nor
/// throw. The other waits for the answer; on the client's own thread, that is in a handler, it gives
/// the error EDEADLK. Errors: those that the daemon answers, and those of `clientErrorDomain`. When
/// the client is destroyed, requests without an answer get `connectionLost` before that returns (or,
/// where a handler destroys it, soon after).
///
/// "Needs read" and "needs write" below mean the entitlements "com.tessel.storix.acl-read" (write will
/// do as well) and "com.tessel.storix.acl-write"; without it the error is `clientLacksEntitlement`.
class Client {
 public:
  /// Absent on success.
  using Outcome = std::optional<SXError>;
  using OutcomeHandler = std::function<void(Outcome)>;
  template <class T>
  using Handler = std::function<void(Result<T>)>;

  explicit Client(ClientOptions options = {});
  ~Client();
  Client(const Client &) = delete;
  Client &operator=(const Client &) = delete;

  // --- The nine requests

  /// Starts the daemon where it is started on demand. Needs nothing.
  void wakeUp(OutcomeHandler handler);
  [[nodiscard]] Outcome wakeUp();

  /// Grants the consumer the document and has tokens issued for it. Needs write. The document need not
  /// be there yet. Errors: `notFound` (no such provider), `pluginOperationFailed` (the provider does
  /// not know the document).
  void extendSandbox(const URL &document, const std::string &providerID, const std::string &consumerID,
                     Handler<GrantedDocument> handler);
  [[nodiscard]] Result<GrantedDocument> extendSandbox(const URL &document, const std::string &providerID,
                                                      const std::string &consumerID);

  /// Has the provider make the document's placeholder. Needs read, and the consumer must have been
  /// granted the document (`notPermitted`). Other errors: `notFound`, `pluginOperationFailed`.
  void providePlaceholder(const URL &document, const std::string &providerID, const std::string &consumerID,
                          OutcomeHandler handler);
  [[nodiscard]] Outcome providePlaceholder(const URL &document, const std::string &providerID,
                                           const std::string &consumerID);

  /// Has the provider put the document's content at its URL; succeeds when it is there. Needs read and
  /// the grant. Errors as above, and `invalidParameter` when another provider owns the URL.
  void startProviding(const URL &document, const std::string &providerID, const std::string &consumerID,
                      OutcomeHandler handler);
  [[nodiscard]] Outcome startProviding(const URL &document, const std::string &providerID,
                                       const std::string &consumerID);

  /// Tells the provider that the document's content is not needed any more. Needs read, no grant.
  /// The daemon answers a `pluginOperationFailed` in any case; the one without an underlying error is
  /// its word for success, and only that one is reported as success here.
  void stopProviding(const URL &document, const std::string &providerID, const std::string &consumerID,
                     OutcomeHandler handler);
  [[nodiscard]] Outcome stopProviding(const URL &document, const std::string &providerID,
                                      const std::string &consumerID);

  /// The installed providers, in the order of their identifiers. Needs read.
  void providers(Handler<std::vector<ProviderDescription>> handler);
  [[nodiscard]] Result<std::vector<ProviderDescription>> providers();

  /// Grants the consumer a document that this process may write, and gives the bookmarkable string
  /// that the consumer passes to `resolveBookmark`. Opens the document for writing, where it can, to
  /// prove to the daemon that it may. Errors: `notPermitted` (it may not, or has no bundle
  /// identifier), `notFoundURL` (no provider owns the URL), `pluginOperationFailed`.
  void extendBookmark(const URL &document, const std::string &consumerID, Handler<std::string> handler);
  [[nodiscard]] Result<std::string> extendBookmark(const URL &document, const std::string &consumerID);

  /// The string that names the document wherever it lies. Absent when no provider owns the URL. Needs
  /// and grants nothing.
  void bookmarkableString(const URL &document, Handler<std::optional<std::string>> handler);
  [[nodiscard]] Result<std::optional<std::string>> bookmarkableString(const URL &document);

  /// The document that a bookmarkable string names, when it has been granted to this process (else
  /// `notPermitted`). Other errors: `invalidBookmarkableString`, `sandboxExtensionFailed` (the
  /// provider does not know it any more). When the provider is not installed the daemon never
  /// answers: `timedOut`.
  void resolveBookmark(const std::string &bookmarkableString, Handler<GrantedDocument> handler);
  [[nodiscard]] Result<GrantedDocument> resolveBookmark(const std::string &bookmarkableString);

  // --- Opening what was granted

  /// Opens what the token stands for, for reading and writing, past this process's own sandbox. The
  /// companion of a document is made when it is missing. Errors: `refused` with the name
  /// "com.tessel.Platform.Error.InvalidToken", ".NotAFile" (a directory, for instance) or
  /// ".Unavailable" (a document that is not there yet, for instance).
  void open(const Data &token, Handler<UniqueFd> handler);
  [[nodiscard]] Result<UniqueFd> open(const Data &token);

  /// As `open` for the document's token, or its companion's; `incompleteAnswer` where there is none.
  [[nodiscard]] Result<UniqueFd> openDocument(const GrantedDocument &document);
  [[nodiscard]] Result<UniqueFd> openCompanion(const GrantedDocument &document);

  /// Opens the document that a bookmarkable string names, in one call: resolves it, claims the file for
  /// reading, so that its provider puts the content there, opens it, and ends the claim. Whoever writes
  /// it in place later changes it under the descriptor; one who replaces it does not. The deadline is
  /// for all of it; without one: the timeout of the client's options. Errors: those of
  /// `resolveBookmark`, of `FileCoordinator`, and of `open`.
  void openDocument(const std::string &bookmarkableString, ClaimOptions options, Handler<OpenedDocument> handler);
  [[nodiscard]] Result<OpenedDocument> openDocument(const std::string &bookmarkableString, ClaimOptions options = {});

  /// As `openDocument`, and then claims the file for writing before it is opened: nobody else who
  /// coordinates reads or writes it until the claim in the answer ends.
  void openDocumentForWriting(const std::string &bookmarkableString, ClaimOptions options,
                              Handler<OpenedDocument> handler);
  [[nodiscard]] Result<OpenedDocument> openDocumentForWriting(const std::string &bookmarkableString,
                                                              ClaimOptions options = {});

  /// Shows the daemon a descriptor that is open for writing, so that it knows that this process may
  /// write that file; it counts as long as this client is connected. The descriptor stays the
  /// caller's. Error: `refused`, "com.tessel.Platform.Error.NoProof".
  void proveWriteAccess(int descriptor, OutcomeHandler handler);
  [[nodiscard]] Outcome proveWriteAccess(int descriptor);

  // --- System notifications

  /// Posts a system-wide notification. Confined processes are `refused`.
  void postNotification(const std::string &name, OutcomeHandler handler);
  [[nodiscard]] Outcome postNotification(const std::string &name);

 private:
  class Implementation;
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace storix
