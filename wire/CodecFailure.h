#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "wire/Codec.h"

namespace storix::wire {

// The words in which reading and writing of messages fail.

inline MethodFailure invalidArgs(std::string text) { return {std::string(busErrorName::invalidArgs), std::move(text)}; }
inline MethodFailure limitsExceeded(std::string text) {
  return {std::string(busErrorName::limitsExceeded), std::move(text)};
}

inline std::string quotedArgument(std::string_view name) { return "the argument \"" + std::string(name) + "\""; }

inline MethodFailure argumentTooLong(std::string_view name) {
  return limitsExceeded(quotedArgument(name) + " is longer than " + std::to_string(maximumStringSize) + " bytes");
}

/// The failure of an argument that holds a value of a kind that was not declared for it.
inline std::optional<MethodFailure> forbiddenKind(const MessageRow &row, std::size_t index, const Argument &argument) {
  const std::set<ValueKind> *kinds = row.interface.permittedKinds(row.operation.name, index, row.ofReply);
  if (!kinds || !argument || holdsOnlyKinds(*argument, *kinds)) return std::nullopt;
  return invalidArgs(quotedArgument(row.arguments()[index].name) +
                     " holds a value of a kind that is not permitted in it");
}

}  // namespace storix::wire
