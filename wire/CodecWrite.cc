// Values to messages.
#include <cstdint>
#include <utility>

#include "platform/Log.h"
#include "platform/SXError.h"
#include "wire/CodecFailure.h"

namespace storix::wire {

namespace {

constexpr std::string_view cutText = "(cut: nested too deeply)";

/// What a message costs besides its body: the fixed header, and the path, interface, member and
/// signature fields, which are short in every interface here.
constexpr std::size_t headerAllowance = 1024;

bool isNoncharacter(std::string_view text, std::size_t i) {
  const auto byteAt = [text](std::size_t at) { return static_cast<unsigned char>(text[at]); };
  if (byteAt(i) == 0xEF && i + 2 < text.size() && byteAt(i + 1) == 0xB7) {
    return byteAt(i + 2) >= 0x90 && byteAt(i + 2) <= 0xAF;
  }
  const bool endsPlane = i >= 1 && (byteAt(i) == 0xBE || byteAt(i) == 0xBF) && byteAt(i - 1) == 0xBF;
  if (!endsPlane || i < 2) return false;
  if (byteAt(i - 2) == 0xEF) return true;
  return i >= 3 && byteAt(i - 3) >= 0xF0 && (byteAt(i - 2) & 0x0F) == 0x0F;
}

/// Whether every reader of D-Bus takes the text: UTF-8 without zero bytes, and without the code points
/// that sd-bus refuses because Unicode keeps them free of characters.
bool isBusText(std::string_view text) {
  bool plain = true;
  for (char c : text) {
    if (c == '\0') return false;
    if (static_cast<unsigned char>(c) >= 0x80) plain = false;
  }
  if (plain) return true;
  if (!isUTF8(text)) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (isNoncharacter(text, i)) return false;
  }
  return true;
}

std::string escapedBytes(std::string_view text) {
  constexpr std::string_view digits = "0123456789abcdef";
  std::string escaped;
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte != 0 && byte < 0x80) {
      escaped += c;
    } else {
      escaped += {'\\', 'x', digits[byte >> 4], digits[byte & 0xF]};
    }
  }
  return escaped;
}

/// Fills one message and keeps count of its size, as D-Bus aligns it.
class Writer {
 public:
  explicit Writer(sd_bus_message *message) : message_(message) {}

  MethodFailure failure;

  template <class AppendOne>
  bool absentable(bool present, const char *elementType, const AppendOne &appendOne) {
    return open('a', elementType) && (!present || appendOne()) && close();
  }

  bool argument(const ArgumentDescription &description, const Argument &argument) {
    if (argument && argument->kind() != description.kind) {
      return fail(invalidArgs(quotedArgument(description.name) + " must be of the kind " +
                              std::string(valueKindName(description.kind)) + ", not " +
                              std::string(valueKindName(argument->kind()))));
    }
    const bool present = argument.has_value();
    switch (description.kind) {
      case ValueKind::string:
        return absentable(present, "s", [&] { return limitedString(description.name, *argument->string()); });
      case ValueKind::URL:
        return absentable(present, "s",
                          [&] { return limitedString(description.name, argument->url()->absoluteString()); });
      case ValueKind::data:
        return absentable(present, "ay", [&] { return bytes(argument->data()->bytes); });
      case ValueKind::error:
        return absentable(present, "(sxa{sv})", [&] { return error(*argument->error(), 1); });
      case ValueKind::dictionary:
        return absentable(present, "a{sv}", [&] { return dictionary(*argument->dictionary(), 1); });
      case ValueKind::list:
      case ValueKind::number:
      case ValueKind::boolean:
        break;
    }
    return fail(invalidArgs(quotedArgument(description.name) + " has a kind that no message carries"));
  }

  bool value(const MethodArgument &argument, const MethodValue &value) {
    if (argument.type == "s") {
      const auto *text = std::get_if<std::string>(&value);
      return text ? limitedString(argument.name, *text) : wrongType(argument);
    }
    if (argument.type == "as") {
      const auto *text = std::get_if<std::optional<std::string>>(&value);
      if (!text) return wrongType(argument);
      return absentable(text->has_value(), "s", [&] { return limitedString(argument.name, **text); });
    }
    if (argument.type == "t") {
      const auto *number = std::get_if<std::uint64_t>(&value);
      return number ? basic('t', number, 8, 8) : wrongType(argument);
    }
    if (argument.type == "at") {
      const auto *number = std::get_if<std::optional<std::uint64_t>>(&value);
      if (!number) return wrongType(argument);
      return absentable(number->has_value(), "t", [&] { return basic('t', &**number, 8, 8); });
    }
    if (argument.type == "ay") {
      const auto *content = std::get_if<Data>(&value);
      return content ? bytes(content->bytes) : wrongType(argument);
    }
    if (argument.type == "h") {
      const auto *fd = std::get_if<UniqueFd>(&value);
      if (!fd || !*fd) return wrongType(argument);
      const int number = fd->get();
      return basic('h', &number, 4, 4);
    }
    const auto *given = std::get_if<std::optional<SXError>>(&value);
    if (!given) return wrongType(argument);
    return absentable(given->has_value(), "(sxa{sv})", [&] { return error(**given, 1); });
  }

  /// After the last argument.
  bool fits() {
    if (size_ + headerAllowance <= maximumMessageSize) return true;
    return fail(limitsExceeded("the message would be larger than " + std::to_string(maximumMessageSize) + " bytes"));
  }

 private:
  bool fail(MethodFailure reason) {
    failure = std::move(reason);
    return false;
  }
  bool check(int result) {
    return result >= 0 || fail({std::string(busErrorName::limitsExceeded),
                                "the message could not be made: " + busError(result, "append").message()});
  }
  bool wrongType(const MethodArgument &argument) {
    return fail(invalidArgs(quotedArgument(argument.name) + " is not of the type " + std::string(argument.type)));
  }

  /// False once the message is too large, so that no more of it is collected.
  bool count(std::size_t alignment, std::size_t bytes) {
    size_ = (size_ + alignment - 1) / alignment * alignment + bytes;
    return fits();
  }

  bool open(char type, const char *contents) {
    switch (type) {
      case 'a':
        // The length, and the padding before the first element, counted even where there is none.
        if (!count(4, 4) || !count(contents[0] == '(' || contents[0] == '{' || contents[0] == 't' ? 8 : 1, 0)) {
          return false;
        }
        break;
      case 'v':
        if (!count(1, std::string_view(contents).size() + 2)) return false;
        break;
      default:
        if (!count(8, 0)) return false;
    }
    return check(sd_bus_message_open_container(message_, type, contents));
  }
  bool close() { return check(sd_bus_message_close_container(message_)); }

  bool basic(char type, const void *value, std::size_t alignment, std::size_t bytes) {
    return count(alignment, bytes) && check(sd_bus_message_append_basic(message_, type, value));
  }

  bool string(const std::string &text) {
    // A name that is no text must not make the whole message unreadable.
    if (!isBusText(text)) return string(escapedBytes(text));
    return count(4, 4 + text.size() + 1) && check(sd_bus_message_append_basic(message_, 's', text.c_str()));
  }

  bool limitedString(std::string_view name, const std::string &text) {
    if (text.size() <= maximumStringSize) return string(text);
    return fail(argumentTooLong(name));
  }

  bool bytes(const std::string &content) {
    return count(4, 4 + content.size()) &&
           check(sd_bus_message_append_array(message_, 'y', content.data(), content.size()));
  }

  bool error(const SXError &error, int level) {
    const std::int64_t code = error.code();
    return open('r', "sxa{sv}") && string(error.domain()) && basic('x', &code, 8, 8) &&
           dictionary(error.details(), level) && close();
  }

  bool dictionary(const Dictionary &entries, int level) {
    if (!open('a', "{sv}")) return false;
    for (const auto &[key, content] : entries) {
      if (!open('e', "sv") || !string(key) || !variant(content, level + 1) || !close()) return false;
    }
    return close();
  }

  bool list(const List &elements, int level) {
    if (!open('a', "v")) return false;
    for (const Value &element : elements) {
      if (!variant(element, level + 1)) return false;
    }
    return close();
  }

  static bool holdsOthers(const Value &value) {
    if (const List *list = value.list()) return !list->empty();
    if (const Dictionary *dictionary = value.dictionary()) return !dictionary->empty();
    if (const SXError *error = value.error()) return !error->details().empty();
    return false;
  }

  bool variant(const Value &value, int level) {
    if (level >= maximumNesting && holdsOthers(value)) {
      return open('v', "s") && string(std::string(cutText)) && close();
    }
    switch (value.kind()) {
      case ValueKind::boolean: {
        const int flag = *value.boolean() ? 1 : 0;
        return open('v', "b") && basic('b', &flag, 4, 4) && close();
      }
      case ValueKind::number:
        if (const std::int64_t *integer = value.integer()) {
          return open('v', "x") && basic('x', integer, 8, 8) && close();
        }
        return open('v', "d") && basic('d', value.real(), 8, 8) && close();
      case ValueKind::string:
        return open('v', "s") && string(*value.string()) && close();
      case ValueKind::URL:
        return open('v', "(s)") && open('r', "s") && string(value.url()->absoluteString()) && close() && close();
      case ValueKind::data:
        return open('v', "ay") && bytes(value.data()->bytes) && close();
      case ValueKind::list:
        return open('v', "av") && list(*value.list(), level) && close();
      case ValueKind::dictionary:
        return open('v', "a{sv}") && dictionary(*value.dictionary(), level) && close();
      case ValueKind::error:
        return open('v', "(sxa{sv})") && error(*value.error(), level) && close();
    }
    return fail(invalidArgs("a value has no kind"));
  }

  sd_bus_message *message_;
  std::size_t size_ = 0;
};

}  // namespace

std::string busText(std::string text) { return isBusText(text) ? std::move(text) : escapedBytes(text); }

std::optional<MethodFailure> appendArguments(sd_bus_message *message, const MessageRow &row,
                                             const Arguments &arguments) {
  Writer writer(message);
  if (arguments.size() != row.arguments().size()) {
    return invalidArgs("\"" + std::string(row.operation.name) + "\" has " + std::to_string(row.arguments().size()) +
                       (row.ofReply ? " reply values, not " : " arguments, not ") + std::to_string(arguments.size()));
  }
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    if (std::optional<MethodFailure> refused = forbiddenKind(row, i, arguments[i])) return refused;
    if (!writer.argument(row.arguments()[i], arguments[i])) return std::move(writer.failure);
  }
  return std::nullopt;
}

std::optional<MethodFailure> appendValues(sd_bus_message *message, const std::vector<MethodArgument> &types,
                                          const MethodValues &values) {
  Writer writer(message);
  if (values.size() != types.size()) {
    return invalidArgs("the message has " + std::to_string(types.size()) + " values, not " +
                       std::to_string(values.size()));
  }
  for (std::size_t i = 0; i < types.size(); ++i) {
    if (!writer.value(types[i], values[i])) return std::move(writer.failure);
  }
  return std::nullopt;
}

}  // namespace storix::wire
