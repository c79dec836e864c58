#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <stop_token>
#include <string>
#include <thread>

#include "examples/webdav-provider/DavClient.h"
#include "examples/webdav-provider/DocumentSync.h"
#include "examples/webdav-provider/ItemTurns.h"
#include "storix/ProviderExtension.h"

namespace storix::example {

/// Serves the documents of a folder on a WebDAV server, as `readConfiguration` finds it: downloads them
/// when they are needed, uploads what was changed, and keeps both versions where a document was changed
/// in both places. An item's identifier is its decoded path relative to the folder, its URL the same
/// path below the provided-items directory. Names that begin with a dot are not served.
///
/// The functions block the threads of the extension on which they are called; those of one item one
/// after another, so that one who asks for what is being downloaded gets that download. Errors are of
/// the domain "posix" with a sentence about the server or the file.
class WebDavProvider : public ProviderExtension {
 public:
  /// How the configuration is come by; for tests that want short waits.
  using Configure = std::function<Result<DavSettings>(const std::string &groupContainer)>;

  explicit WebDavProvider(ProviderEnvironment environment);
  WebDavProvider(ProviderEnvironment environment, Configure configure);
  ~WebDavProvider() override;

  /// Fails where the configuration is wrong, not where the server cannot be reached: local changes
  /// would be out of reach then. In the background it uploads what could not be uploaded before, and
  /// makes placeholders for what is in the folder.
  void performInitialSetup(Completion completion) override;

  /// For a folder: its directory, with the placeholders of what is in it.
  void providePlaceholder(const URL &url, URLCompletion completion) override;
  void startProviding(const URL &url, Completion completion) override;
  void itemChanged(const URL &url, Completion completion) override;
  /// Uploads the changes that the server does not have, and drops the content only then.
  void stopProviding(const URL &url, Completion completion) override;
  void itemIdentifier(const URL &url, IdentifierCompletion completion) override;
  void itemURL(const std::string &identifier, URLCompletion completion) override;

 private:
  /// What work needs, made when it is first needed and made anew by setup.
  struct Workplace {
    Workplace(DavSettings settings, LocalCopies localCopies, ItemStates itemStates)
        : client(std::move(settings)), copies(std::move(localCopies)), states(std::move(itemStates)) {}
    DavClient client;
    LocalCopies copies;
    ItemStates states;
  };

  Result<std::shared_ptr<Workplace>> workplace();
  Result<std::shared_ptr<Workplace>> openWorkplace() const;
  Result<std::string> pathOf(const URL &url) const;

  /// Runs the step on the item, and uploads what the step kept under another name.
  std::optional<SXError> work(const std::string &path,
                              DocumentSync::Outcome (DocumentSync::*step)(const std::string &));
  Result<URL> writePlaceholders(const std::string &path);
  std::optional<SXError> writePlaceholdersIn(Workplace &place, const std::string &path);
  void catchUp();

  const Configure configure_;
  ItemTurns turns_;
  std::stop_source ending_;
  std::stop_callback<std::function<void()>> daemonGone_;

  std::mutex mutex_;
  std::shared_ptr<Workplace> workplace_;  ///< Under the mutex.
  std::thread catchingUp_;                ///< Under the mutex.
  std::atomic<bool> isCatchingUp_{false};
};

}  // namespace storix::example
