#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Protocol.h"
#include "platform/SXError.h"
#include "wire/UniqueFd.h"

namespace storix::wire {

/// One argument of a method as D-Bus has it.
struct MethodArgument {
  std::string_view name;
  std::string_view type;
};

struct MethodDescription {
  MethodDescription(std::string_view methodName, std::vector<MethodArgument> inArguments,
                    std::vector<MethodArgument> outArguments);

  std::string_view name;
  std::vector<MethodArgument> in;
  std::vector<MethodArgument> out;
  std::string inSignature;
  std::string outSignature;
};

/// A D-Bus interface: what introspection shows and what messages are held against. All its texts live
/// as long as the process.
struct InterfaceDescription {
  std::string_view name;
  std::string_view objectPath;
  std::vector<MethodDescription> methods;

  /// The position of the method of that name.
  [[nodiscard]] std::optional<std::size_t> indexOf(std::string_view methodName) const;
};

/// The D-Bus type that carries an argument of that kind; each can carry absence. Lists, numbers and
/// booleans stand inside dictionaries only and have none: empty.
std::string_view argumentType(ValueKind kind);

/// The interface of a protocol, its methods in the order of the rows. Made once per protocol and kept.
const InterfaceDescription &interfaceOf(const ProtocolDescription &protocol);

/// A value of an interface that is described by hand instead of by a protocol; in the order of the
/// types: `s`, `as`, `t`, `at`, `ay`, `h`, `a(sxa{sv})`.
using MethodValue = std::variant<std::string, std::optional<std::string>, std::uint64_t, std::optional<std::uint64_t>,
                                 Data, UniqueFd, std::optional<SXError>>;
using MethodValues = std::vector<MethodValue>;

/// A D-Bus error: its name and a sentence for people.
struct MethodFailure {
  std::string name;
  std::string text;
  friend bool operator==(const MethodFailure &, const MethodFailure &) = default;
};

using MethodResult = std::variant<MethodValues, MethodFailure>;
using MethodResultHandler = std::function<void(MethodResult)>;

}  // namespace storix::wire
