#include "platform/linux/identity/PeerIdentity.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/FlatpakInfo.h"
#include "platform/linux/identity/ProcessFiles.h"
#include "platform/linux/identity/UnitNames.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr std::size_t sandboxInfoLimit = 1024 * 1024;
constexpr std::size_t cgroupLimit = 64 * 1024;

enum class Sandboxed { no, yes, unknown };

Sandboxed readSandboxInfo(int processDirectory, PeerIdentity &identity) {
  const UniqueFd root(::openat(processDirectory, "root", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!root) return Sandboxed::unknown;
  const std::optional<std::string> text = readSmallFile(root.get(), ".flatpak-info", sandboxInfoLimit);
  if (!text) return errno == ENOENT ? Sandboxed::no : Sandboxed::unknown;
  std::optional<FlatpakInfo> info = parseFlatpakInfo(*text);
  if (!info) return Sandboxed::unknown;
  identity.bundleIdentifier = std::move(info->applicationName);
  identity.entitlements = std::move(info->entitlements);
  return Sandboxed::yes;
}

}  // namespace

PeerIdentity readIdentity(int processDirectory, ApplicationManifests &manifests) {
  PeerIdentity identity;
  if (readSandboxInfo(processDirectory, identity) != Sandboxed::no) return identity;

  std::optional<ApplicationManifest> manifest;
  struct stat program {};
  if (::fstatat(processDirectory, "exe", &program, 0) == 0) {
    manifest = manifests.manifestForExecutable(program.st_dev, program.st_ino);
  }
  if (manifest) {
    identity.bundleIdentifier = std::move(manifest->bundleIdentifier);
  } else if (const std::optional<std::string> cgroup = readSmallFile(processDirectory, "cgroup", cgroupLimit)) {
    identity.bundleIdentifier = applicationIdentifierFromCgroup(*cgroup);
    if (identity.bundleIdentifier) manifest = manifests.manifestForIdentifier(*identity.bundleIdentifier);
  }
  if (manifest) identity.entitlements = std::move(manifest->entitlements);
  return identity;
}

}  // namespace storix::linuxhost
