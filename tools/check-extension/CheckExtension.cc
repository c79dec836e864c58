#include "tools/check-extension/CheckExtension.h"

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <utility>

#include "platform/linux/HostEnvironment.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/extensions/ExtensionConfinement.h"
#include "tools/check-extension/CheckBadInput.h"
#include "tools/check-extension/CheckBundle.h"
#include "tools/check-extension/CheckItem.h"
#include "tools/check-extension/CheckedExtension.h"

namespace storix::check {

namespace {

namespace fs = std::filesystem;

/// A fresh directory, removed with its content at the end.
class WorkingDirectory {
 public:
  WorkingDirectory() {
    std::error_code failed;
    const fs::path parent = fs::canonical(fs::temp_directory_path(failed), failed);
    std::string name = (parent / "storix-check-XXXXXX").string();
    if (!failed && ::mkdtemp(name.data())) path_ = name;
  }
  ~WorkingDirectory() {
    std::error_code ignored;
    if (!path_.empty()) fs::remove_all(path_, ignored);
  }
  WorkingDirectory(const WorkingDirectory &) = delete;
  WorkingDirectory &operator=(const WorkingDirectory &) = delete;

  [[nodiscard]] const std::string &path() const { return path_; }

 private:
  std::string path_;
};

/// The session as the daemon would see it, but with directories of the check's own.
Result<linuxhost::HostEnvironment> hostEnvironment(const std::string &workingDirectory) {
  auto variables = linuxhost::processEnvironment();
  variables.insert_or_assign("STORIX_RUNTIME_DIR", workingDirectory + "/run");
  auto host = linuxhost::HostEnvironment::fromVariables(variables);
  if (host) host.value().extensionPlaces.groupContainersDirectory = workingDirectory + "/groups";
  return host;
}

/// The container of the bundle's document group: the one that was given, or one of the fresh ones.
Result<std::optional<std::string>> groupContainer(const ExtensionCheck &check, const linuxhost::ExtensionBundle &bundle,
                                                  const linuxhost::ExtensionPlaces &places) {
  const auto group = bundle.documentGroup();
  if (!group) return std::optional<std::string>();
  if (check.container) {
    std::error_code failed;
    const fs::path given = fs::canonical(*check.container, failed);
    if (failed || !fs::is_directory(given, failed)) {
      return posixError(failed ? failed.value() : ENOTDIR, "using " + *check.container + " as the group's container");
    }
    return std::optional(given.string());
  }
  const auto problems = linuxhost::makeGroupContainers(places, bundle);
  if (!problems.empty()) return problems.front().error;
  return std::optional(groupContainerPath(places, *group));
}

/// Sets the extension up twice, as two starts of the daemon do. Whether there is a directory to go on with.
bool checkSetup(CheckedExtension &extension, const std::optional<std::string> &storage) {
  bool answered = false;
  for (const char *when : {"", "the second time"}) {
    const auto answer = extension.ask(Operation::performInitialSetup, std::nullopt, when);
    if (!answer) continue;
    answered = true;
    if (const auto failure = failureOf(*answer)) {
      extension.findings().error("PerformInitialSetup: the daemon leaves out a provider that answers an error: " +
                                 *failure);
    }
  }
  if (!storage || !answered) return false;
  std::error_code failed;
  if (fs::is_directory(*storage, failed)) return true;
  extension.findings().error(
      "PerformInitialSetup: the provided-items directory \"Storix Storage\" in the group's "
      "container is not there afterwards; nobody makes it but the provider.");
  return fs::create_directory(*storage, failed);
}

std::vector<KnownItem> knownItems(const ExtensionCheck &check) {
  std::vector<KnownItem> items;
  for (const std::string &identifier : check.items) items.push_back({identifier, ""});
  for (const std::string &path : check.files) items.push_back({std::nullopt, path});
  return items;
}

/// Everything, without a sandbox that would hide what the extension does elsewhere.
void checkEverything(CheckedExtension &extension, const ExtensionCheck &check,
                     const std::optional<std::string> &storagePath, const std::string &workingDirectory) {
  if (!extension.start()) return;
  if (checkSetup(extension, storagePath)) {
    const URL storage = *URL::fileURLWithPath(*storagePath, true);
    checkBadInput(extension, storage, workingDirectory);
    std::optional<URL> first;
    for (const KnownItem &item : knownItems(check)) {
      const auto url = checkItem(extension, item, storage);
      if (!first) first = url;
    }
    checkDescriptors(extension, first, storage);
  }
  extension.end(false);
}

/// What an extension is for, inside the sandbox that the daemon makes.
void checkServing(CheckedExtension &extension, const ExtensionCheck &check,
                  const std::optional<std::string> &storagePath) {
  if (!extension.start()) return;
  if (checkSetup(extension, storagePath)) {
    const URL storage = *URL::fileURLWithPath(*storagePath, true);
    for (const KnownItem &item : knownItems(check)) checkThatItemIsServed(extension, item, storage);
  }
  extension.end(false);
}

}  // namespace

Result<std::vector<Finding>> checkExtension(const ExtensionCheck &check) {
  Findings findings;
  auto bundle = checkBundle(check.bundle, findings);
  if (!bundle) return findings.all();

  const WorkingDirectory working;
  if (working.path().empty()) return posixError(errno, "making a temporary directory");
  const auto host = hostEnvironment(working.path());
  if (!host) return host.error();
  const auto container = groupContainer(check, *bundle->bundle, host.value().extensionPlaces);
  if (!container) return container.error();
  std::optional<std::string> storage;
  if (container.value()) storage = *container.value() + "/Storix Storage";

  CheckedExtension::Setting setting{
      *bundle,
      extensionProcessEnvironment(host.value().extensionEnvironment, *bundle->bundle, container.value()),
      {},
      check.timeout,
      check.takeOutputLine};
  CheckedExtension extension(setting, findings);
  checkEverything(extension, check, storage, working.path());
  if (findings.count(Severity::error) > 0) return findings.all();

  // Now with nothing but what the daemon lets it have.
  linuxhost::ExtensionConfinement confinement(host.value().confinementPlaces(), host.value().confinement);
  linuxhost::ExtensionBundle confined = *bundle->bundle;
  if (check.container && container.value()) confined.wishes.readWrite.push_back(*container.value());
  setting.prepare = [&confinement, &confined](linuxhost::LaunchDescription &description) {
    return confinement.confine(description, confined);
  };
  Findings inside;
  CheckedExtension confinedExtension(setting, inside);
  checkServing(confinedExtension, check, storage);
  for (const Finding &finding : inside.all()) {
    findings.error("Inside the sandbox in which the daemon runs it (\"KTSandbox\" asks for more): " + finding.sentence);
  }
  return findings.all();
}

}  // namespace storix::check
