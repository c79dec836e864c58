#include "platform/linux/identity/Sandbox.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <mutex>
#include <vector>

#include "platform/linux/files/PathText.h"
#include "platform/linux/files/ResolvedPath.h"

namespace storix::linuxhost {
namespace {

using FileIdentity = std::pair<dev_t, ino_t>;

constexpr mode_t companionMode = 0600;

SandboxFailure failure(SandboxFailure::Kind kind, std::string text) { return {kind, std::move(text)}; }

SandboxFailure unavailable(int error, std::string_view doing) {
  return failure(SandboxFailure::Kind::unavailable, posixError(error, doing).message());
}

/// Opens without following any symbolic link; for reading and writing, and without waiting.
int openDocument(const std::string &path, std::uint64_t flags) {
  open_how how{};
  how.flags = O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | flags;
  how.mode = flags & O_CREAT ? companionMode : 0;
  how.resolve = RESOLVE_NO_SYMLINKS;
  return static_cast<int>(::syscall(SYS_openat2, AT_FDCWD, path.c_str(), &how, sizeof how));
}

bool isCompanionName(std::string_view path) { return path.substr(path.rfind('/') + 1).starts_with('.'); }

}  // namespace

/// Who has proved what. A process is known by its number as long as the peer that proved it lives.
class Sandbox::ProofTable {
 public:
  struct Holder {
    std::shared_ptr<const Peer> peer;
    /// Each with a descriptor that keeps its inode number from being given away.
    std::map<FileIdentity, UniqueFd> files;
  };

  Holder *add(std::shared_ptr<const Peer> peer) {
    const std::lock_guard lock(mutex_);
    const pid_t process = peer->processIdentifier();
    auto holder = std::make_unique<Holder>();
    holder->peer = std::move(peer);
    return holders_.emplace(process, std::move(holder))->second.get();
  }

  void remove(Holder *holder) {
    std::unique_ptr<Holder> removed;
    const std::lock_guard lock(mutex_);
    const auto [first, last] = holders_.equal_range(holder->peer->processIdentifier());
    const auto found = std::find_if(first, last, [holder](const auto &entry) { return entry.second.get() == holder; });
    if (found == last) return;
    fileCount_ -= holder->files.size();
    removed = std::move(found->second);
    holders_.erase(found);
  }

  /// False when a limit is reached.
  bool insert(Holder *holder, const FileIdentity &file, UniqueFd pin) {
    const std::lock_guard lock(mutex_);
    if (holder->files.contains(file)) return true;
    if (holder->files.size() >= proofsPerConnection || fileCount_ >= proofsAltogether) return false;
    holder->files.emplace(file, std::move(pin));
    ++fileCount_;
    return true;
  }

  bool hasProved(pid_t process, const FileIdentity &file) const {
    const std::lock_guard lock(mutex_);
    const auto [first, last] = holders_.equal_range(process);
    return std::any_of(first, last, [&file](const auto &entry) {
      return entry.second->files.contains(file) && entry.second->peer->isAlive();
    });
  }

 private:
  mutable std::mutex mutex_;
  std::multimap<pid_t, std::unique_ptr<Holder>> holders_;
  std::size_t fileCount_ = 0;
};

class Sandbox::ConnectionProofs : public WriteProofs {
 public:
  ConnectionProofs(std::shared_ptr<ProofTable> table, std::shared_ptr<const Peer> peer)
      : table_(std::move(table)), holder_(table_->add(std::move(peer))) {}
  ~ConnectionProofs() override { table_->remove(holder_); }
  ConnectionProofs(const ConnectionProofs &) = delete;
  ConnectionProofs &operator=(const ConnectionProofs &) = delete;

  std::optional<SandboxFailure> proveWriteAccess(UniqueFd fd) override {
    const auto noProof = [](std::string text) {
      return failure(SandboxFailure::Kind::noProof, "The descriptor proves nothing: " + std::move(text));
    };
    const int flags = ::fcntl(fd.get(), F_GETFL);
    struct stat status {};
    if (flags < 0 || ::fstat(fd.get(), &status) != 0) return noProof("it is not open.");
    if ((flags & O_PATH) != 0 || (flags & O_ACCMODE) == O_RDONLY) return noProof("it is not open for writing.");
    if (!S_ISREG(status.st_mode)) return noProof("it is not a regular file's.");
    if (status.st_nlink == 0) return noProof("its file has no name any more.");
    // What is kept must not keep the file open for writing.
    UniqueFd pin(::open(("/proc/self/fd/" + std::to_string(fd.get())).c_str(), O_PATH | O_CLOEXEC));
    if (!pin) return unavailable(errno, "Cannot keep the proof");
    if (table_->insert(holder_, {status.st_dev, status.st_ino}, std::move(pin))) return std::nullopt;
    return failure(SandboxFailure::Kind::limitExceeded, "Too many files are proved already. Close the connection.");
  }

 private:
  std::shared_ptr<ProofTable> table_;
  ProofTable::Holder *holder_;
};

Result<std::unique_ptr<Sandbox>> Sandbox::create(std::shared_ptr<const PeerTable> peers,
                                                 const std::string &runtimeDirectory, std::string groupContainers) {
  Result<TokenSealer> sealer = TokenSealer::open(runtimeDirectory);
  if (!sealer) return sealer.error();
  return std::unique_ptr<Sandbox>(new Sandbox(std::move(peers), sealer.value(), std::move(groupContainers)));
}

Sandbox::Sandbox(std::shared_ptr<const PeerTable> peers, const TokenSealer &sealer, std::string groupContainers)
    : peers_(std::move(peers)),
      sealer_(sealer),
      groupContainers_(std::move(groupContainers)),
      proofs_(std::make_shared<ProofTable>()) {}

int Sandbox::checkAccess(const AuditToken &token, std::string_view operation, SandboxFilter,
                         const std::string &path) const {
  constexpr int refused = 1;
  if (operation != "file-write-data" || path.find('\0') != std::string::npos) return refused;
  const std::shared_ptr<Peer> peer = peers_->find(token);
  if (!peer) return refused;
  struct stat status {};
  bool allowed = ::stat(path.c_str(), &status) == 0 &&
                 proofs_->hasProved(peer->processIdentifier(), {status.st_dev, status.st_ino});
  if (!allowed && !peer->isConfined()) {
    allowed = ::faccessat(AT_FDCWD, path.c_str(), W_OK, AT_EACCESS) == 0;
  }
  // Last, so that the number of the process was still its own when it was compared.
  return allowed && peer->isAlive() ? 0 : refused;
}

std::optional<std::string> Sandbox::issueExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                                   std::uint32_t) const {
  const auto refused = [&path](std::string_view why) -> std::optional<std::string> {
    sx_default_log().info("[INFO] No token for %@: %@", path, why);
    return std::nullopt;
  };
  const std::optional<std::string> containers = resolveExistingPath(groupContainers_);
  if (!containers) return refused("there is no group container");
  const std::optional<ResolvedPath> resolved = resolvePath(path);
  if (!resolved) return refused(posixError(errno, "it cannot be looked at").message());
  const std::optional<std::string_view> below = pathBelow(*containers, resolved->path);
  // The containers' directory holds containers, and they hold documents.
  if (!below || below->find('/') == std::string_view::npos) return refused("it is in no group container");
  if (resolved->exists) {
    struct stat status {};
    if (::lstat(resolved->path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
      return refused("it is not a regular file");
    }
  }
  return sealer_.seal({extensionClass, resolved->path});
}

std::variant<UniqueFd, SandboxFailure> Sandbox::consume(std::string_view token) const {
  const std::optional<TokenPayload> payload = sealer_.unseal(token);
  if (!payload) {
    return failure(SandboxFailure::Kind::invalidToken,
                   "The token was not made here, or before the system was last started. Ask for a new one.");
  }
  UniqueFd fd(openDocument(payload->path, 0));
  if (!fd && errno == ENOENT && isCompanionName(payload->path)) fd.reset(openDocument(payload->path, O_CREAT));
  if (!fd) {
    const int error = errno;
    if (error == EISDIR || error == ENXIO || error == ELOOP) {
      return failure(SandboxFailure::Kind::notAFile, quotedPath(payload->path) + " is not a regular file.");
    }
    return unavailable(error, "Cannot open " + quotedPath(payload->path));
  }
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return failure(SandboxFailure::Kind::notAFile, quotedPath(payload->path) + " is not a regular file.");
  }
  // Only the opening was not to wait.
  const int flags = ::fcntl(fd.get(), F_GETFL);
  if (flags < 0 || ::fcntl(fd.get(), F_SETFL, flags & ~O_NONBLOCK) != 0) {
    return unavailable(errno, "Cannot open " + quotedPath(payload->path));
  }
  return fd;
}

std::unique_ptr<WriteProofs> Sandbox::proofsOf(std::shared_ptr<const Peer> peer) {
  return std::make_unique<ConnectionProofs>(proofs_, std::move(peer));
}

}  // namespace storix::linuxhost
