#pragma once

#include <string>

#include "platform/SXError.h"

namespace storix::ctl {

/// The error with a sentence after its own that tells what to do about it.
SXError withAdvice(const SXError &error, const std::string &advice);

/// What to do when a bookmarkable string could not be resolved.
SXError adviseOnResolving(const SXError &error, const std::string &bookmarkableString);

/// What to do when the daemon cannot be reached; other errors stay as they are.
SXError adviseOnReaching(const SXError &error);

}  // namespace storix::ctl
