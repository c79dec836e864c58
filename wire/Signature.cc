#include "wire/Signature.h"

#include <algorithm>
#include <map>
#include <memory>
#include <mutex>
#include <utility>

namespace storix::wire {

namespace {

std::string signatureOf(const std::vector<MethodArgument> &arguments) {
  std::string signature;
  for (const MethodArgument &argument : arguments) signature += argument.type;
  return signature;
}

std::vector<MethodArgument> methodArguments(const std::vector<ArgumentDescription> &arguments) {
  std::vector<MethodArgument> result;
  result.reserve(arguments.size());
  for (const ArgumentDescription &argument : arguments) result.push_back({argument.name, argumentType(argument.kind)});
  return result;
}

std::unique_ptr<InterfaceDescription> makeInterface(const ProtocolDescription &protocol) {
  auto interface = std::make_unique<InterfaceDescription>();
  interface->name = protocol.interfaceName;
  interface->objectPath = protocol.objectPath;
  for (const OperationDescription &operation : protocol.operations) {
    interface->methods.emplace_back(operation.method, methodArguments(operation.arguments),
                                    methodArguments(operation.replies));
  }
  return interface;
}

}  // namespace

MethodDescription::MethodDescription(std::string_view methodName, std::vector<MethodArgument> inArguments,
                                     std::vector<MethodArgument> outArguments)
    : name(methodName),
      in(std::move(inArguments)),
      out(std::move(outArguments)),
      inSignature(signatureOf(in)),
      outSignature(signatureOf(out)) {}

std::optional<std::size_t> InterfaceDescription::indexOf(std::string_view methodName) const {
  const auto found = std::find_if(methods.begin(), methods.end(),
                                  [methodName](const MethodDescription &method) { return method.name == methodName; });
  if (found == methods.end()) return std::nullopt;
  return static_cast<std::size_t>(found - methods.begin());
}

std::string_view argumentType(ValueKind kind) {
  switch (kind) {
    case ValueKind::string:
    case ValueKind::URL:
      return "as";
    case ValueKind::data:
      return "aay";
    case ValueKind::error:
      return "a(sxa{sv})";
    case ValueKind::dictionary:
      return "aa{sv}";
    case ValueKind::list:
    case ValueKind::number:
    case ValueKind::boolean:
      break;
  }
  return "";
}

const InterfaceDescription &interfaceOf(const ProtocolDescription &protocol) {
  static std::mutex mutex;
  static std::map<const ProtocolDescription *, std::unique_ptr<InterfaceDescription>> interfaces;
  const std::lock_guard lock(mutex);
  std::unique_ptr<InterfaceDescription> &interface = interfaces[&protocol];
  if (!interface) interface = makeInterface(protocol);
  return *interface;
}

}  // namespace storix::wire
