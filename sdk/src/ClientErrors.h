#pragma once

#include <string>

#include "storix/ClientOptions.h"
#include "wire/Signature.h"

namespace storix::sdk {

SXError clientError(ClientErrorCode code, std::string sentence, Dictionary details = {});

SXError incompleteAnswer(std::string sentence);
SXError connectionLostError();

/// The error of a request that the daemon answered by a D-Bus error, or whose connection ended.
SXError clientErrorOf(const wire::MethodFailure &failure);

/// The same, for an error that the connection reports for an operation of a protocol.
SXError clientErrorOf(const SXError &connectionError);

}  // namespace storix::sdk
