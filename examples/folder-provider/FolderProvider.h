#pragma once

#include <condition_variable>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "FolderTree.h"
#include "storix/ProviderExtension.h"

namespace storix::example {

/// Serves the files of a source folder, which stands for a remote place: providing an item copies
/// it from there ("download"), a changed item is copied back ("upload"), and what nobody needs any
/// more is dropped.
///
/// The source folder is the string "FolderProviderSource" in the bundle's Info.kvs, absolute or
/// relative to the bundle. An item's identifier is its path relative to the source, its URL the same
/// path below the provided-items directory. Hidden files and symbolic links are not served.
///
/// The functions run on the threads of the extension's pool; those of one item one after another.
class FolderProvider : public ProviderExtension {
 public:
  explicit FolderProvider(ProviderEnvironment environment);

  void performInitialSetup(Completion completion) override;
  /// Writes the companion file: a keyed-value file with "name", "size" and "modificationTime"
  /// (seconds since 1970).
  void providePlaceholder(const URL &url, URLCompletion completion) override;
  /// A copy that is as new as the source's file stays; so does one that is newer, since its changes
  /// have not been copied back yet.
  void startProviding(const URL &url, Completion completion) override;
  void itemChanged(const URL &url, Completion completion) override;
  /// Drops the copy. Changes that were not copied back yet are copied back first.
  void stopProviding(const URL &url, Completion completion) override;
  void itemIdentifier(const URL &url, IdentifierCompletion completion) override;
  void itemURL(const std::string &identifier, URLCompletion completion) override;

 private:
  class ItemInUse;

  Result<FolderTree> openSource() const;
  Result<FolderTree> openProvided() const;
  /// The item's path relative to the provided-items directory, checked.
  Result<std::string> pathOf(const URL &url) const;

  std::optional<SXError> start(const std::string &path);
  std::optional<SXError> copyBack(const std::string &path);
  std::optional<SXError> stop(const std::string &path);
  Result<URL> writePlaceholder(const std::string &path);

  std::mutex mutex_;
  std::condition_variable itemReleased_;
  std::set<std::string> itemsInUse_;
};

/// The text of an item's placeholder; none where the name is not UTF-8.
std::optional<std::string> placeholderText(const std::string &name, const FileState &state);

/// The source folder that a bundle's Info.kvs names, or what is wrong with it.
Result<std::string> sourceFolderOfBundle(const std::string &bundlePath);

}  // namespace storix::example
