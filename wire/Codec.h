#pragma once

#include <cstddef>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Protocol.h"
#include "wire/Framing.h"
#include "wire/SdBus.h"
#include "wire/Signature.h"

namespace storix::wire {

/// A string or URL that is an argument.
inline constexpr std::size_t maximumStringSize = std::size_t{64} << 10;
/// An argument is the first level, what stands in a dictionary, a list or an error's details the next.
inline constexpr int maximumNesting = 16;

/// Names of D-Bus errors that this layer makes.
namespace busErrorName {
inline constexpr std::string_view invalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";
inline constexpr std::string_view limitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";
inline constexpr std::string_view accessDenied = "org.freedesktop.DBus.Error.AccessDenied";
inline constexpr std::string_view disconnected = "org.freedesktop.DBus.Error.Disconnected";
}  // namespace busErrorName

/// The text itself, or, where D-Bus would refuse it (it is not UTF-8, or holds a zero byte), the text with
/// every byte of it that is not ASCII written as "\xNN".
std::string busText(std::string text);

/// One side of one row of a protocol: what a message must carry, or is filled with.
struct MessageRow {
  const LinkInterface &interface;
  const OperationDescription &operation;
  const std::string &signature;
  bool ofReply;

  [[nodiscard]] const std::vector<ArgumentDescription> &arguments() const {
    return ofReply ? operation.replies : operation.arguments;
  }
};

// The four functions use the message: the mutex of its connection is held meanwhile. Whatever they read
// is copied out of it. A failure names the D-Bus error that the peer gets and says what was wrong.

/// The arguments of a message that fits the row in signature, absence, limits and permitted kinds.
std::variant<Arguments, MethodFailure> readArguments(sd_bus_message *message, const MessageRow &row);

/// Appends them. What is nested too deeply is cut, and a word in its place says so.
std::optional<MethodFailure> appendArguments(sd_bus_message *message, const MessageRow &row,
                                             const Arguments &arguments);

/// The same for interfaces that are described by hand. Descriptors are duplicated.
std::variant<MethodValues, MethodFailure> readValues(sd_bus_message *message, const std::vector<MethodArgument> &types,
                                                     const std::string &signature);
std::optional<MethodFailure> appendValues(sd_bus_message *message, const std::vector<MethodArgument> &types,
                                          const MethodValues &values);

}  // namespace storix::wire
