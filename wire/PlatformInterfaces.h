#pragma once

#include "wire/Signature.h"

namespace storix::wire {

/// The interfaces of the socket "com.tessel.Platform", for the host that serves them and for the SDK
/// that calls them. The enumerators are the positions of the methods.
inline constexpr std::string_view platformObjectPath = "/com/tessel/Platform";

enum FileCoordinationMethod : std::size_t { beginReadMethod, endReadMethod, beginWriteMethod, endWriteMethod };
const InterfaceDescription &fileCoordinationInterface();

enum SandboxMethod : std::size_t { consumeMethod, proveWriteAccessMethod };
const InterfaceDescription &sandboxInterface();

enum NotificationsMethod : std::size_t { postMethod };
const InterfaceDescription &notificationsInterface();

/// Names of the D-Bus errors by which these interfaces fail.
namespace platformError {
inline constexpr std::string_view invalidToken = "com.tessel.Platform.Error.InvalidToken";
inline constexpr std::string_view notAFile = "com.tessel.Platform.Error.NotAFile";
inline constexpr std::string_view noProof = "com.tessel.Platform.Error.NoProof";
inline constexpr std::string_view noSuchClaim = "com.tessel.Platform.Error.NoSuchClaim";
inline constexpr std::string_view busy = "com.tessel.Platform.Error.Busy";
inline constexpr std::string_view unavailable = "com.tessel.Platform.Error.Unavailable";
}  // namespace platformError

}  // namespace storix::wire
