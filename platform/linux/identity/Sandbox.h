#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/PlatformServices.h"
#include "platform/linux/identity/Peers.h"
#include "platform/linux/identity/Tokens.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// Why a request to the sandbox interface failed: the kind becomes the name of the D-Bus error, the
/// text its message.
struct SandboxFailure {
  enum class Kind { invalidToken, notAFile, noProof, limitExceeded, unavailable };
  Kind kind;
  std::string text;
};

/// The files that one platform connection has proved it may write. Made by `Sandbox::proofsOf`, owned
/// by the connection; the proofs count for the connection's process until this is destroyed.
class WriteProofs {
 public:
  virtual ~WriteProofs() = default;
  /// None when the descriptor proves it: opened for writing, of a regular file that has a name.
  [[nodiscard]] virtual std::optional<SandboxFailure> proveWriteAccess(UniqueFd fd) = 0;
};

/// Decides what a peer may write, and hands out and takes back the tokens that open a document.
/// Owned by the platform object; thread-safe; `WriteProofs` may outlive it.
class Sandbox {
 public:
  /// Distinct files that one connection, and all of them together, may have proved. Each holds a
  /// descriptor, so that no other file can come by its inode number meanwhile.
  static constexpr std::size_t proofsPerConnection = 256;
  static constexpr std::size_t proofsAltogether = 1024;

  /// `groupContainers` is the directory that holds the group containers; it need not exist yet. The
  /// error says what is wrong with the key in the runtime directory.
  static Result<std::unique_ptr<Sandbox>> create(std::shared_ptr<const PeerTable> peers,
                                                 const std::string &runtimeDirectory, std::string groupContainers);

  /// `PlatformServices::checkSandboxAccess`.
  int checkAccess(const AuditToken &token, std::string_view operation, SandboxFilter filter,
                  const std::string &path) const;

  /// `PlatformServices::issueSandboxExtension`. None for what is not below a group container once
  /// symbolic links are resolved, and for what is there and is no regular file.
  std::optional<std::string> issueExtension(SandboxExtensionClass extensionClass, const std::string &path,
                                            std::uint32_t flags) const;

  /// Opens the document that the token names, for reading and writing.
  std::variant<UniqueFd, SandboxFailure> consume(std::string_view token) const;

  std::unique_ptr<WriteProofs> proofsOf(std::shared_ptr<const Peer> peer);

 private:
  class ProofTable;
  class ConnectionProofs;

  Sandbox(std::shared_ptr<const PeerTable> peers, const TokenSealer &sealer, std::string groupContainers);

  std::shared_ptr<const PeerTable> peers_;
  TokenSealer sealer_;
  std::string groupContainers_;
  std::shared_ptr<ProofTable> proofs_;
};

}  // namespace storix::linuxhost
