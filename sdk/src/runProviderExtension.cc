#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <stop_token>
#include <string_view>
#include <utility>

#include "platform/ThreadPool.h"
#include "providers/_KTStorixVendor.h"
#include "sdk/src/BusLoop.h"
#include "storix/ProviderExtension.h"

namespace storix {

namespace {

/// Calls of the extension that may be at work at the same time, of each of the two kinds.
constexpr std::size_t concurrentCalls = 8;

/// The daemon itself bounds what it asks. Calls that wait for a thread must not keep others, which have
/// one, from being read.
constexpr std::size_t unansweredCallsAtMost = std::size_t{1} << 20;

/// Threads for calls that move content and may take long, and for those that are answered at once.
struct CallThreads {
  ThreadPool transfers{concurrentCalls};
  ThreadPool lookups{concurrentCalls};
};

/// What becomes of calls that have not begun when the daemon goes away.
enum class WithoutDaemon { dropped, carriedOut };

/// A completion handler whose first call sends the answer. When nobody can call it any more, the
/// answer is an error.
template <class Answer>
std::function<void(Answer)> answeringOnce(std::function<void(Answer)> send) {
  struct Once {
    explicit Once(std::function<void(Answer)> sendAnswer) : send(std::move(sendAnswer)) {}
    ~Once() {
      if (!answered.exchange(true)) send(posixError(ECANCELED, "waiting for the provider, which gave no answer"));
    }
    Once(const Once &) = delete;
    Once &operator=(const Once &) = delete;

    std::function<void(Answer)> send;
    std::atomic<bool> answered{false};
  };
  return [once = std::make_shared<Once>(std::move(send))](Answer answer) {
    if (!once->answered.exchange(true)) once->send(std::move(answer));
  };
}

/// The handler, or one that does nothing where nobody waits.
template <class... Replies>
CompletionHandler<Replies...> orNobody(CompletionHandler<Replies...> completion) {
  if (completion) return completion;
  return [](std::optional<Replies>...) {};
}

SXError nothingGiven(std::string_view what) { return posixError(EINVAL, "looking for the " + std::string(what)); }

SXError emptyIdentifier() {
  return posixError(EINVAL, "identifying the document: the provider gave an empty identifier");
}

/// What the daemon calls: hands every operation to the extension, on a thread of the pool.
class ExportedExtension : public _KTStorixVendor {
 public:
  using Outcome = std::optional<SXError>;

  ExportedExtension(std::shared_ptr<ProviderExtension> extension, std::stop_token cancellation, CallThreads &threads)
      : extension_(std::move(extension)), cancellation_(std::move(cancellation)), threads_(threads) {}

  void _performInitialSetupWithCompletion(CompletionHandler<std::string, URL, SXError> completion) override {
    work<Outcome>(
        threads_.lookups,
        [completion = orNobody(std::move(completion))](Outcome error) {
          completion(std::nullopt, std::nullopt, std::move(error));
        },
        [](ProviderExtension &extension, ProviderExtension::Completion answer) {
          extension.performInitialSetup(std::move(answer));
        });
  }

  void _providePlaceholderAtURL(std::optional<URL> url, CompletionHandler<URL, SXError> completion) override {
    auto answer = [completion = orNobody(std::move(completion))](Result<URL> placeholder) {
      if (placeholder) return completion(std::move(placeholder.value()), std::nullopt);
      completion(std::nullopt, placeholder.error());
    };
    if (!url) return answer(nothingGiven("URL of the document"));
    work<Result<URL>>(
        threads_.lookups, answer,
        [url = *std::move(url)](ProviderExtension &extension, ProviderExtension::URLCompletion placeholder) {
          extension.providePlaceholder(url, std::move(placeholder));
        });
  }

  void _startProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override {
    workOnItem(std::move(url), std::move(completion), &ProviderExtension::startProviding);
  }
  void _itemChangedAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override {
    workOnItem(std::move(url), std::move(completion), &ProviderExtension::itemChanged, WithoutDaemon::carriedOut);
  }
  void _stopProvidingItemAtURL(std::optional<URL> url, CompletionHandler<SXError> completion) override {
    workOnItem(std::move(url), std::move(completion), &ProviderExtension::stopProviding);
  }

  void _identifierForItemAtURL(std::optional<URL> url, CompletionHandler<SXError, std::string> completion) override {
    auto answer = [completion = orNobody(std::move(completion))](Result<std::string> identifier) {
      if (!identifier) return completion(identifier.error(), std::nullopt);
      // A grant for it would be one for nothing, and the daemon takes an identifier as it is.
      if (identifier.value().empty()) return completion(emptyIdentifier(), std::nullopt);
      completion(std::nullopt, std::move(identifier.value()));
    };
    if (!url) return answer(nothingGiven("URL of the document"));
    work<Result<std::string>>(
        threads_.lookups, answer,
        [url = *std::move(url)](ProviderExtension &extension, ProviderExtension::IdentifierCompletion identifier) {
          extension.itemIdentifier(url, std::move(identifier));
        });
  }

  void _URLForItemIdentifier(std::optional<std::string> itemIdentifier,
                             CompletionHandler<SXError, URL> completion) override {
    auto answer = [completion = orNobody(std::move(completion))](Result<URL> url) {
      if (url) return completion(std::nullopt, std::move(url.value()));
      completion(url.error(), std::nullopt);
    };
    if (!itemIdentifier) return answer(nothingGiven("identifier of the document"));
    work<Result<URL>>(
        threads_.lookups, answer,
        [identifier = *std::move(itemIdentifier)](ProviderExtension &extension, ProviderExtension::URLCompletion url) {
          extension.itemURL(identifier, std::move(url));
        });
  }

 private:
  template <class Answer>
  void work(ThreadPool &threads, std::function<void(Answer)> send,
            std::function<void(ProviderExtension &, std::function<void(Answer)>)> operation,
            WithoutDaemon withoutDaemon = WithoutDaemon::dropped) {
    auto answer = answeringOnce<Answer>(std::move(send));
    threads.execute([extension = extension_, cancellation = cancellation_, withoutDaemon, answer = std::move(answer),
                     operation = std::move(operation)] {
      if (cancellation.stop_requested() && withoutDaemon == WithoutDaemon::dropped) return;
      try {
        operation(*extension, answer);
      } catch (const std::exception &thrown) {
        answer(posixError(EIO, std::string("serving the document: ") + thrown.what()));
      } catch (...) {
        answer(posixError(EIO, "serving the document"));
      }
    });
  }

  void workOnItem(std::optional<URL> url, CompletionHandler<SXError> completion,
                  void (ProviderExtension::*function)(const URL &, ProviderExtension::Completion),
                  WithoutDaemon withoutDaemon = WithoutDaemon::dropped) {
    completion = orNobody(std::move(completion));
    if (!url) return completion(nothingGiven("URL of the document"));
    work<Outcome>(
        threads_.transfers, std::move(completion),
        [url = *std::move(url), function](ProviderExtension &extension, ProviderExtension::Completion answer) {
          (extension.*function)(url, std::move(answer));
        },
        withoutDaemon);
  }

  std::shared_ptr<ProviderExtension> extension_;
  const std::stop_token cancellation_;
  CallThreads &threads_;
};

int complain(const std::string &sentence) {
  std::fprintf(stderr, "%s\n", sentence.c_str());
  return 1;
}

}  // namespace

int serveProviderExtension(std::shared_ptr<ProviderExtension> extension, int socket) {
  sdk::BusLoop loop;
  CallThreads threads;
  std::optional<SXError> reason;
  bool ready = false;
  auto exported = std::make_shared<ProtocolExporter<_KTStorixVendor>>(
      _KTStorixVendorProtocol(), std::make_shared<ExportedExtension>(extension, extension->cancellation(), threads));
  wire::BusConnection::Options options;
  options.peer = "the daemon";
  options.requestsInFlightAtMost = unansweredCallsAtMost;
  const auto added = loop.add(UniqueFd(socket), std::move(options), [&](wire::BusConnection &connection) {
    connection.exportObject(LinkInterface(_KTStorixVendorProtocol().description()), std::move(exported));
    connection.setReadyHandler([&ready] { ready = true; });
    connection.setClosedHandler([&loop, &reason](const SXError &error) {
      reason = error;
      loop.stop();
    });
  });
  if (!added) return complain("The connection to the document broker failed: " + added.error().message());
  loop.run();
  extension->cancellation_.request_stop();
  if (!ready) {
    return complain("The document broker ended the connection before the login was done" +
                    (reason ? ": " + reason->message() : "."));
  }
  return 0;
}

int runProviderExtension(std::shared_ptr<ProviderExtension> extension) {
  const char *text = std::getenv("STORIX_EXTENSION_FD");
  if (!text) {
    return complain("This program is a document provider. The document broker starts it when a document is needed.");
  }
  const std::string_view number(text);
  int descriptor = -1;
  const auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), descriptor);
  struct stat status {};
  if (error != std::errc() || end != number.data() + number.size() || descriptor < 0 ||
      ::fstat(descriptor, &status) != 0 || !S_ISSOCK(status.st_mode)) {
    return complain("STORIX_EXTENSION_FD must be the number of a connected socket; it is \"" + std::string(number) +
                    "\".");
  }
  ::fcntl(descriptor, F_SETFD, FD_CLOEXEC);
  return serveProviderExtension(std::move(extension), descriptor);
}

}  // namespace storix
