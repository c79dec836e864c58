#include "platform/linux/extensions/ExtensionBundles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <set>

#include "platform/linux/HostErrors.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

namespace {

/// One name in a directory, and nothing that leads elsewhere.
bool isPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
         name.find('\0') == std::string_view::npos;
}

/// The string of that key; empty where it is missing, an error where it is something else.
Result<std::string> infoString(const Dictionary &info, std::string_view key) {
  const auto found = info.find(key);
  if (found == info.end()) return std::string();
  if (const std::string *text = found->second.string()) return *text;
  return keyedValueFormatError("\"" + std::string(key) + "\" must be a string.");
}

Result<std::vector<std::string>> infoGroups(const Dictionary &info) {
  std::vector<std::string> groups;
  const auto found = info.find("KTGroupContainers");
  if (found == info.end()) return groups;
  const List *list = found->second.list();
  if (!list) return keyedValueFormatError("\"KTGroupContainers\" must be a list.");
  for (const Value &entry : *list) {
    const std::string *group = entry.string();
    if (!group || !isPlainName(*group)) {
      return keyedValueFormatError("\"KTGroupContainers\" must hold group identifiers, which are plain names.");
    }
    if (std::find(groups.begin(), groups.end(), *group) == groups.end()) groups.push_back(*group);
  }
  return groups;
}

struct CloseDirectory {
  void operator()(DIR *directory) const { ::closedir(directory); }
};

/// The names of the bundles in a directory, sorted. A directory that is not there has none.
Result<std::vector<std::string>> bundleNames(const std::string &directory) {
  std::vector<std::string> names;
  UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) {
    if (errno == ENOENT) return names;
    return posixError(errno, "opening the extensions directory " + directory);
  }
  const std::unique_ptr<DIR, CloseDirectory> entries(::fdopendir(fd.get()));
  if (!entries) return posixError(errno, "reading the extensions directory " + directory);
  static_cast<void>(fd.release());  // closed with the stream
  for (;;) {
    errno = 0;
    const dirent *entry = ::readdir(entries.get());
    if (!entry) {
      if (errno != 0) return posixError(errno, "reading the extensions directory " + directory);
      break;
    }
    const std::string_view name(entry->d_name);
    if (name.size() > bundleSuffix.size() && name.ends_with(bundleSuffix)) names.emplace_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

/// As `mkdir -p`, each new directory for its owner alone.
int makeDirectories(const std::string &path) {
  if (::mkdir(path.c_str(), 0700) == 0) return 0;
  if (errno == ENOENT) {
    const std::size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash == 0) return ENOENT;
    if (const int error = makeDirectories(path.substr(0, slash)); error != 0) return error;
    if (::mkdir(path.c_str(), 0700) == 0) return 0;
  }
  if (errno != EEXIST) return errno;
  const UniqueFd existing(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  return existing ? 0 : errno;
}

class InstalledBundleRecord : public BundleRecord {
 public:
  InstalledBundleRecord(std::shared_ptr<const ExtensionBundle> bundle, std::map<std::string, URL> groupContainers)
      : bundle_(std::move(bundle)), groupContainers_(std::move(groupContainers)) {}

  std::optional<Value> infoDictionaryValue(std::string_view key, ValueKind expectedKind) const override {
    const auto found = bundle_->info.find(key);
    if (found == bundle_->info.end() || found->second.kind() != expectedKind) return std::nullopt;
    return found->second;
  }

  std::map<std::string, URL> groupContainerURLs() const override { return groupContainers_; }

 private:
  std::shared_ptr<const ExtensionBundle> bundle_;
  std::map<std::string, URL> groupContainers_;
};

}  // namespace

Result<std::shared_ptr<const ExtensionBundle>> readExtensionBundle(const std::string &path) {
  Result<Dictionary> info = readKeyedValueFile(path + "/" + std::string(infoFileName));
  if (!info) return info.error();
  auto bundle = std::make_shared<ExtensionBundle>();
  bundle->path = path;
  Result<std::string> identifier = infoString(info.value(), "KTBundleIdentifier");
  if (!identifier) return identifier.error();
  if (!identifier.value().empty()) bundle->identifier = identifier.value();
  Result<std::string> version = infoString(info.value(), "KTBundleVersion");
  if (!version) return version.error();
  bundle->version = version.value();
  Result<std::string> extensionPoint = infoString(info.value(), extensionPointAttribute);
  if (!extensionPoint) return extensionPoint.error();
  bundle->extensionPoint = extensionPoint.value();
  Result<std::vector<std::string>> groups = infoGroups(info.value());
  if (!groups) return groups.error();
  bundle->groups = groups.value();
  Result<ConfinementWishes> wishes = confinementWishes(info.value());
  if (!wishes) return wishes.error();
  bundle->wishes = std::move(wishes.value());
  bundle->info = std::move(info.value());
  return std::shared_ptr<const ExtensionBundle>(std::move(bundle));
}

Result<std::string> ExtensionBundle::executablePath() const {
  const auto found = info.find("KTBundleExecutable");
  const std::string *name = found == info.end() ? nullptr : found->second.string();
  if (!name || name->empty()) {
    return hostError(HostErrorCode::noExecutable, "The bundle " + path + " names no KTBundleExecutable.");
  }
  // Component by component, so that "a..b" is a name like any other.
  bool inside = !name->starts_with('/') && name->find('\0') == std::string::npos;
  for (std::size_t start = 0; inside && start <= name->size();) {
    const std::size_t end = std::min(name->find('/', start), name->size());
    if (std::string_view(*name).substr(start, end - start) == "..") inside = false;
    start = end + 1;
  }
  if (!inside) {
    return hostError(HostErrorCode::noExecutable, "The KTBundleExecutable \"" + *name + "\" of the bundle " + path +
                                                      " does not lie inside the bundle.");
  }
  return path + "/" + *name;
}

std::optional<std::string> ExtensionBundle::documentGroup() const {
  const auto extension = info.find("KTExtension");
  const Dictionary *dictionary = extension == info.end() ? nullptr : extension->second.dictionary();
  if (!dictionary) return std::nullopt;
  const auto found = dictionary->find("KTExtensionStorixDocumentGroup");
  const std::string *group = found == dictionary->end() ? nullptr : found->second.string();
  if (!group || std::find(groups.begin(), groups.end(), *group) == groups.end()) return std::nullopt;
  return *group;
}

bool BundleProblem::isTransient() const {
  return error.domain() == posixErrorDomain &&
         (error.code() == EMFILE || error.code() == ENFILE || error.code() == ENOMEM);
}

BundleScan scanExtensionBundles(const ExtensionPlaces &places, DirectoryReadingObserver &observer) {
  BundleScan scan;
  std::set<std::string> identifiers;
  for (const std::string &directory : places.extensionDirectories) {
    observer.willReadExtensionDirectory(directory);
    Result<std::vector<std::string>> names = bundleNames(directory);
    if (!names) {
      scan.directoryProblems.push_back({directory, names.error()});
      continue;
    }
    for (const std::string &name : names.value()) {
      const std::string path = stringByAppendingPathComponent(directory, name);
      observer.willReadBundle(path);
      Result<std::shared_ptr<const ExtensionBundle>> bundle = readExtensionBundle(path);
      if (!bundle) {
        scan.bundleProblems.push_back({path + "/" + std::string(infoFileName), bundle.error()});
        continue;
      }
      const std::optional<std::string> &identifier = bundle.value()->identifier;
      if (identifier && !identifiers.insert(*identifier).second) continue;
      scan.bundles.push_back(std::move(bundle.value()));
    }
  }
  return scan;
}

std::string groupContainerPath(const ExtensionPlaces &places, const std::string &group) {
  return places.groupContainersDirectory + "/" + group;
}

std::vector<BundleProblem> makeGroupContainers(const ExtensionPlaces &places, const ExtensionBundle &bundle) {
  std::vector<BundleProblem> problems;
  for (const std::string &group : bundle.groups) {
    const std::string path = groupContainerPath(places, group);
    if (const int error = makeDirectories(path); error != 0) {
      problems.push_back({path, posixError(error, "making the group container " + path)});
    }
  }
  return problems;
}

std::vector<std::string> extensionProcessEnvironment(std::vector<std::string> common, const ExtensionBundle &bundle,
                                                     const std::optional<std::string> &groupContainer) {
  common.push_back("STORIX_BUNDLE_PATH=" + bundle.path);
  if (groupContainer) common.push_back("STORIX_GROUP_CONTAINER=" + *groupContainer);
  return common;
}

std::shared_ptr<BundleRecord> makeBundleRecord(std::shared_ptr<const ExtensionBundle> bundle,
                                               const ExtensionPlaces &places) {
  std::map<std::string, URL> containers;
  for (const std::string &group : bundle->groups) {
    if (auto url = URL::fileURLWithPath(groupContainerPath(places, group), true)) containers.emplace(group, *url);
  }
  return std::make_shared<InstalledBundleRecord>(std::move(bundle), std::move(containers));
}

}  // namespace storix::linuxhost
