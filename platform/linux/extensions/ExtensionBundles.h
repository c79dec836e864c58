#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Extensions.h"
#include "platform/Result.h"
#include "platform/linux/extensions/ConfinementWishes.h"

namespace storix::linuxhost {

/// Where extensions are looked for, and where their group containers lie. All absolute.
struct ExtensionPlaces {
  /// In the order of precedence.
  std::vector<std::string> extensionDirectories;
  std::string groupContainersDirectory;
};

/// One installed bundle: `<directory>/<name>.appdex` and what its Info.kvs says. Unchanging.
struct ExtensionBundle {
  std::string path;
  /// Absent when Info.kvs has none or an empty one.
  std::optional<std::string> identifier;
  std::string version;
  std::string extensionPoint;
  std::vector<std::string> groups;
  ConfinementWishes wishes;
  /// The whole content of Info.kvs.
  Dictionary info;

  /// The same state of the same bundle.
  friend bool operator==(const ExtensionBundle &, const ExtensionBundle &) = default;

  /// The file to run, and an error where the bundle names none or one outside of itself. Only the
  /// name is looked at.
  [[nodiscard]] Result<std::string> executablePath() const;

  /// The group that `KTExtensionStorixDocumentGroup` names, if it is one of the bundle's own.
  [[nodiscard]] std::optional<std::string> documentGroup() const;
};

/// A file or directory that could not be used, and why.
struct BundleProblem {
  std::string path;
  SXError error;
  friend bool operator==(const BundleProblem &, const BundleProblem &) = default;

  /// The process or the system had run out of something, so that looking again may help.
  [[nodiscard]] bool isTransient() const;
};

/// What one look at all directories found.
struct BundleScan {
  /// In the order of directories, then of names; of several bundles with one identifier the first.
  std::vector<std::shared_ptr<const ExtensionBundle>> bundles;
  /// Bundles that are left out.
  std::vector<BundleProblem> bundleProblems;
  /// Directories that exist and could not be read.
  std::vector<BundleProblem> directoryProblems;
};

/// The bundle in that directory, or what is wrong with its Info.kvs.
Result<std::shared_ptr<const ExtensionBundle>> readExtensionBundle(const std::string &path);

inline constexpr std::string_view bundleSuffix = ".appdex";
inline constexpr std::string_view infoFileName = "Info.kvs";

/// Told of each directory right before it is read, so that whoever watches it misses no change.
class DirectoryReadingObserver {
 public:
  virtual ~DirectoryReadingObserver() = default;
  virtual void willReadExtensionDirectory(const std::string &path) = 0;
  virtual void willReadBundle(const std::string &path) = 0;
};

/// Looks at all directories now. A directory that is not there is no problem.
BundleScan scanExtensionBundles(const ExtensionPlaces &places, DirectoryReadingObserver &observer);

/// The container directory of a group, whether or not it exists.
std::string groupContainerPath(const ExtensionPlaces &places, const std::string &group);

/// Makes the directories of the bundle's groups (0700) that are missing; gives what failed.
std::vector<BundleProblem> makeGroupContainers(const ExtensionPlaces &places, const ExtensionBundle &bundle);

/// The environment of the bundle's process: `common`, which is that of every extension, and what is its
/// own. `groupContainer` is the directory of its document group, if it has one.
std::vector<std::string> extensionProcessEnvironment(std::vector<std::string> common, const ExtensionBundle &bundle,
                                                     const std::optional<std::string> &groupContainer);

/// The record of one bundle for the logic. `places` gives the group containers.
std::shared_ptr<BundleRecord> makeBundleRecord(std::shared_ptr<const ExtensionBundle> bundle,
                                               const ExtensionPlaces &places);

}  // namespace storix::linuxhost
