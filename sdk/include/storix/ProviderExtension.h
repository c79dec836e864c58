#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <stop_token>
#include <string>

#include "platform/Result.h"
#include "platform/SXError.h"
#include "platform/URL.h"

namespace storix {

/// What the daemon gives an extension's process when it starts it.
struct ProviderEnvironment {
  /// The extension's bundle, "<name>.appdex".
  std::string bundlePath;
  /// The container of the group whose provided-items directory this provider serves. Absent when the
  /// bundle names no group.
  std::optional<std::string> groupContainer;

  /// From STORIX_BUNDLE_PATH and STORIX_GROUP_CONTAINER.
  static ProviderEnvironment ofThisProcess();
};

/// The base of a document provider. Subclass it, override what differs from the defaults, and write
///
///     class MyProvider : public storix::ProviderExtension {
///       using ProviderExtension::ProviderExtension;
///       void startProviding(const storix::URL &url, Completion completion) override { ... }
///     };
///     int main() { return storix::runProviderExtension<MyProvider>(); }
///
/// The daemon starts the process when a document is asked for and ends it some time after the last
/// request. Every function is called on one of a few threads kept for this work, never on the one
/// that reads the connection, and may be called for several items, or twice for the same one, at the
/// same time. It may answer at once or later, from any thread, by calling its completion handler.
///
/// Moving content may take its time: `startProviding`, `itemChanged` and `stopProviding` have eight
/// threads of their own, and further calls of them wait for one, in the order of arrival. The other
/// functions have eight threads too, so that any number of slow documents never keeps somebody
/// waiting who asks for an identifier. One that must wait for something long should return and answer
/// later.
///
/// When the daemon closes the connection nobody waits for an answer any more, and the process should
/// end: `cancellation` tells the calls under way. Calls that have not begun by then are dropped, except
/// `itemChanged`, since a change that nobody has heard of could be lost. A process that is still there
/// after 5 seconds is ended by a signal.
///
/// The first call of a completion handler counts and further ones do nothing. When a function lets go
/// of its completion handler without calling it, or ends with an exception, the daemon gets an error
/// that says so, so that no document waits for ever. A handler may be called after the daemon has
/// gone; nothing happens then.
///
/// URLs are those that the daemon's client or the file coordination named: mostly below
/// `providedItemsURL`, but that is for the provider to check (`relativePath` does).
class ProviderExtension {
 public:
  /// Absent on success.
  using Completion = std::function<void(std::optional<SXError>)>;
  using URLCompletion = std::function<void(Result<URL>)>;
  using IdentifierCompletion = std::function<void(Result<std::string>)>;

  explicit ProviderExtension(ProviderEnvironment environment) : environment_(std::move(environment)) {}
  virtual ~ProviderExtension() = default;
  ProviderExtension(const ProviderExtension &) = delete;
  ProviderExtension &operator=(const ProviderExtension &) = delete;

  /// Asked once before the daemon registers the provider, and again after each start of the daemon.
  /// With an error the daemon tries again, three times in all, and then leaves the provider out.
  /// The default makes the provided-items directory.
  virtual void performInitialSetup(Completion completion);

  /// Make a small file that stands for an item whose content is not there, and answer its URL (a good
  /// place is the item's companion: the same directory, "." before the name). The default answers
  /// the error ENOTSUP.
  virtual void providePlaceholder(const URL &url, URLCompletion completion);

  /// Have the item's content at the URL. Put it there complete, by renaming, since readers may look
  /// at any time.
  virtual void startProviding(const URL &url, Completion completion) = 0;

  /// A coordinated writer has changed the file at the URL. The default answers success.
  virtual void itemChanged(const URL &url, Completion completion);

  /// The item's content is not needed at the URL any more. The default answers success and keeps it.
  virtual void stopProviding(const URL &url, Completion completion);

  /// The identifier of the item at that URL: UTF-8, lasting, and known to nobody but this provider as
  /// to its meaning. Grants are made for it. The daemon gets an error in the place of an empty one. The default is the
  /// path relative to the provided-items directory, or an error when the URL lies elsewhere.
  virtual void itemIdentifier(const URL &url, IdentifierCompletion completion);

  /// The reverse. The default takes the identifier for a relative path, and refuses one that is
  /// absolute or has empty, "." or ".." components.
  virtual void itemURL(const std::string &identifier, URLCompletion completion);

 protected:
  [[nodiscard]] const ProviderEnvironment &environment() const { return environment_; }

  /// Says, from any thread, whether the daemon has closed the connection: long work asks
  /// `cancellation().stop_requested()` between its steps, waits with a condition_variable_any that
  /// takes the token, or has a std::stop_callback break off what it waits for. Leave nothing half
  /// written under an item's name; the answer does not matter any more.
  [[nodiscard]] std::stop_token cancellation() const { return cancellation_.get_token(); }

  /// The directory "Storix Storage" in the group's container, where the provider's documents appear.
  /// Absent without a group. Nobody makes it but the provider.
  [[nodiscard]] std::optional<URL> providedItemsURL() const;

  /// The path of an item relative to the provided-items directory. Absent for the directory itself
  /// and for what lies outside, be it by ".." or by a symbolic link as it leads at the moment. Who
  /// then opens the file should let nobody lead him astray meanwhile, and follow no links.
  [[nodiscard]] std::optional<std::string> relativePath(const URL &url) const;

 private:
  friend int serveProviderExtension(std::shared_ptr<ProviderExtension> extension, int socket);

  ProviderEnvironment environment_;
  std::stop_source cancellation_;
};

/// Serves the daemon over the connection that it handed down (STORIX_EXTENSION_FD) until it closes
/// it, then cancels the calls under way and waits for them. Gives the process's exit status: 0, or 1 with a sentence
/// on stderr where the process was not started by the daemon or the connection could not be made.
int runProviderExtension(std::shared_ptr<ProviderExtension> extension);

template <class Extension>
int runProviderExtension() {
  return runProviderExtension(std::make_shared<Extension>(ProviderEnvironment::ofThisProcess()));
}

/// As the first form, over a connected socket that the function takes. Once for each extension.
int serveProviderExtension(std::shared_ptr<ProviderExtension> extension, int socket);

}  // namespace storix
