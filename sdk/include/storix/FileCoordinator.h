#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string_view>

#include "platform/Result.h"
#include "platform/SXError.h"
#include "platform/URL.h"
#include "storix/ClientOptions.h"
#include "storix/FileClaim.h"

namespace storix {

/// Claims on files, so that processes read and write them in turn. A claim for reading is shared and
/// makes the file's provider put the content there; one for writing is exclusive, and the provider
/// hears when it ends. Claims conflict when one of them is for writing and they are for the same file,
/// or one is for a directory that the other lies in; they are held in the order in which they came.
/// Any absolute file URL will do, whether or not a provider owns it and the file exists.
///
/// Thread-safe. Make one and keep it. Each request has two forms. The one with a handler returns at
/// once; the handler runs exactly once, on the coordinator's own thread, never inside the call, and
/// must neither wait for long nor throw. The other waits; on the coordinator's own thread it gives the
/// error EDEADLK. When the coordinator is destroyed, requests without an answer get `connectionLost`
/// before that returns (or, where a handler destroys it, soon after), and its claims are lost.
///
/// A daemon that has just been started knows no providers yet, and would take their files for
/// anybody's; so the first claim waits until the daemon answers requests, which is when it has found
/// them. In an extension's own process nothing waits for that.
///
/// A process that waits for a claim that conflicts with one of its own waits for itself: give a
/// deadline. Errors: what the provider answered to a read; `cancelled`; `timedOut`; `notReachable`;
/// `connectionLost`; `tooManyClaims`; and `refused` with the name
/// "com.tessel.Platform.Error.Unavailable" (the path cannot be followed: a loop of symbolic links, for
/// instance) or ".Busy" (the daemon has too many claims).
///
/// A claim that is still waiting cannot be taken back on the daemon's wire but by ending its
/// connection, and until then it would hold up everyone behind it. So every claim has a connection to
/// itself, as long as there are fewer than `connectionsAtMost`, and giving up closes it. That also
/// keeps the end of one claim from queuing behind others that wait. A connection costs the daemon some
/// 16 KiB, a descriptor, and one of the 1,024 that it accepts; a few without claims are kept for the
/// next. Where there are more claims than that they share connections: one that was given up ends as
/// soon as it comes, and its connection closes when no claim on it is wanted any more.
class FileCoordinator {
 public:
  static constexpr std::size_t connectionsAtMost = 32;
  static constexpr std::size_t claimsAtMost = 4096;

  using ClaimHandler = std::function<void(Result<FileClaim>)>;

  /// `options.timeout` is for what does not wait for others: connecting, and ending a claim.
  explicit FileCoordinator(ClientOptions options = {});
  ~FileCoordinator();
  FileCoordinator(const FileCoordinator &) = delete;
  FileCoordinator &operator=(const FileCoordinator &) = delete;

  /// Claims the file for reading. Held once the provider has put its content there.
  void read(const URL &file, ClaimOptions options, ClaimHandler handler);
  [[nodiscard]] Result<FileClaim> read(const URL &file, ClaimOptions options = {});

  /// Claims the file for writing. Does not ask the provider for the content: read before, where the
  /// old content is to be kept.
  void write(const URL &file, ClaimOptions options, ClaimHandler handler);
  [[nodiscard]] Result<FileClaim> write(const URL &file, ClaimOptions options = {});

  /// The URL of a path, which must be absolute; else `invalidPath`.
  [[nodiscard]] static Result<URL> fileURL(std::string_view path);

 private:
  class Implementation;
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace storix
