#pragma once

#include <string>

#include "storix/Client.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Surroundings.h"

namespace storix::ctl {

enum ExitStatus : int { done = 0, requestFailed = 1, notUnderstood = 2, daemonNotReachable = 3 };

/// Carries out one call of the program and prints its result on `out`, an error for people on `err`,
/// and with --json the error on `out` as well.
ExitStatus runCommand(const Invocation &invocation, Client &client, Surroundings &surroundings);

/// Whether it is the daemon that cannot be reached, or the request that failed.
ExitStatus exitStatusOf(const SXError &error);

/// One line for people: the error's sentence and those of its underlying errors, control characters
/// shown as "?".
std::string errorLine(const SXError &error);

}  // namespace storix::ctl
