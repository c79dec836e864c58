#pragma once

#include <string>

#include "platform/Result.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Printed.h"

namespace storix::ctl {

/// What the access-control file below the home directory holds, in the file's order. Changes nothing
/// and asks no daemon. The error says what to do when there is no file, or it cannot be understood.
Result<Printed> grants(const Invocation &invocation, const std::string &homeDirectory, bool forTerminal);

}  // namespace storix::ctl
