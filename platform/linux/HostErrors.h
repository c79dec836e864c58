#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/SXError.h"

namespace storix::linuxhost {

inline constexpr std::string_view platformErrorDomain = "com.tessel.platform";

/// Codes in `platformErrorDomain`: what went wrong on this host where the operating system itself has
/// no errno for it. Never renumber.
enum class HostErrorCode : std::int64_t {
  noExecutable = 1,      ///< the bundle names none, or one outside of itself
  extensionExited = 2,   ///< the extension's process ended by itself
  extensionKilled = 3,   ///< a signal ended it
  loginTimedOut = 4,     ///< it did not finish its login in time
  connectionClosed = 5,  ///< its connection ended, or never became one
  startingTooOften = 6,  ///< it failed so often that it is left alone for a while
  hostEnding = 7,        ///< the daemon is about to end
  cannotStart = 9,       ///< what the daemon needs in order to start cannot be used; the text says what to do
  cannotConfine = 11,    ///< extensions may only run confined, and that does not work here
  notGranted = 12,       ///< an extension asks for a place that it may not have
  tooManyRequests = 13,  ///< too many wait for the start of an extension already
  noAnswer = 10,         ///< a provider let go of a question without answering it
};

/// An error of this host, with a sentence for people.
inline SXError hostError(HostErrorCode code, std::string description) {
  return SXError(std::string(platformErrorDomain), static_cast<std::int64_t>(code),
                 {{"description", Value(std::move(description))}});
}

/// The program of an extension cannot be run.
inline SXError programError(int errorNumber, const std::string &executable, const std::string &extension) {
  return posixError(errorNumber, "The program " + executable + " of the extension " + extension + " could not be run");
}

}  // namespace storix::linuxhost
