#include "sdk/src/ClientErrors.h"

#include <utility>

#include "wire/Codec.h"

namespace storix {

bool isClientError(const SXError &error, ClientErrorCode code) {
  return error.domain() == clientErrorDomain && error.code() == static_cast<std::int64_t>(code);
}

namespace sdk {

SXError clientError(ClientErrorCode code, std::string sentence, Dictionary details) {
  details.insert_or_assign("description", std::move(sentence));
  return SXError(std::string(clientErrorDomain), static_cast<std::int64_t>(code), std::move(details));
}

SXError incompleteAnswer(std::string sentence) {
  return clientError(ClientErrorCode::incompleteAnswer, std::move(sentence));
}

SXError connectionLostError() {
  return clientError(ClientErrorCode::connectionLost,
                     "The connection to the document broker ended before the answer came.");
}

SXError clientErrorOf(const wire::MethodFailure &failure) {
  if (failure.name == wire::busErrorName::disconnected) return connectionLostError();
  return clientError(ClientErrorCode::refused, "The document broker refused the request: " + failure.text,
                     {{"name", failure.name}});
}

SXError clientErrorOf(const SXError &connectionError) {
  const auto name = connectionError.stringDetail("busError");
  return clientErrorOf(
      wire::MethodFailure{name.value_or(std::string(wire::busErrorName::disconnected)), connectionError.message()});
}

}  // namespace sdk
}  // namespace storix
