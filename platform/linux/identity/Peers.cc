#include "platform/linux/identity/Peers.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>

#include <cerrno>
#include <map>
#include <mutex>

#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/PeerIdentity.h"

namespace storix::linuxhost {
namespace {

/// Not in the headers of every system that this is built on.
constexpr int peerPidfdOption = 77;

bool isRunning(int pidfd) {
  pollfd process{pidfd, POLLIN, 0};
  int ready = 0;
  do {
    ready = ::poll(&process, 1, 0);
  } while (ready < 0 && errno == EINTR);
  return ready == 0;
}

/// Pins the process that connected. The second way has a gap in which the process may have ended and
/// another one got its number; a kernel that has the first way has none.
Result<UniqueFd> pinPeer(int socket, pid_t process) {
  int pidfd = -1;
  socklen_t length = sizeof pidfd;
  if (::getsockopt(socket, SOL_SOCKET, peerPidfdOption, &pidfd, &length) == 0) return UniqueFd(pidfd);
  if (errno == ENOPROTOOPT) pidfd = static_cast<int>(::syscall(SYS_pidfd_open, process, 0));
  if (pidfd < 0) return posixError(errno, "Cannot pin the process " + std::to_string(process));
  return UniqueFd(pidfd);
}

SXError goneError(pid_t process) {
  return posixError(ESRCH, "Cannot tell who connected as process " + std::to_string(process));
}

}  // namespace

struct PeerTable::State {
  std::mutex mutex;
  std::uint64_t nextSerial = 1;
  std::map<std::uint64_t, std::weak_ptr<Peer>> peers;
};

bool Peer::isAlive() const { return isRunning(pidfd_.get()); }

std::optional<Value> Peer::entitlement(std::string_view name) const {
  const auto found = entitlements_.find(name);
  return found == entitlements_.end() ? std::nullopt : std::optional(found->second);
}

PeerTable::PeerTable(std::shared_ptr<ApplicationManifests> manifests, uid_t user)
    : manifests_(std::move(manifests)), user_(user), state_(std::make_shared<State>()) {
  const UniqueFd self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (self) own_ = readRestrictions(self.get());
}

Result<std::shared_ptr<Peer>> PeerTable::admit(int socket) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
    return posixError(errno, "Cannot tell who connected");
  }
  if (credentials.uid != user_) {
    return posixError(EACCES, "The user " + std::to_string(credentials.uid) + " may not connect");
  }
  // Zero stands for a process of another world of process identifiers.
  if (credentials.pid <= 0) return goneError(credentials.pid);
  Result<UniqueFd> pidfd = pinPeer(socket, credentials.pid);
  if (!pidfd) return pidfd.error();

  // Alive after the directory was opened: it is this process's, and stays so. Alive after all was
  // read: what was read is what the process was.
  const std::string path = "/proc/" + std::to_string(credentials.pid);
  const UniqueFd directory(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!directory || !isRunning(pidfd.value().get())) return goneError(credentials.pid);
  PeerIdentity identity = readIdentity(directory.get(), *manifests_);
  const std::optional<ProcessRestrictions> restrictions = readRestrictions(directory.get());
  if (!isRunning(pidfd.value().get())) return goneError(credentials.pid);

  const std::lock_guard lock(state_->mutex);
  const std::uint64_t serial = state_->nextSerial++;
  const std::shared_ptr<Peer> peer(new Peer, [state = state_, serial](Peer *gone) {
    {
      const std::lock_guard stateLock(state->mutex);
      state->peers.erase(serial);
    }
    delete gone;
  });
  peer->pidfd_ = std::move(pidfd.value());
  peer->processIdentifier_ = credentials.pid;
  peer->auditToken_.words[0] = static_cast<std::uint32_t>(serial);
  peer->auditToken_.words[1] = static_cast<std::uint32_t>(serial >> 32);
  peer->auditToken_.words[2] = static_cast<std::uint32_t>(credentials.pid);
  peer->bundleIdentifier_ = std::move(identity.bundleIdentifier);
  peer->entitlements_ = std::move(identity.entitlements);
  peer->confined_ = isConfined(restrictions, own_);
  state_->peers.emplace(serial, peer);
  return peer;
}

std::shared_ptr<Peer> PeerTable::find(const AuditToken &token) const {
  const std::uint64_t serial = token.words[0] | std::uint64_t{token.words[1]} << 32;
  std::shared_ptr<Peer> peer;
  {
    const std::lock_guard lock(state_->mutex);
    const auto found = state_->peers.find(serial);
    if (found != state_->peers.end()) peer = found->second.lock();
  }
  return peer && peer->auditToken() == token ? peer : nullptr;
}

}  // namespace storix::linuxhost
