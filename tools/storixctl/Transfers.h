#pragma once

#include "platform/Result.h"
#include "storix/Client.h"
#include "tools/storixctl/Arguments.h"
#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Surroundings.h"

namespace storix::ctl {

/// Whether a verb moves the content of a document: open, read, cat, write. Such a verb can be
/// interrupted, and leaves no claim and no half-written file behind.
bool movesContent(const VerbDescription &verb);

/// Carries out such a verb.
Result<Printed> moveContent(const Invocation &invocation, Client &client, const Surroundings &surroundings);

}  // namespace storix::ctl
