#pragma once

#include "platform/Result.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Surroundings.h"

namespace storix::ctl {

/// Carries out "check-extension". What the provider prints goes to the surroundings' `err`, each line with
/// "provider: " in front. The error says why nothing could be checked.
Result<Printed> checkBundle(const Invocation &invocation, const Surroundings &surroundings);

}  // namespace storix::ctl
