// Requests and answers of the platform's interfaces, from well-formed messages to values and back.

#include "tests/fuzz/MessageBuilder.h"
#include "tests/fuzz/Target.h"
#include "wire/Codec.h"
#include "wire/PlatformInterfaces.h"

using storix::fuzz::MessageBuilder;
using storix::fuzz::require;
using namespace storix::wire;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  MessageBuilder builder(bytes, size);
  const std::uint8_t choice = builder.nextByte();
  const std::array<const InterfaceDescription *, 3> interfaces{&fileCoordinationInterface(), &sandboxInterface(),
                                                               &notificationsInterface()};
  const InterfaceDescription &interface = *interfaces[choice % interfaces.size()];
  const MethodDescription &method = interface.methods[choice / 8 % interface.methods.size()];
  const bool ofReply = choice / 4 % 2 == 1;
  const auto &types = ofReply ? method.out : method.in;
  const std::string &signature = ofReply ? method.outSignature : method.inSignature;

  const OwnedMessage message = builder.message(signature);
  if (!message) return 0;
  const auto result = readValues(message.get(), types, signature);
  if (const auto *failure = std::get_if<MethodFailure>(&result)) {
    require(!failure->text.empty(), "a refusal says nothing");
    return 0;
  }
  const auto &values = std::get<MethodValues>(result);
  require(values.size() == types.size(), "values are missing");
  const OwnedMessage written = MessageBuilder::emptyMessage();
  if (const auto failure = appendValues(written.get(), types, values)) {
    require(failure->name == busErrorName::limitsExceeded, "what was read cannot be written");
    return 0;
  }
  require(sd_bus_message_seal(written.get(), 1, 0) >= 0, "what was written is no message");
  require(std::holds_alternative<MethodValues>(readValues(written.get(), types, signature)),
          "what was written cannot be read");
  return 0;
}
