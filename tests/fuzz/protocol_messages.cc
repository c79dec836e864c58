// Requests and replies of both protocols, from well-formed messages to values and back.

#include <cmath>

#include "platform/Log.h"
#include "providers/_KTStorixVendor.h"
#include "service/SXDaemon.h"
#include "tests/fuzz/MessageBuilder.h"
#include "tests/fuzz/Target.h"
#include "wire/Codec.h"

using storix::Arguments;
using storix::LinkInterface;
using storix::fuzz::MessageBuilder;
using storix::fuzz::require;
using namespace storix::wire;

namespace {

const std::array<LinkInterface, 2> &interfaces() {
  static const std::array<LinkInterface, 2> both = [] {
    LinkInterface service(storix::SXDaemonProtocol().description());
    service.setPermittedKinds({storix::ValueKind::dictionary, storix::ValueKind::string, storix::ValueKind::URL},
                              storix::SXDaemon::providersName, 1, true);
    return std::array<LinkInterface, 2>{service, LinkInterface(storix::_KTStorixVendorProtocol().description())};
  }();
  return both;
}

/// What a reader made of a message can be written, and reads as the same.
void checkTravel(const Arguments &arguments, const MessageRow &row) {
  const OwnedMessage written = MessageBuilder::emptyMessage();
  const auto failure = appendArguments(written.get(), row, arguments);
  if (failure) {
    require(failure->name == busErrorName::limitsExceeded, "what was read cannot be written");
    return;
  }
  require(sd_bus_message_seal(written.get(), 1, 0) >= 0, "what was written is no message");
  const auto again = readArguments(written.get(), row);
  const Arguments *read = std::get_if<Arguments>(&again);
  require(read != nullptr, "what was written cannot be read");
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    // Compared as texts, since what is no number differs from itself.
    require(storix::logDescription((*read)[i]) == storix::logDescription(arguments[i]), "a value arrives as another");
  }
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  MessageBuilder builder(bytes, size);
  const std::uint8_t choice = builder.nextByte();
  const LinkInterface &interface = interfaces()[choice % 2];
  const bool ofReply = choice / 2 % 2 == 1;
  const auto &operations = interface.protocol().operations;
  const std::size_t index = choice / 4 % operations.size();
  const MethodDescription &method = interfaceOf(interface.protocol()).methods[index];
  const MessageRow row{interface, operations[index], ofReply ? method.outSignature : method.inSignature, ofReply};

  const OwnedMessage message = builder.message(row.signature);
  if (!message) return 0;
  const auto result = readArguments(message.get(), row);
  if (const auto *failure = std::get_if<MethodFailure>(&result)) {
    require(failure->name == busErrorName::invalidArgs || failure->name == busErrorName::limitsExceeded,
            "a refusal has another name");
    require(!failure->text.empty(), "a refusal says nothing");
    return 0;
  }
  const Arguments &arguments = std::get<Arguments>(result);
  require(arguments.size() == row.arguments().size(), "arguments are missing");
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    require(!arguments[i] || arguments[i]->kind() == row.arguments()[i].kind, "an argument is of another kind");
  }
  checkTravel(arguments, row);
  return 0;
}
