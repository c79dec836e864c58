#include <optional>
#include <utility>
#include <variant>

#include "sdk/src/ClientImplementation.h"
#include "wire/PlatformInterfaces.h"

namespace storix {

using sdk::Claim;
using sdk::PendingPointer;

void Client::Implementation::resolveBookmark(const std::string &bookmarkableString, Time deadline,
                                             Handler<GrantedDocument> handler) {
  using Answer = Result<GrantedDocument>;
  request<Answer>(std::move(handler), deadline, [&](SXDaemon &daemon, PendingPointer<Answer> pending) {
    daemon.documentURLFromBookmarkableString(
        bookmarkableString,
        [pending = std::move(pending)](std::optional<URL> url, std::optional<Data> token, std::optional<URL> companion,
                                       std::optional<Data> companionToken, std::optional<SXError> error) {
          if (error) return pending->finish(*std::move(error));
          if (!url) return pending->finish(sdk::incompleteAnswer("The provider named no URL for the document."));
          pending->finish(
              GrantedDocument{*std::move(url), std::move(token), std::move(companion), std::move(companionToken)});
        });
  });
}

void Client::Implementation::open(const Data &token, Time deadline, Handler<UniqueFd> handler) {
  wire::MethodValues values;
  values.emplace_back(token);
  callPlatform<Result<UniqueFd>>(wire::sandboxInterface(), wire::consumeMethod, std::move(values), deadline,
                                 std::move(handler), [](wire::MethodValues &answer) -> Result<UniqueFd> {
                                   UniqueFd *descriptor =
                                       answer.empty() ? nullptr : std::get_if<UniqueFd>(&answer.front());
                                   if (!descriptor || !*descriptor) {
                                     return sdk::incompleteAnswer("The answer holds no file descriptor.");
                                   }
                                   return std::move(*descriptor);
                                 });
}

/// A document on its way from its bookmarkable string to a descriptor, one step after the other on the
/// request thread. Whichever step fails ends it, and so do the deadline and a cancellation.
class Client::Implementation::Opening : public std::enable_shared_from_this<Opening> {
 public:
  Opening(std::shared_ptr<Implementation> client, Claim::Kind kind, ClaimOptions options,
          Handler<OpenedDocument> handler)
      : client_(std::move(client)),
        kind_(kind),
        options_(std::move(options)),
        deadline_(options_.deadline ? options_.deadline->time() : client_->deadline()),
        pending_(std::make_shared<sdk::Pending<Result<OpenedDocument>>>(client_->thread().loop(), deadline_,
                                                                        std::move(handler))) {
    options_.deadline = deadline_;
  }

  void start(const std::string &bookmarkableString) {
    pending_->start(options_.cancellation);
    if (pending_->isFinished()) return;
    client_->resolveBookmark(bookmarkableString, deadline_,
                             step<GrantedDocument>([](Opening &self, GrantedDocument document) {
                               self.document_.emplace(std::move(document));
                               self.provide();
                             }));
  }

 private:
  /// The handler of a step's answer.
  template <class Answer>
  Handler<Answer> step(std::function<void(Opening &, Answer)> next) {
    return [self = shared_from_this(), next = std::move(next)](Result<Answer> answer) {
      if (self->pending_->isFinished()) return;
      if (!answer) return self->pending_->finish(answer.error());
      next(*self, std::move(answer.value()));
    };
  }

  /// A claim for reading has the provider put the content there.
  void provide() {
    client_->claims_->begin(Claim::Kind::read, document_->url, options_,
                            step<FileClaim>([](Opening &self, FileClaim claim) {
                              if (self.kind_ == Claim::Kind::read) return self.open(std::move(claim));
                              // It would be in the way of the other one, which comes after its end.
                              claim = FileClaim();
                              self.claimForWriting();
                            }));
  }

  void claimForWriting() {
    client_->claims_->begin(Claim::Kind::write, document_->url, options_,
                            step<FileClaim>([](Opening &self, FileClaim claim) { self.open(std::move(claim)); }));
  }

  void open(FileClaim claim) {
    if (!document_->token) {
      return pending_->finish(sdk::incompleteAnswer("No token was issued for " + document_->url.absoluteString()));
    }
    claim_ = std::move(claim);
    client_->open(*document_->token, deadline_, step<UniqueFd>([](Opening &self, UniqueFd descriptor) {
      FileClaim held = std::move(self.claim_);
      if (self.kind_ == Claim::Kind::read) held = FileClaim();
      self.pending_->finish(OpenedDocument{*std::move(self.document_), std::move(descriptor), std::move(held)});
    }));
  }

  const std::shared_ptr<Implementation> client_;
  const Claim::Kind kind_;
  ClaimOptions options_;
  const Time deadline_;
  const PendingPointer<Result<OpenedDocument>> pending_;
  std::optional<GrantedDocument> document_;
  FileClaim claim_;
};

void Client::Implementation::openDocument(const std::string &bookmarkableString, Claim::Kind kind, ClaimOptions options,
                                          Handler<OpenedDocument> handler) {
  const auto opening = std::make_shared<Opening>(shared_from_this(), kind, std::move(options), std::move(handler));
  // A thread that has ended belongs to a client that is gone, and nobody asks one.
  (void)thread_->post([opening, bookmarkableString] { opening->start(bookmarkableString); });
}

void Client::resolveBookmark(const std::string &bookmarkableString, Handler<GrantedDocument> handler) {
  implementation_->resolveBookmark(bookmarkableString, implementation_->deadline(), std::move(handler));
}

Result<GrantedDocument> Client::resolveBookmark(const std::string &bookmarkableString) {
  return implementation_->thread().wait<Result<GrantedDocument>>(
      [&](Handler<GrantedDocument> handler) { resolveBookmark(bookmarkableString, std::move(handler)); });
}

void Client::open(const Data &token, Handler<UniqueFd> handler) {
  implementation_->open(token, implementation_->deadline(), std::move(handler));
}

Result<UniqueFd> Client::open(const Data &token) {
  return implementation_->thread().wait<Result<UniqueFd>>(
      [&](Handler<UniqueFd> handler) { open(token, std::move(handler)); });
}

Result<UniqueFd> Client::openDocument(const GrantedDocument &document) {
  if (!document.token) return sdk::incompleteAnswer("No token was issued for " + document.url.absoluteString());
  return open(*document.token);
}

Result<UniqueFd> Client::openCompanion(const GrantedDocument &document) {
  if (!document.companionToken) {
    return sdk::incompleteAnswer("No token was issued for the companion of " + document.url.absoluteString());
  }
  return open(*document.companionToken);
}

void Client::openDocument(const std::string &bookmarkableString, ClaimOptions options,
                          Handler<OpenedDocument> handler) {
  implementation_->openDocument(bookmarkableString, Claim::Kind::read, std::move(options), std::move(handler));
}

Result<OpenedDocument> Client::openDocument(const std::string &bookmarkableString, ClaimOptions options) {
  return implementation_->thread().wait<Result<OpenedDocument>>([&](Handler<OpenedDocument> handler) {
    openDocument(bookmarkableString, std::move(options), std::move(handler));
  });
}

void Client::openDocumentForWriting(const std::string &bookmarkableString, ClaimOptions options,
                                    Handler<OpenedDocument> handler) {
  implementation_->openDocument(bookmarkableString, Claim::Kind::write, std::move(options), std::move(handler));
}

Result<OpenedDocument> Client::openDocumentForWriting(const std::string &bookmarkableString, ClaimOptions options) {
  return implementation_->thread().wait<Result<OpenedDocument>>([&](Handler<OpenedDocument> handler) {
    openDocumentForWriting(bookmarkableString, std::move(options), std::move(handler));
  });
}

}  // namespace storix
