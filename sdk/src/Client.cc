#include "storix/Client.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <utility>

#include "sdk/src/ClientImplementation.h"
#include "wire/PlatformInterfaces.h"

namespace storix {

namespace {

using sdk::PendingPointer;

/// Whether the answer to a stop request, which is always an error value, means success.
bool saysStopped(const SXError &error) {
  return error.domain() == storixErrorDomain &&
         error.code() == static_cast<std::int64_t>(SXErrorCode::pluginOperationFailed) &&
         !error.details().contains("underlyingError");
}

/// A descriptor of a regular file that is open for writing, or none: nothing is asked of whoever may
/// not write.
UniqueFd openForProof(const URL &document) {
  UniqueFd file(::open(document.path().c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return UniqueFd();
  return file;
}

std::vector<ProviderDescription> providerDescriptions(const Dictionary &records) {
  std::vector<ProviderDescription> providers;
  providers.reserve(records.size());
  for (const auto &[identifier, record] : records) {
    ProviderDescription provider{identifier, std::nullopt};
    if (const Dictionary *fields = record.dictionary()) {
      if (const auto found = fields->find("documentStorageURL"); found != fields->end() && found->second.url()) {
        provider.documentStorageURL = *found->second.url();
      }
    }
    providers.push_back(std::move(provider));
  }
  return providers;
}

}  // namespace

void Client::Implementation::proveWriteAccess(UniqueFd descriptor, Time deadline, OutcomeHandler handler) {
  wire::MethodValues values;
  values.emplace_back(std::move(descriptor));
  callPlatform<Outcome>(wire::sandboxInterface(), wire::proveWriteAccessMethod, std::move(values), deadline,
                        std::move(handler), [](wire::MethodValues &) { return Outcome(); });
}

void Client::Implementation::extendBookmark(const URL &document, const std::string &consumerID, Time deadline,
                                            Handler<std::string> handler) {
  request<Result<std::string>>(
      std::move(handler), deadline, [&](SXDaemon &daemon, PendingPointer<Result<std::string>> pending) {
        daemon.extendBookmarkForFileURL(
            document, consumerID,
            [pending = std::move(pending)](std::optional<std::string> string, std::optional<SXError> error) {
              if (error) return pending->finish(*std::move(error));
              if (!string) return pending->finish(sdk::incompleteAnswer("The answer holds no bookmarkable string."));
              pending->finish(*std::move(string));
            });
      });
}

Client::Client(ClientOptions options) : implementation_(std::make_shared<Implementation>(std::move(options))) {}

Client::~Client() { implementation_->thread().end(); }

void Client::wakeUp(OutcomeHandler handler) {
  implementation_->request<Outcome>(std::move(handler), implementation_->deadline(),
                                    [](SXDaemon &daemon, PendingPointer<Outcome> pending) {
                                      daemon.wakeUp([pending = std::move(pending)] { pending->finish(std::nullopt); });
                                    });
}

void Client::extendSandbox(const URL &document, const std::string &providerID, const std::string &consumerID,
                           Handler<GrantedDocument> handler) {
  using Answer = Result<GrantedDocument>;
  implementation_->request<
      Answer>(std::move(handler), implementation_->deadline(), [&](SXDaemon &daemon, PendingPointer<Answer> pending) {
    daemon.extendSandboxForFileURL(
        document, providerID, consumerID,
        [pending = std::move(pending), document](std::optional<SXError> error, std::optional<Data> token,
                                                 std::optional<URL> companion, std::optional<Data> companionToken) {
          if (error) return pending->finish(*std::move(error));
          pending->finish(GrantedDocument{document, std::move(token), std::move(companion), std::move(companionToken)});
        });
  });
}

void Client::providePlaceholder(const URL &document, const std::string &providerID, const std::string &consumerID,
                                OutcomeHandler handler) {
  implementation_->requestOutcome(std::move(handler), [&](SXDaemon &daemon, SXDaemon::ErrorReply reply) {
    daemon.providePlaceholderForItemAtURL(document, providerID, consumerID, std::move(reply));
  });
}

void Client::startProviding(const URL &document, const std::string &providerID, const std::string &consumerID,
                            OutcomeHandler handler) {
  implementation_->requestOutcome(std::move(handler), [&](SXDaemon &daemon, SXDaemon::ErrorReply reply) {
    daemon.startProvidingItemAtURL(document, providerID, consumerID, std::move(reply));
  });
}

void Client::stopProviding(const URL &document, const std::string &providerID, const std::string &consumerID,
                           OutcomeHandler handler) {
  implementation_->requestOutcome(std::move(handler), [&](SXDaemon &daemon, const SXDaemon::ErrorReply &reply) {
    daemon.stopProvidingItemAtURL(document, providerID, consumerID, [reply](std::optional<SXError> error) {
      if (error && saysStopped(*error)) error.reset();
      reply(std::move(error));
    });
  });
}

void Client::providers(Handler<std::vector<ProviderDescription>> handler) {
  using Answer = Result<std::vector<ProviderDescription>>;
  implementation_->request<Answer>(
      std::move(handler), implementation_->deadline(), [](SXDaemon &daemon, PendingPointer<Answer> pending) {
        daemon.providers(
            [pending = std::move(pending)](std::optional<SXError> error, std::optional<Dictionary> records) {
              if (error) return pending->finish(*std::move(error));
              if (!records) return pending->finish(sdk::incompleteAnswer("The answer holds no list of providers."));
              pending->finish(providerDescriptions(*records));
            });
      });
}

void Client::extendBookmark(const URL &document, const std::string &consumerID, Handler<std::string> handler) {
  const auto deadline = implementation_->deadline();
  UniqueFd proof = openForProof(document);
  if (!proof) return implementation_->extendBookmark(document, consumerID, deadline, std::move(handler));
  // Whatever the proof was worth, the daemon decides.
  implementation_->proveWriteAccess(std::move(proof), deadline,
                                    [weak = std::weak_ptr(implementation_), document, consumerID, deadline,
                                     handler = std::move(handler)](const Outcome &) {
                                      if (const auto implementation = weak.lock()) {
                                        implementation->extendBookmark(document, consumerID, deadline, handler);
                                      }
                                    });
}

void Client::bookmarkableString(const URL &document, Handler<std::optional<std::string>> handler) {
  using Answer = Result<std::optional<std::string>>;
  implementation_->request<Answer>(
      std::move(handler), implementation_->deadline(), [&](SXDaemon &daemon, PendingPointer<Answer> pending) {
        daemon.bookmarkableStringFromDocumentURL(
            document, [pending = std::move(pending)](std::optional<std::string> string, std::optional<SXError> error) {
              if (error) return pending->finish(*std::move(error));
              pending->finish(std::move(string));
            });
      });
}

void Client::proveWriteAccess(int descriptor, OutcomeHandler handler) {
  UniqueFd copy(::fcntl(descriptor, F_DUPFD_CLOEXEC, 0));
  if (!copy) {
    const SXError error = posixError(errno, "copying a file descriptor");
    sdk::RequestThread &thread = implementation_->thread();
    return thread.failLater(thread.begin(std::move(handler), implementation_->deadline()), error);
  }
  implementation_->proveWriteAccess(std::move(copy), implementation_->deadline(), std::move(handler));
}

void Client::postNotification(const std::string &name, OutcomeHandler handler) {
  wire::MethodValues values;
  values.emplace_back(name);
  implementation_->callPlatform<Outcome>(wire::notificationsInterface(), wire::postMethod, std::move(values),
                                         implementation_->deadline(), std::move(handler),
                                         [](wire::MethodValues &) { return Outcome(); });
}

// --- The forms that wait

Client::Outcome Client::wakeUp() {
  return implementation_->thread().wait<Outcome>([&](OutcomeHandler handler) { wakeUp(std::move(handler)); });
}

Result<GrantedDocument> Client::extendSandbox(const URL &document, const std::string &providerID,
                                              const std::string &consumerID) {
  return implementation_->thread().wait<Result<GrantedDocument>>(
      [&](Handler<GrantedDocument> handler) { extendSandbox(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::providePlaceholder(const URL &document, const std::string &providerID,
                                           const std::string &consumerID) {
  return implementation_->thread().wait<Outcome>(
      [&](OutcomeHandler handler) { providePlaceholder(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::startProviding(const URL &document, const std::string &providerID,
                                       const std::string &consumerID) {
  return implementation_->thread().wait<Outcome>(
      [&](OutcomeHandler handler) { startProviding(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::stopProviding(const URL &document, const std::string &providerID,
                                      const std::string &consumerID) {
  return implementation_->thread().wait<Outcome>(
      [&](OutcomeHandler handler) { stopProviding(document, providerID, consumerID, std::move(handler)); });
}

Result<std::vector<ProviderDescription>> Client::providers() {
  return implementation_->thread().wait<Result<std::vector<ProviderDescription>>>(
      [&](Handler<std::vector<ProviderDescription>> handler) { providers(std::move(handler)); });
}

Result<std::string> Client::extendBookmark(const URL &document, const std::string &consumerID) {
  return implementation_->thread().wait<Result<std::string>>(
      [&](Handler<std::string> handler) { extendBookmark(document, consumerID, std::move(handler)); });
}

Result<std::optional<std::string>> Client::bookmarkableString(const URL &document) {
  return implementation_->thread().wait<Result<std::optional<std::string>>>(
      [&](Handler<std::optional<std::string>> handler) { bookmarkableString(document, std::move(handler)); });
}

Client::Outcome Client::proveWriteAccess(int descriptor) {
  return implementation_->thread().wait<Outcome>(
      [&](OutcomeHandler handler) { proveWriteAccess(descriptor, std::move(handler)); });
}

Client::Outcome Client::postNotification(const std::string &name) {
  return implementation_->thread().wait<Outcome>(
      [&](OutcomeHandler handler) { postNotification(name, std::move(handler)); });
}

}  // namespace storix
