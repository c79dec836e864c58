#include "storix/Client.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <utility>

#include "sdk/src/BusLoop.h"
#include "sdk/src/ClientErrors.h"
#include "sdk/src/ServiceSocket.h"
#include "service/SXDaemon.h"
#include "wire/PlatformInterfaces.h"

namespace storix {

namespace {

using sdk::BusLoop;
using sdk::clientError;
using sdk::clientErrorOf;

using Deadline = BusLoop::Clock::time_point;

/// One request on its way: whatever comes first, answer, failure or deadline, reaches the handler, and
/// nothing after it. Used on the loop's thread, but for `start`.
template <class Answer>
class Pending : public std::enable_shared_from_this<Pending<Answer>> {
 public:
  Pending(BusLoop &loop, Deadline deadline, std::function<void(Answer)> handler)
      : loop_(loop), deadline_(deadline), handler_(std::move(handler)) {}

  void start() {
    loop_.at(deadline_, this, [self = this->shared_from_this()] {
      self->finish(clientError(ClientErrorCode::timedOut, "The document broker did not answer in time."));
    });
  }

  void finish(Answer answer) {
    if (finished_) return;
    finished_ = true;
    loop_.cancel(deadline_, this);
    if (const auto handler = std::exchange(handler_, nullptr)) handler(std::move(answer));
  }

 private:
  BusLoop &loop_;
  const Deadline deadline_;
  std::function<void(Answer)> handler_;
  bool finished_ = false;
};

template <class Answer>
using PendingPointer = std::shared_ptr<Pending<Answer>>;

SXError incomplete(std::string sentence) { return clientError(ClientErrorCode::incompleteAnswer, std::move(sentence)); }

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

class Client::Implementation : public std::enable_shared_from_this<Client::Implementation> {
 public:
  explicit Implementation(ClientOptions options)
      : options_(std::move(options)),
        daemon_(loop_, "com.tessel.Storix", BusLoop::Descriptors::refused),
        platform_(loop_, "com.tessel.Platform", BusLoop::Descriptors::passed) {}

  void start() {
    thread_ = std::thread([self = shared_from_this()] { self->loop_.run(); });
  }

  void end() {
    loop_.stop();
    if (isOwnThread()) {
      thread_.detach();
    } else {
      thread_.join();
    }
  }

  [[nodiscard]] bool isOwnThread() const { return loop_.isCurrentThread(); }

  [[nodiscard]] Deadline deadline() const { return BusLoop::Clock::now() + options_.timeout; }

  /// Sends one request of the daemon's protocol. `send` gives the proxy's operation a handler that
  /// finishes the pending request.
  template <class Answer>
  void request(std::function<void(Answer)> handler, Deadline deadline,
               const std::function<void(SXDaemon &, PendingPointer<Answer>)> &send) {
    const auto pending = begin(std::move(handler), deadline);
    auto connection = daemon_.connection(options_.runtimeDirectory);
    if (!connection) return failLater(pending, connection.error());
    SXDaemonProxy proxy(
        connection.value()->remoteObject(LinkInterface(SXDaemonProtocol().description()),
                                         [pending](const SXError &error) { pending->finish(clientErrorOf(error)); }));
    send(proxy, pending);
  }

  /// The same for an operation that answers an error alone.
  void requestOutcome(OutcomeHandler handler, const std::function<void(SXDaemon &, SXDaemon::ErrorReply)> &send) {
    request<Outcome>(std::move(handler), deadline(), [&send](SXDaemon &daemon, PendingPointer<Outcome> pending) {
      send(daemon, [pending = std::move(pending)](Outcome error) { pending->finish(std::move(error)); });
    });
  }

  /// Calls a method of the platform socket. `convert` makes the answer of the values that came back.
  template <class Answer>
  void callPlatform(const wire::InterfaceDescription &interface, std::size_t method, wire::MethodValues values,
                    Deadline deadline, std::function<void(Answer)> handler,
                    std::function<Answer(wire::MethodValues &)> convert) {
    const auto pending = begin(std::move(handler), deadline);
    auto connection = platform_.connection(options_.runtimeDirectory);
    if (!connection) return failLater(pending, connection.error());
    connection.value()->call(interface, method, std::move(values),
                             [pending, convert = std::move(convert)](wire::MethodResult result) {
                               if (const auto *failure = std::get_if<wire::MethodFailure>(&result)) {
                                 pending->finish(clientErrorOf(*failure));
                               } else {
                                 pending->finish(convert(std::get<wire::MethodValues>(result)));
                               }
                             });
  }

  void proveWriteAccess(UniqueFd descriptor, Deadline deadline, OutcomeHandler handler) {
    wire::MethodValues values;
    values.emplace_back(std::move(descriptor));
    callPlatform<Outcome>(wire::sandboxInterface(), wire::proveWriteAccessMethod, std::move(values), deadline,
                          std::move(handler), [](wire::MethodValues &) { return Outcome(); });
  }

  void extendBookmark(const URL &document, const std::string &consumerID, Deadline deadline,
                      Handler<std::string> handler) {
    request<Result<std::string>>(
        std::move(handler), deadline, [&](SXDaemon &daemon, PendingPointer<Result<std::string>> pending) {
          daemon.extendBookmarkForFileURL(
              document, consumerID,
              [pending = std::move(pending)](std::optional<std::string> string, std::optional<SXError> error) {
                if (error) return pending->finish(*std::move(error));
                if (!string) return pending->finish(incomplete("The answer holds no bookmarkable string."));
                pending->finish(*std::move(string));
              });
        });
  }

  template <class Answer>
  void failLater(const PendingPointer<Answer> &pending, SXError error) {
    loop_.later([pending, error = std::move(error)] { pending->finish(error); });
  }

  template <class Answer>
  PendingPointer<Answer> begin(std::function<void(Answer)> handler, Deadline deadline) {
    auto pending = std::make_shared<Pending<Answer>>(loop_, deadline, std::move(handler));
    pending->start();
    return pending;
  }

  /// Waits for the answer that `send`'s handler gets.
  template <class Answer>
  Answer wait(const std::function<void(std::function<void(Answer)>)> &send) {
    if (isOwnThread()) {
      return posixError(EDEADLK, "waiting for an answer on the thread that would bring it");
    }
    struct Waiting {
      std::mutex mutex;
      std::condition_variable answered;
      std::optional<Answer> answer;
    };
    const auto waiting = std::make_shared<Waiting>();
    send([waiting](Answer answer) {
      const std::lock_guard lock(waiting->mutex);
      waiting->answer.emplace(std::move(answer));
      waiting->answered.notify_one();
    });
    std::unique_lock lock(waiting->mutex);
    waiting->answered.wait(lock, [&waiting] { return waiting->answer.has_value(); });
    return *std::move(waiting->answer);
  }

 private:
  const ClientOptions options_;
  BusLoop loop_;
  sdk::ServiceSocket daemon_;
  sdk::ServiceSocket platform_;
  std::thread thread_;
};

Client::Client(ClientOptions options) : implementation_(std::make_shared<Implementation>(std::move(options))) {
  implementation_->start();
}

Client::~Client() { implementation_->end(); }

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
              if (!records) return pending->finish(incomplete("The answer holds no list of providers."));
              pending->finish(providerDescriptions(*records));
            });
      });
}

void Client::extendBookmark(const URL &document, const std::string &consumerID, Handler<std::string> handler) {
  const Deadline deadline = implementation_->deadline();
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

void Client::resolveBookmark(const std::string &bookmarkableString, Handler<GrantedDocument> handler) {
  using Answer = Result<GrantedDocument>;
  implementation_->request<Answer>(
      std::move(handler), implementation_->deadline(), [&](SXDaemon &daemon, PendingPointer<Answer> pending) {
        daemon.documentURLFromBookmarkableString(
            bookmarkableString, [pending = std::move(pending)](
                                    std::optional<URL> url, std::optional<Data> token, std::optional<URL> companion,
                                    std::optional<Data> companionToken, std::optional<SXError> error) {
              if (error) return pending->finish(*std::move(error));
              if (!url) return pending->finish(incomplete("The provider named no URL for the document."));
              pending->finish(
                  GrantedDocument{*std::move(url), std::move(token), std::move(companion), std::move(companionToken)});
            });
      });
}

void Client::open(const Data &token, Handler<UniqueFd> handler) {
  wire::MethodValues values;
  values.emplace_back(token);
  implementation_->callPlatform<Result<UniqueFd>>(
      wire::sandboxInterface(), wire::consumeMethod, std::move(values), implementation_->deadline(), std::move(handler),
      [](wire::MethodValues &answer) -> Result<UniqueFd> {
        UniqueFd *descriptor = answer.empty() ? nullptr : std::get_if<UniqueFd>(&answer.front());
        if (!descriptor || !*descriptor) return incomplete("The answer holds no file descriptor.");
        return std::move(*descriptor);
      });
}

void Client::proveWriteAccess(int descriptor, OutcomeHandler handler) {
  UniqueFd copy(::fcntl(descriptor, F_DUPFD_CLOEXEC, 0));
  if (!copy) {
    const SXError error = posixError(errno, "copying a file descriptor");
    return implementation_->failLater(implementation_->begin(std::move(handler), implementation_->deadline()), error);
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
  return implementation_->wait<Outcome>([&](OutcomeHandler handler) { wakeUp(std::move(handler)); });
}

Result<GrantedDocument> Client::extendSandbox(const URL &document, const std::string &providerID,
                                              const std::string &consumerID) {
  return implementation_->wait<Result<GrantedDocument>>(
      [&](Handler<GrantedDocument> handler) { extendSandbox(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::providePlaceholder(const URL &document, const std::string &providerID,
                                           const std::string &consumerID) {
  return implementation_->wait<Outcome>(
      [&](OutcomeHandler handler) { providePlaceholder(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::startProviding(const URL &document, const std::string &providerID,
                                       const std::string &consumerID) {
  return implementation_->wait<Outcome>(
      [&](OutcomeHandler handler) { startProviding(document, providerID, consumerID, std::move(handler)); });
}

Client::Outcome Client::stopProviding(const URL &document, const std::string &providerID,
                                      const std::string &consumerID) {
  return implementation_->wait<Outcome>(
      [&](OutcomeHandler handler) { stopProviding(document, providerID, consumerID, std::move(handler)); });
}

Result<std::vector<ProviderDescription>> Client::providers() {
  return implementation_->wait<Result<std::vector<ProviderDescription>>>(
      [&](Handler<std::vector<ProviderDescription>> handler) { providers(std::move(handler)); });
}

Result<std::string> Client::extendBookmark(const URL &document, const std::string &consumerID) {
  return implementation_->wait<Result<std::string>>(
      [&](Handler<std::string> handler) { extendBookmark(document, consumerID, std::move(handler)); });
}

Result<std::optional<std::string>> Client::bookmarkableString(const URL &document) {
  return implementation_->wait<Result<std::optional<std::string>>>(
      [&](Handler<std::optional<std::string>> handler) { bookmarkableString(document, std::move(handler)); });
}

Result<GrantedDocument> Client::resolveBookmark(const std::string &bookmarkableString) {
  return implementation_->wait<Result<GrantedDocument>>(
      [&](Handler<GrantedDocument> handler) { resolveBookmark(bookmarkableString, std::move(handler)); });
}

Result<UniqueFd> Client::open(const Data &token) {
  return implementation_->wait<Result<UniqueFd>>([&](Handler<UniqueFd> handler) { open(token, std::move(handler)); });
}

Result<UniqueFd> Client::openDocument(const GrantedDocument &document) {
  if (!document.token) return incomplete("No token was issued for " + document.url.absoluteString());
  return open(*document.token);
}

Result<UniqueFd> Client::openCompanion(const GrantedDocument &document) {
  if (!document.companionToken) {
    return incomplete("No token was issued for the companion of " + document.url.absoluteString());
  }
  return open(*document.companionToken);
}

Client::Outcome Client::proveWriteAccess(int descriptor) {
  return implementation_->wait<Outcome>(
      [&](OutcomeHandler handler) { proveWriteAccess(descriptor, std::move(handler)); });
}

Client::Outcome Client::postNotification(const std::string &name) {
  return implementation_->wait<Outcome>([&](OutcomeHandler handler) { postNotification(name, std::move(handler)); });
}

}  // namespace storix
