#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "platform/Executor.h"
#include "platform/FileCoordination.h"
#include "platform/linux/identity/Peers.h"

namespace storix::linuxhost {

/// Names a claim on a file to the connection that has it. Never 0, and never used twice.
using ClaimIdentifier = std::uint64_t;

/// Why the coordination service itself refuses: the kind becomes the name of the D-Bus error, the text
/// its message.
struct CoordinationFailure {
  enum class Kind { noSuchClaim, busy, unavailable };
  Kind kind;
  std::string text;
};

/// The claim, or the error that the provider of the file answered, or the service's own refusal.
using ClaimOutcome = std::variant<ClaimIdentifier, SXError, CoordinationFailure>;
/// Runs once, on a thread of the executor, never inside the call that takes it; not at all when the
/// connection has ended before.
using ClaimHandler = std::function<void(ClaimOutcome)>;

/// The claims of one platform connection. Made by `FileCoordination::claimsOf`, owned by the
/// connection; destroying it ends all of them, the waiting ones included. Thread-safe; may outlive
/// the service, and then does nothing.
class FileClaims {
 public:
  virtual ~FileClaims() = default;

  /// A shared claim. For a file of a provider that is once the provider has provided it.
  virtual void beginRead(const URL &url, std::optional<std::string> readerID, ClaimHandler handler) = 0;
  /// An exclusive claim.
  virtual void beginWrite(const URL &url, std::optional<std::string> writerID, ClaimHandler handler) = 0;

  /// None when the claim was this connection's, of that kind, and has ended now.
  [[nodiscard]] virtual std::optional<CoordinationFailure> endRead(ClaimIdentifier claim) = 0;
  /// As `endRead`; the provider of the file hears of the write.
  [[nodiscard]] virtual std::optional<CoordinationFailure> endWrite(ClaimIdentifier claim) = 0;
};

/// The cross-process file coordination service. Owned by the platform object; thread-safe. It holds no
/// lock while it calls a provider or a handler.
///
///  1. A claim waits for every conflicting claim that came before it, held or waiting; so nobody
///     overtakes. Claims conflict when one of them is exclusive and their paths, symbolic links
///     resolved, are the same or one lies below the other.
///  2. A read of a file below a provider's directory asks the provider first, and counts as having come
///     when the provider has answered. Readers that come meanwhile for the same file get that answer.
///  3. A provider's own process never causes a callback, nor does the provided-items directory itself.
///  4. A provider that is withdrawn hears of nothing that was on its way to it: readers get their claim
///     as for any other file. One that lets go of a question unanswered has failed.
class FileCoordination : public FileCoordinationService {
 public:
  /// Claims that one connection may hold or wait for.
  static constexpr std::size_t claimsPerConnection = 4096;
  /// Path components that the claims of all connections may have together.
  static constexpr std::size_t componentsAltogether = std::size_t{1} << 18;

  /// Whether that is the number of a process of the extension that is the provider with that identifier:
  /// of a child that has not been waited for, so that the number means no other process.
  using IsProviderProcess = std::function<bool(const std::string &providerIdentifier, pid_t process)>;

  /// `executor` must outlive the service.
  FileCoordination(Executor &executor, IsProviderProcess isProviderProcess);
  ~FileCoordination() override;

  void addProvider(std::shared_ptr<KTStorix> provider) override;
  /// Waits for a callback that is being made on another thread, except inside one of the provider's own.
  void removeProvider(const std::shared_ptr<KTStorix> &provider) override;

  /// The claims of a new connection. Without a peer every provider is asked.
  std::unique_ptr<FileClaims> claimsOf(std::shared_ptr<const Peer> peer);

 private:
  class State;
  class ConnectionClaims;

  std::shared_ptr<State> state_;
};

}  // namespace storix::linuxhost
