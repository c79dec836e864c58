#include "tests/fuzz/MessageBuilder.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <utility>

#include "tests/fuzz/Target.h"

namespace storix::fuzz {

namespace {

/// D-Bus ends at 64 containers; this is as deep as the bytes may go.
constexpr int deepest = 60;
constexpr std::uint8_t mostElements = 12;

/// What may stand in a variant: the types that mean something here, and some that do not.
constexpr std::array<const char *, 16> variantTypes{"s",         "x", "d",  "b", "(s)", "ay",   "a{sv}", "av",
                                                    "(sxa{sv})", "s", "av", "u", "as",  "(ss)", "v",     "a{ss}"};

/// A connection that never speaks: messages are made on one.
sd_bus *silentBus() {
  static const wire::OwnedBus bus = [] {
    std::array<int, 2> ends{-1, -1};
    require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) == 0, "no socket pair");
    static const UniqueFd other(ends[1]);
    sd_bus *raw = nullptr;
    require(sd_bus_new(&raw) >= 0 && sd_bus_set_fd(raw, ends[0], ends[0]) >= 0 && sd_bus_start(raw) >= 0,
            "no connection to make messages on");
    return wire::OwnedBus(raw);
  }();
  return bus.get();
}

/// The length of the first complete type.
std::size_t completeType(std::string_view signature) {
  if (signature.front() == 'a') return 1 + completeType(signature.substr(1));
  if (signature.front() != '(' && signature.front() != '{') return 1;
  int open = 0;
  for (std::size_t i = 0; i < signature.size(); ++i) {
    if (signature[i] == '(' || signature[i] == '{') ++open;
    if (signature[i] == ')' || signature[i] == '}') --open;
    if (open == 0) return i + 1;
  }
  return signature.size();
}

}  // namespace

wire::OwnedMessage MessageBuilder::emptyMessage() {
  sd_bus_message *raw = nullptr;
  require(sd_bus_message_new_method_call(silentBus(), &raw, nullptr, "/org/sample", "org.sample.Fuzz", "Fuzz") >= 0,
          "no message can be made");
  return wire::OwnedMessage(raw);
}

std::uint8_t MessageBuilder::nextByte() {
  if (left_ == 0) return 0;
  --left_;
  return *bytes_++;
}

/// A length and that many bytes; a URL's beginning before them for an odd length.
std::string MessageBuilder::nextText() {
  const std::uint8_t length = nextByte();
  // Long ones are made by repeating, since the limits lie beyond what a fuzzer would invent.
  if (length == 0xff) return std::string(std::size_t{nextByte()} << 9, 'x');
  std::string text = length % 2 == 1 ? "file:///" : "";
  const std::size_t taken = std::min<std::size_t>(length / 2, left_);
  text.append(reinterpret_cast<const char *>(bytes_), taken);
  bytes_ += taken;
  left_ -= taken;
  std::replace(text.begin(), text.end(), '\0', '0');
  return text;
}

wire::OwnedMessage MessageBuilder::message(std::string_view signature) {
  wire::OwnedMessage message = emptyMessage();
  while (!signature.empty()) {
    const std::size_t length = completeType(signature);
    // Now and then an argument is missing or of another type.
    const std::uint8_t choice = nextByte();
    const std::string_view type = choice == 0xfe ? std::string_view("v") : signature.substr(0, length);
    if (choice != 0xff && !append(message.get(), type, 0)) return nullptr;
    signature.remove_prefix(length);
  }
  if (sd_bus_message_seal(message.get(), 1, 0) < 0) return nullptr;
  return message;
}

bool MessageBuilder::append(sd_bus_message *message, std::string_view type, int depth) {
  if (type == "v") return appendVariant(message, depth);
  if (type == "ay") {
    const std::string bytes = nextText();
    return sd_bus_message_append_array(message, 'y', bytes.data(), bytes.size()) >= 0;
  }
  const char kind = type.front();
  if (kind != 'a' && kind != '(' && kind != '{') return appendBasic(message, kind);
  const bool isArray = kind == 'a';
  const std::string contents(isArray ? type.substr(1) : type.substr(1, type.size() - 2));
  const char container = isArray ? 'a' : kind == '(' ? 'r' : 'e';
  if (sd_bus_message_open_container(message, container, contents.c_str()) < 0) return false;
  if (isArray) {
    const int count = depth < deepest ? nextByte() % mostElements : 0;
    for (int i = 0; i < count; ++i) {
      if (!append(message, contents, depth + 1)) return false;
    }
  } else {
    for (std::string_view rest = contents; !rest.empty();) {
      const std::size_t length = completeType(rest);
      if (!append(message, rest.substr(0, length), depth + 1)) return false;
      rest.remove_prefix(length);
    }
  }
  return sd_bus_message_close_container(message) >= 0;
}

bool MessageBuilder::appendVariant(sd_bus_message *message, int depth) {
  const char *type = depth < deepest ? variantTypes[nextByte() % variantTypes.size()] : "b";
  return sd_bus_message_open_container(message, 'v', type) >= 0 && append(message, type, depth + 1) &&
         sd_bus_message_close_container(message) >= 0;
}

bool MessageBuilder::appendBasic(sd_bus_message *message, char type) {
  if (type == 's') return sd_bus_message_append_basic(message, type, nextText().c_str()) >= 0;
  std::uint64_t number = 0;
  const std::size_t width = nextByte() % 9;
  for (std::size_t i = 0; i < width; ++i) number = number << 8 | nextByte();
  switch (type) {
    case 'h':
      return sd_bus_message_append(message, "h", 0) >= 0;
    case 'b':
    case 'u': {
      const int truth = number % 2 == 1 ? 1 : 0;
      return sd_bus_message_append_basic(message, type, &truth) >= 0;
    }
    case 'd': {
      double real = 0;
      std::memcpy(&real, &number, sizeof real);
      return sd_bus_message_append_basic(message, type, &real) >= 0;
    }
    default:
      return sd_bus_message_append_basic(message, type, &number) >= 0;
  }
}

}  // namespace storix::fuzz
