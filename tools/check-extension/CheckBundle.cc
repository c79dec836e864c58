#include "tools/check-extension/CheckBundle.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>
#include <utility>

#include "platform/Extensions.h"
#include "wire/UniqueFd.h"

namespace storix::check {

namespace {

constexpr std::string_view extensionPoint = "com.tessel.storix-nonui";

std::string quoted(std::string_view text) { return "\"" + std::string(text) + "\""; }

void checkIdentifier(const linuxhost::ExtensionBundle &bundle, Findings &findings) {
  if (!bundle.identifier) {
    findings.error("Info.kvs: \"KTBundleIdentifier\" is missing or empty; the daemon ignores the bundle.");
  } else if (bundle.identifier->find('/') != std::string::npos) {
    findings.error("Info.kvs: the \"KTBundleIdentifier\" " + quoted(*bundle.identifier) +
                   " holds a \"/\"; no bookmarkable string of its documents could be resolved.");
  } else if (!std::all_of(bundle.identifier->begin(), bundle.identifier->end(), [](char c) {
               return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
                      c == '-' || c == '_';
             })) {
    findings.advice(
        "Info.kvs: a \"KTBundleIdentifier\" of letters, digits, \".\" and \"-\" alone, such as "
        "\"org.sample.docs\", is safe in file names and on command lines.");
  }
}

void checkGroup(const linuxhost::ExtensionBundle &bundle, Findings &findings) {
  const auto extension = bundle.info.find("KTExtension");
  const Dictionary *dictionary = extension == bundle.info.end() ? nullptr : extension->second.dictionary();
  if (!dictionary) {
    findings.error("Info.kvs: \"KTExtension\" must be a dictionary that holds \"KTExtensionStorixDocumentGroup\".");
    return;
  }
  const auto found = dictionary->find("KTExtensionStorixDocumentGroup");
  const std::string *group = found == dictionary->end() ? nullptr : found->second.string();
  if (!group || group->empty()) {
    findings.error(
        "Info.kvs: \"KTExtension\" must hold the string \"KTExtensionStorixDocumentGroup\", the group in "
        "whose container the documents appear.");
  } else if (!bundle.documentGroup()) {
    findings.error("Info.kvs: the \"KTExtensionStorixDocumentGroup\" " + quoted(*group) +
                   " is not one of the bundle's \"KTGroupContainers\"; without a container the provider has no "
                   "documents.");
  }
}

/// The file to run, where there is one.
std::optional<std::string> checkExecutable(const linuxhost::ExtensionBundle &bundle, Findings &findings) {
  const auto path = bundle.executablePath();
  if (!path) {
    findings.error("Info.kvs: " + path.error().message());
    return std::nullopt;
  }
  const UniqueFd file(::open(path.value().c_str(), O_PATH | O_CLOEXEC));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0) {
    findings.error("The \"KTBundleExecutable\" " + path.value() + " cannot be opened: " + std::strerror(errno) + ".");
    return std::nullopt;
  }
  if (!S_ISREG(status.st_mode)) {
    findings.error("The \"KTBundleExecutable\" " + path.value() + " is not a file.");
    return std::nullopt;
  }
  if (::faccessat(AT_FDCWD, path.value().c_str(), X_OK, 0) != 0) {
    findings.error("The \"KTBundleExecutable\" " + path.value() + " is not executable; chmod +x it.");
    return std::nullopt;
  }
  if ((status.st_mode & S_IWOTH) != 0) {
    findings.advice("The \"KTBundleExecutable\" " + path.value() + " can be written by every user; chmod o-w it.");
  }
  return path.value();
}

}  // namespace

std::optional<CheckedBundle> checkBundle(const std::string &path, Findings &findings) {
  const UniqueFd directory(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory) {
    findings.error("The bundle " + path + " cannot be opened as a directory: " + std::strerror(errno) + ".");
    return std::nullopt;
  }
  if (!path.ends_with(linuxhost::bundleSuffix) || path.ends_with("/" + std::string(linuxhost::bundleSuffix))) {
    findings.error("The name of the bundle " + path +
                   " must end in \".appdex\"; the daemon looks at no other directories.");
  }
  auto read = linuxhost::readExtensionBundle(path);
  if (!read) {
    findings.error("Info.kvs: " + read.error().message());
    return std::nullopt;
  }
  const linuxhost::ExtensionBundle &bundle = *read.value();
  checkIdentifier(bundle, findings);
  if (bundle.extensionPoint != extensionPoint) {
    findings.error(
        "Info.kvs: the " + quoted(extensionPointAttribute) + " must be " + quoted(extensionPoint) +
        (bundle.extensionPoint.empty() ? "; it is missing." : "; it is " + quoted(bundle.extensionPoint) + "."));
  }
  if (bundle.version.empty()) {
    findings.advice(
        "Info.kvs: \"KTBundleVersion\" is missing; with a version that goes up the daemon notices that a "
        "bundle was replaced.");
  }
  checkGroup(bundle, findings);
  auto executable = checkExecutable(bundle, findings);
  if (!executable) return std::nullopt;
  return CheckedBundle{std::move(read.value()), std::move(*executable)};
}

}  // namespace storix::check
