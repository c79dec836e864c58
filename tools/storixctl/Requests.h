#pragma once

#include "platform/Result.h"
#include "storix/Client.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Surroundings.h"

namespace storix::ctl {

/// Carries out a verb that is one request to the daemon, and waits for its answer.
Result<Printed> request(const Invocation &invocation, Client &client, const Surroundings &surroundings);

}  // namespace storix::ctl
