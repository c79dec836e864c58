#pragma once

#include <string>

#include "platform/SXError.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Surroundings.h"

namespace storix::ctl {

/// Where a signal has ended it: 128 and the signal's number, as shells say it.
enum ExitStatus : int {
  done = 0,
  requestFailed = 1,
  notUnderstood = 2,
  daemonNotReachable = 3,
  /// Whoever read the output has gone, as with a program that SIGPIPE ends. Nothing is said of it.
  readerGone = 141,
};

/// Carries out one call of the program and prints its result on `out`, an error for people on `err`,
/// and with --json the error on `out` as well.
ExitStatus runCommand(const Invocation &invocation, const Surroundings &surroundings);

/// Whether it is the daemon that cannot be reached, or the request that failed.
ExitStatus exitStatusOf(const SXError &error);

/// One line for people: the error's sentence and those of its underlying errors, control characters
/// shown as "?".
std::string errorLine(const SXError &error);

}  // namespace storix::ctl
