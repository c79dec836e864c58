#pragma once

#include <functional>
#include <memory>
#include <optional>
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

  /// The identifier of the item at that URL: not empty, UTF-8, lasting, and known to nobody but this
  /// provider as to its meaning. Grants are made for it. The default is the path relative to the
  /// provided-items directory, or an error when the URL lies elsewhere.
  virtual void itemIdentifier(const URL &url, IdentifierCompletion completion);

  /// The reverse. The default takes the identifier for a relative path, and refuses one that is
  /// absolute or has empty, "." or ".." components.
  virtual void itemURL(const std::string &identifier, URLCompletion completion);

 protected:
  [[nodiscard]] const ProviderEnvironment &environment() const { return environment_; }

  /// The directory "Storix Storage" in the group's container, where the provider's documents appear.
  /// Absent without a group. Nobody makes it but the provider.
  [[nodiscard]] std::optional<URL> providedItemsURL() const;

  /// The path of an item relative to the provided-items directory. Absent for the directory itself
  /// and for what lies outside. Symbolic links on the way to the directory, and ".." in the URL, are
  /// resolved when the URL does not begin with the directory as it stands.
  [[nodiscard]] std::optional<std::string> relativePath(const URL &url) const;

 private:
  ProviderEnvironment environment_;
};

/// Serves the daemon over the connection that it handed down (STORIX_EXTENSION_FD) until it closes
/// it, then waits for the calls under way. Gives the process's exit status: 0, or 1 with a sentence
/// on stderr where the process was not started by the daemon or the connection could not be made.
int runProviderExtension(std::shared_ptr<ProviderExtension> extension);

template <class Extension>
int runProviderExtension() {
  return runProviderExtension(std::make_shared<Extension>(ProviderEnvironment::ofThisProcess()));
}

/// As the first form, over a connected socket that the function takes.
int serveProviderExtension(std::shared_ptr<ProviderExtension> extension, int socket);

}  // namespace storix
