#include "platform/linux/identity/Confinement.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <string_view>
#include <system_error>

#include "platform/linux/identity/ProcessFiles.h"

namespace storix::linuxhost {
namespace {

constexpr std::size_t statusLimit = 64 * 1024;
constexpr int seccompStrict = 1;
constexpr int seccompWithFilters = 2;

/// The number behind "<name>:" at the start of a line.
std::optional<int> statusNumber(std::string_view status, std::string_view name) {
  const std::string start = "\n" + std::string(name) + ":";
  const std::size_t at = status.find(start);
  if (at == std::string_view::npos) return std::nullopt;
  std::string_view text = status.substr(at + start.size());
  text.remove_prefix(std::min(text.find_first_not_of(" \t"), text.size()));
  int number = 0;
  const auto result = std::from_chars(text.data(), text.data() + text.size(), number);
  if (result.ec != std::errc()) return std::nullopt;
  return number;
}

std::optional<std::pair<dev_t, ino_t>> namespaceOf(int processDirectory, const char *link) {
  struct stat status {};
  if (::fstatat(processDirectory, link, &status, 0) != 0) return std::nullopt;
  return std::pair(status.st_dev, status.st_ino);
}

std::optional<std::string> securityLabelOf(int processDirectory) {
  std::optional<std::string> label = readSmallFile(processDirectory, "attr/current", statusLimit);
  // So answers a kernel that has no security module with labels.
  if (!label && (errno == EINVAL || errno == ENOENT || errno == EOPNOTSUPP)) label.emplace();
  return label;
}

}  // namespace

std::optional<ProcessRestrictions> readRestrictions(int processDirectory) {
  const std::optional<std::string> status = readSmallFile(processDirectory, "status", statusLimit);
  if (!status) return std::nullopt;
  const std::optional<int> noNewPrivileges = statusNumber(*status, "NoNewPrivs");
  const auto mountNamespace = namespaceOf(processDirectory, "ns/mnt");
  const auto userNamespace = namespaceOf(processDirectory, "ns/user");
  std::optional<std::string> label = securityLabelOf(processDirectory);
  if (!noNewPrivileges || !mountNamespace || !userNamespace || !label) return std::nullopt;

  ProcessRestrictions restrictions;
  restrictions.noNewPrivileges = *noNewPrivileges != 0;
  // A kernel without seccomp has no such line.
  restrictions.seccompMode = statusNumber(*status, "Seccomp").value_or(0);
  restrictions.seccompFilters = statusNumber(*status, "Seccomp_filters");
  restrictions.mountNamespace = *mountNamespace;
  restrictions.userNamespace = *userNamespace;
  restrictions.securityLabel = *std::move(label);
  return restrictions;
}

bool isConfined(const std::optional<ProcessRestrictions> &process, const std::optional<ProcessRestrictions> &own) {
  if (!process || !own) return true;
  if (process->noNewPrivileges) return true;
  if (process->mountNamespace != own->mountNamespace || process->userNamespace != own->userNamespace) return true;
  if (process->securityLabel != own->securityLabel) return true;
  if (process->seccompMode == seccompStrict) return true;
  if (process->seccompMode != seccompWithFilters) return false;
  if (own->seccompMode != seccompWithFilters) return true;
  return !process->seccompFilters || !own->seccompFilters || *process->seccompFilters > *own->seccompFilters;
}

}  // namespace storix::linuxhost
