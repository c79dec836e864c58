#include "bench/BusClient.h"

#include <cstring>
#include <optional>

#include "bench/Measure.h"
#include "bench/Scene.h"

namespace storix::bench {

namespace {

constexpr const char *servicePath = "/com/tessel/Storix";
constexpr const char *serviceInterface = "com.tessel.Storix.Daemon";
constexpr const char *platformPath = "/com/tessel/Platform";
constexpr const char *coordinationInterface = "com.tessel.Platform.FileCoordination";
constexpr const char *errorContents = "(sxa{sv})";

void require(int result, const std::string &doing) {
  if (result < 0) giveUp(doing + ": " + std::strerror(-result));
}

/// Goes through the values of a reply: the first text, and no error.
std::optional<std::string> readReply(sd_bus_message *reply, const char *method) {
  std::optional<std::string> text;
  for (;;) {
    char type = 0;
    const char *contents = nullptr;
    const int more = sd_bus_message_peek_type(reply, &type, &contents);
    require(more, std::string("reading the reply of ") + method);
    if (more == 0) return text;
    const bool isError = type == 'a' && std::strcmp(contents, errorContents) == 0;
    const bool isText = type == 'a' && std::strcmp(contents, "s") == 0;
    if (!isError && !(isText && !text)) {
      require(sd_bus_message_skip(reply, nullptr), "skipping a value");
      continue;
    }
    require(sd_bus_message_enter_container(reply, 'a', contents), "entering an array");
    if (isError && sd_bus_message_at_end(reply, 0) == 0) {
      const char *domain = nullptr;
      std::int64_t code = 0;
      sd_bus_message_enter_container(reply, 'r', "sxa{sv}");
      sd_bus_message_read(reply, "sx", &domain, &code);
      giveUp(std::string(method) + " answered an error: " + (domain ? domain : "") + " " + std::to_string(code));
    }
    const char *value = nullptr;
    if (isText && sd_bus_message_read(reply, "s", &value) > 0) text = value;
    require(sd_bus_message_exit_container(reply), "leaving an array");
  }
}

}  // namespace

BusClient::BusClient(const std::string &socket) {
  sd_bus *raw = nullptr;
  require(sd_bus_new(&raw), "making a connection");
  bus_.reset(raw);
  const int fd = connectTo(socket).release();
  require(sd_bus_set_fd(raw, fd, fd), "using a socket");
  require(sd_bus_start(raw), "logging in");
}

wire::OwnedMessage BusClient::request(const char *method, const std::vector<std::string> &arguments) {
  sd_bus_message *raw = nullptr;
  require(sd_bus_message_new_method_call(bus_.get(), &raw, nullptr, servicePath, serviceInterface, method), method);
  wire::OwnedMessage message(raw);
  for (const std::string &argument : arguments) require(sd_bus_message_append(raw, "as", 1, argument.c_str()), method);
  return message;
}

wire::OwnedMessage BusClient::exchange(const char *method, const wire::OwnedMessage &message) {
  sd_bus_error error{};
  sd_bus_message *reply = nullptr;
  const int result = sd_bus_call(bus_.get(), message.get(), 0, &error, &reply);
  if (result < 0) giveUp(std::string(method) + ": " + (error.message ? error.message : std::strerror(-result)));
  return wire::OwnedMessage(reply);
}

void BusClient::call(const char *method, const std::vector<std::string> &arguments) {
  (void)readReply(exchange(method, request(method, arguments)).get(), method);
}

std::string BusClient::callForText(const char *method, const std::vector<std::string> &arguments) {
  auto text = readReply(exchange(method, request(method, arguments)).get(), method);
  if (!text) giveUp(std::string(method) + " answered no text.");
  return *std::move(text);
}

std::uint64_t BusClient::beginRead(const std::string &url) {
  sd_bus_message *raw = nullptr;
  require(sd_bus_message_new_method_call(bus_.get(), &raw, nullptr, platformPath, coordinationInterface, "BeginRead"),
          "BeginRead");
  const wire::OwnedMessage message(raw);
  require(sd_bus_message_append(raw, "sas", url.c_str(), 0), "BeginRead");
  const wire::OwnedMessage reply = exchange("BeginRead", message);
  std::uint64_t claim = 0;
  require(sd_bus_message_skip(reply.get(), "a(sxa{sv})"), "BeginRead");
  require(sd_bus_message_enter_container(reply.get(), 'a', "t"), "BeginRead");
  if (sd_bus_message_read(reply.get(), "t", &claim) <= 0) giveUp("BeginRead gave no claim.");
  return claim;
}

void BusClient::endRead(std::uint64_t claim) {
  sd_bus_message *raw = nullptr;
  require(sd_bus_message_new_method_call(bus_.get(), &raw, nullptr, platformPath, coordinationInterface, "EndRead"),
          "EndRead");
  const wire::OwnedMessage message(raw);
  require(sd_bus_message_append(raw, "t", claim), "EndRead");
  (void)exchange("EndRead", message);
}

}  // namespace storix::bench
