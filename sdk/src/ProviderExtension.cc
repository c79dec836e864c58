#include "storix/ProviderExtension.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <utility>

#include "wire/UniqueFd.h"

namespace storix {

namespace {

std::optional<std::string> environmentVariable(const char *name) {
  const char *value = std::getenv(name);
  if (!value || !*value) return std::nullopt;
  return std::string(value);
}

bool hasPlainComponents(std::string_view path) {
  while (true) {
    const std::size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    if (component.empty() || component == "." || component == "..") return false;
    if (slash == std::string_view::npos) return true;
    path.remove_prefix(slash + 1);
  }
}

std::optional<std::string> below(const std::string &directory, const std::string &path) {
  if (path.size() <= directory.size() + 1 || !path.starts_with(directory) || path[directory.size()] != '/') {
    return std::nullopt;
  }
  std::string rest = path.substr(directory.size() + 1);
  return hasPlainComponents(rest) ? std::optional(std::move(rest)) : std::nullopt;
}

/// Whether the path leads nowhere but below the directory, as far as there is anything: the kernel tells
/// in one look, whatever comes and goes meanwhile.
bool staysBelow(const std::string &directory, const std::string &path) {
  const UniqueFd from(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!from) return false;
  open_how how{};
  how.flags = O_PATH | O_CLOEXEC;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
  for (;;) {
    const UniqueFd there(static_cast<int>(::syscall(SYS_openat2, from.get(), path.c_str(), &how, sizeof how)));
    if (there) return true;
    if (errno != EINTR && errno != EAGAIN) return errno == ENOENT;
  }
}

/// As `std::filesystem::weakly_canonical`, which fails when something that it has seen is gone before it
/// has resolved it.
std::filesystem::path resolvedAsFarAsThere(const std::string &path, std::error_code &failed) {
  constexpr int mostTries = 100;
  std::filesystem::path resolved;
  for (int tries = 0; tries < mostTries; ++tries) {
    resolved = std::filesystem::weakly_canonical(path, failed);
    if (failed != std::errc::no_such_file_or_directory) break;
  }
  return resolved;
}

}  // namespace

ProviderEnvironment ProviderEnvironment::ofThisProcess() {
  return {environmentVariable("STORIX_BUNDLE_PATH").value_or(""), environmentVariable("STORIX_GROUP_CONTAINER")};
}

void ProviderExtension::performInitialSetup(Completion completion) {
  const auto url = providedItemsURL();
  if (!url) return completion(posixError(ENOENT, "looking for the group container of " + environment_.bundlePath));
  std::error_code failed;
  std::filesystem::create_directories(url->path(), failed);
  if (failed) return completion(posixError(failed.value(), "making the directory " + url->path()));
  completion(std::nullopt);
}

void ProviderExtension::providePlaceholder(const URL &url, URLCompletion completion) {
  completion(posixError(ENOTSUP, "making a placeholder for " + url.absoluteString()));
}

void ProviderExtension::itemChanged(const URL & /*url*/, Completion completion) { completion(std::nullopt); }

void ProviderExtension::stopProviding(const URL & /*url*/, Completion completion) { completion(std::nullopt); }

void ProviderExtension::itemIdentifier(const URL &url, IdentifierCompletion completion) {
  if (auto path = relativePath(url)) return completion(std::move(*path));
  completion(posixError(EINVAL, "looking for a document of this provider at " + url.absoluteString()));
}

void ProviderExtension::itemURL(const std::string &identifier, URLCompletion completion) {
  const auto directory = providedItemsURL();
  if (!directory)
    return completion(posixError(ENOENT, "looking for the group container of " + environment_.bundlePath));
  if (!hasPlainComponents(identifier) || identifier.find('\0') != std::string::npos) {
    return completion(posixError(EINVAL, "taking \"" + identifier + "\" for the relative path of a document"));
  }
  completion(directory->appendingPathComponent(identifier));
}

std::optional<URL> ProviderExtension::providedItemsURL() const {
  if (!environment_.groupContainer) return std::nullopt;
  const auto container = URL::fileURLWithPath(*environment_.groupContainer, true);
  if (!container) return std::nullopt;
  return container->appendingPathComponent("Storix Storage", true);
}

std::optional<std::string> ProviderExtension::relativePath(const URL &url) const {
  const auto directory = providedItemsURL();
  if (!directory) return std::nullopt;
  auto asItStands = below(directory->path(), url.path());
  if (asItStands && staysBelow(directory->path(), *asItStands)) return asItStands;
  std::error_code failed;
  const auto resolvedDirectory = std::filesystem::canonical(directory->path(), failed);
  // A directory that is not there yet holds no link.
  if (failed == std::errc::no_such_file_or_directory) return asItStands;
  if (failed) return std::nullopt;
  const auto resolved = resolvedAsFarAsThere(url.path(), failed);
  if (failed) return std::nullopt;
  auto resolvedPath = below(resolvedDirectory.string(), resolved.string());
  return resolvedPath && asItStands ? asItStands : resolvedPath;
}

}  // namespace storix
