#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/SXError.h"

namespace storix {

struct ClientOptions {
  /// The directory of the daemon's sockets. Without one: STORIX_RUNTIME_DIR, else "storix" below
  /// XDG_RUNTIME_DIR.
  std::optional<std::string> runtimeDirectory;
  /// How long a request may take. One that the daemon has not answered by then fails with `timedOut`;
  /// the daemon may carry it out all the same.
  std::chrono::milliseconds timeout{60'000};
};

/// What went wrong between this process and the daemon. What the daemon itself answers has other
/// domains (`storixErrorDomain`, `posixErrorDomain`, a provider's own).
inline constexpr std::string_view clientErrorDomain = "com.tessel.storix.client";

/// Codes in `clientErrorDomain`. Every one comes with a sentence for people (`SXError::message`).
enum class ClientErrorCode : std::int64_t {
  /// Nobody listens on the daemon's socket, or there is no runtime directory.
  notReachable = 1,
  /// The connection ended before the answer came. The request may have been carried out. For a claim
  /// on a file: it ended before its holder was done.
  connectionLost = 2,
  timedOut = 3,
  /// A D-Bus error: the request was not understood, not permitted to this process, or too big. Detail
  /// "name" is the error's name.
  refused = 4,
  /// The answer lacks what it should hold: a token that could not be issued, for instance.
  incompleteAnswer = 5,
  /// The caller gave up.
  cancelled = 6,
  /// The path names no file: it is not absolute, or holds a zero byte.
  invalidPath = 7,
  /// This process has as many claims on files as it may have.
  tooManyClaims = 8,
};

/// Whether an error is of `clientErrorDomain` and has that code.
[[nodiscard]] bool isClientError(const SXError &error, ClientErrorCode code);

}  // namespace storix
