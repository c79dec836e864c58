#include "platform/linux/identity/ApplicationManifests.h"

#include <dirent.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <memory>

#include "platform/Log.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "platform/linux/files/PathText.h"

namespace storix::linuxhost {
namespace {

constexpr std::string_view manifestSuffix = ".kvs";
constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;
/// More than the clock of any file system is coarse.
constexpr std::int64_t settlingTime = 3 * nanosecondsPerSecond;

std::int64_t nanoseconds(const timespec &time) { return time.tv_sec * nanosecondsPerSecond + time.tv_nsec; }

bool isManifestName(std::string_view name) {
  return name.ends_with(manifestSuffix) && name.size() > manifestSuffix.size() && !name.starts_with('.') &&
         isUTF8(name);
}

/// None when the directory cannot be read.
std::optional<std::vector<std::string>> manifestNames(const std::string &directory) {
  const std::unique_ptr<DIR, int (*)(DIR *)> stream(::opendir(directory.c_str()), ::closedir);
  if (!stream) return std::nullopt;
  std::vector<std::string> names;
  while (const dirent *entry = ::readdir(stream.get())) {
    if (isManifestName(entry->d_name)) names.emplace_back(entry->d_name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace

ApplicationManifests::Stamp ApplicationManifests::Stamp::of(const struct stat &status) {
  timespec now{};
  ::clock_gettime(CLOCK_REALTIME, &now);
  // The time of the last change of anything, which nobody can set.
  const std::int64_t changed = nanoseconds(status.st_ctim);
  return {status.st_dev, status.st_ino, status.st_size, changed, nanoseconds(now) - changed > settlingTime};
}

ApplicationManifests::ApplicationManifests(std::vector<std::string> directories) {
  for (std::string &path : directories) {
    directories_.emplace_back();
    directories_.back().path = std::move(path);
  }
}

std::optional<ApplicationManifest> ApplicationManifests::manifestForExecutable(dev_t device, ino_t inode) {
  const std::lock_guard lock(mutex_);
  refresh();
  for (const Directory &directory : directories_) {
    for (const File &file : directory.files) {
      struct stat status {};
      if (file.usable && !file.executable.empty() && ::stat(file.executable.c_str(), &status) == 0 &&
          status.st_dev == device && status.st_ino == inode) {
        return file.manifest;
      }
    }
  }
  return std::nullopt;
}

std::optional<ApplicationManifest> ApplicationManifests::manifestForIdentifier(std::string_view bundleIdentifier) {
  const std::lock_guard lock(mutex_);
  refresh();
  for (const Directory &directory : directories_) {
    for (const File &file : directory.files) {
      if (file.usable && file.manifest.bundleIdentifier == bundleIdentifier) return file.manifest;
    }
  }
  return std::nullopt;
}

void ApplicationManifests::refresh() {
  for (Directory &directory : directories_) {
    struct stat status {};
    if (::stat(directory.path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
      directory.stamp = {};
      directory.files.clear();
      continue;
    }
    if (const Stamp now = Stamp::of(status); !directory.stamp.isStillGood(now)) listFiles(directory, now);
    for (File &file : directory.files) {
      if (::stat(file.path.c_str(), &status) != 0) {
        file.stamp = {};
        file.usable = false;
        continue;
      }
      if (const Stamp now = Stamp::of(status); !file.stamp.isStillGood(now)) readFile(file, now);
    }
  }
}

void ApplicationManifests::listFiles(Directory &directory, const Stamp &now) {
  const std::optional<std::vector<std::string>> names = manifestNames(directory.path);
  if (!names) {
    const SXError error = posixError(errno, "Cannot read " + quotedPath(directory.path));
    if (!directory.complained.sameState(now)) {
      sx_default_log().notice("[NOTICE] Application manifests are left out. %@", error.message());
    }
    directory.complained = now;
    directory.stamp = {};
    return;
  }
  directory.stamp = now;
  std::vector<File> files;
  for (const std::string &name : *names) {
    File file;
    file.path = directory.path + "/" + name;
    const auto known = std::find_if(directory.files.begin(), directory.files.end(),
                                    [&file](const File &other) { return other.path == file.path; });
    if (known != directory.files.end()) file = std::move(*known);
    file.manifest.bundleIdentifier = name.substr(0, name.size() - manifestSuffix.size());
    files.push_back(std::move(file));
  }
  directory.files = std::move(files);
}

void ApplicationManifests::readFile(File &file, const Stamp &now) {
  file.stamp = now;
  file.usable = false;
  file.executable.clear();
  file.manifest.entitlements.clear();

  std::string problem;
  Result<Dictionary> content = readKeyedValueFile(file.path);
  if (!content) {
    problem = content.error().message();
    // What kept it from being read may pass without a trace in the file.
    if (content.error().domain() == posixErrorDomain) file.stamp.settled = false;
  } else {
    const auto executable = content.value().find("Executable");
    if (executable != content.value().end()) {
      const std::string *path = executable->second.string();
      if (path && path->starts_with('/') && path->find('\0') == std::string::npos) {
        file.executable = *path;
      } else {
        problem = "\"Executable\" is not an absolute path";
      }
    }
    const auto entitlements = content.value().find("Entitlements");
    if (entitlements != content.value().end()) {
      if (Dictionary *dictionary = entitlements->second.dictionary()) {
        file.manifest.entitlements = std::move(*dictionary);
      } else {
        problem = "\"Entitlements\" is not a dictionary";
      }
    }
  }
  if (problem.empty()) {
    file.usable = true;
  } else if (!file.complained.sameState(now)) {
    file.complained = now;
    sx_default_log().notice("[NOTICE] Leaving out the application manifest %@: %@", file.path, problem);
  }
}

}  // namespace storix::linuxhost
