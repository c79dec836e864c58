// Messages to values.
#include <fcntl.h>

#include <cerrno>
#include <cstdint>
#include <utility>

#include "platform/SXError.h"
#include "wire/CodecFailure.h"

namespace storix::wire {

namespace {

/// Reads one message from front to back. Each function gives false once anything was wrong, and
/// `failure` says what.
class Reader {
 public:
  explicit Reader(sd_bus_message *message) : message_(message) {}

  MethodFailure failure;

  bool hasSignature(const std::string &signature) {
    if (sd_bus_message_has_signature(message_, signature.c_str()) > 0) return true;
    const char *found = sd_bus_message_get_signature(message_, 1);
    return fail(
        invalidArgs("the message must have the signature \"" + signature + "\", not \"" + (found ? found : "") + "\""));
  }

  /// An array of at most one element, which `readOne` reads.
  template <class ReadOne>
  bool absentable(std::string_view name, const char *elementType, const ReadOne &readOne) {
    if (!enter('a', elementType)) return false;
    if (!atEnd()) {
      if (!readOne()) return false;
      if (!atEnd()) return fail(invalidArgs(quotedArgument(name) + " may have one value at most"));
    }
    return exit();
  }

  bool argument(const ArgumentDescription &description, Argument &out) {
    switch (description.kind) {
      case ValueKind::string:
        return absentable(description.name, "s", [&] {
          std::string text;
          if (!limitedString(description.name, text)) return false;
          out = Value(std::move(text));
          return true;
        });
      case ValueKind::URL:
        return absentable(description.name, "s", [&] { return url(description.name, out); });
      case ValueKind::data:
        return absentable(description.name, "ay", [&] { return data(out); });
      case ValueKind::error:
        return absentable(description.name, "(sxa{sv})", [&] { return error(1, out); });
      case ValueKind::dictionary:
        return absentable(description.name, "a{sv}", [&] { return dictionary(1, out); });
      case ValueKind::list:
      case ValueKind::number:
      case ValueKind::boolean:
        break;
    }
    return fail(invalidArgs(quotedArgument(description.name) + " has a kind that no message carries"));
  }

  bool value(const MethodArgument &argument, MethodValue &out) {
    if (argument.type == "s") return limitedString(argument.name, out.emplace<std::string>());
    if (argument.type == "as") {
      auto &text = out.emplace<std::optional<std::string>>();
      return absentable(argument.name, "s", [&] { return limitedString(argument.name, text.emplace()); });
    }
    if (argument.type == "t") return basic('t', &out.emplace<std::uint64_t>());
    if (argument.type == "at") {
      auto &number = out.emplace<std::optional<std::uint64_t>>();
      return absentable(argument.name, "t", [&] { return basic('t', &number.emplace()); });
    }
    if (argument.type == "ay") return bytes(out.emplace<Data>().bytes);
    if (argument.type == "h") return descriptor(out.emplace<UniqueFd>());
    auto &error = out.emplace<std::optional<SXError>>();
    return absentable(argument.name, "(sxa{sv})", [&] {
      Argument read;
      if (!this->error(1, read)) return false;
      error = *read->error();
      return true;
    });
  }

 private:
  bool fail(MethodFailure reason) {
    failure = std::move(reason);
    return false;
  }
  bool check(int result) { return result > 0 || malformed(); }
  bool malformed() { return fail(invalidArgs("the message is malformed")); }

  bool enter(char type, const char *contents) {
    return check(sd_bus_message_enter_container(message_, type, contents));
  }
  bool exit() { return sd_bus_message_exit_container(message_) >= 0 || malformed(); }
  bool atEnd() { return sd_bus_message_at_end(message_, 0) != 0; }
  bool basic(char type, void *out) { return check(sd_bus_message_read_basic(message_, type, out)); }

  bool string(std::string &out) {
    const char *text = nullptr;
    if (!basic('s', &text)) return false;
    out = text;
    return true;
  }

  bool limitedString(std::string_view name, std::string &out) {
    const char *text = nullptr;
    if (!basic('s', &text)) return false;
    const std::string_view view(text);
    if (view.size() > maximumStringSize) {
      return fail(argumentTooLong(name));
    }
    out = view;
    return true;
  }

  bool url(std::string_view name, Argument &out) {
    std::string text;
    if (!limitedString(name, text)) return false;
    std::string reason;
    std::optional<URL> parsed = URL::fromString(text, &reason);
    if (!parsed) return fail(invalidArgs(quotedArgument(name) + ": " + reason));
    out = Value(std::move(*parsed));
    return true;
  }

  bool bytes(std::string &out) {
    const void *content = nullptr;
    std::size_t size = 0;
    if (sd_bus_message_read_array(message_, 'y', &content, &size) < 0) return malformed();
    if (size > 0) out.assign(static_cast<const char *>(content), size);
    return true;
  }

  bool data(Argument &out) {
    Data content;
    if (!bytes(content.bytes)) return false;
    out = Value(std::move(content));
    return true;
  }

  bool descriptor(UniqueFd &out) {
    int borrowed = -1;
    if (!basic('h', &borrowed)) return false;
    out.reset(fcntl(borrowed, F_DUPFD_CLOEXEC, 3));
    if (out) return true;
    return fail(limitsExceeded("no descriptor is left to take the passed one: " + posixError(errno, "dup").message()));
  }

  bool error(int level, Argument &out) {
    if (!withinNesting(level)) return false;
    std::string domain;
    std::int64_t code = 0;
    Argument details;
    if (!enter('r', "sxa{sv}") || !string(domain) || !basic('x', &code) || !dictionary(level, details) || !exit()) {
      return false;
    }
    out = Value(SXError(std::move(domain), code, std::move(*details->dictionary())));
    return true;
  }

  bool dictionary(int level, Argument &out) {
    if (!withinNesting(level)) return false;
    if (!enter('a', "{sv}")) return false;
    Dictionary entries;
    while (!atEnd()) {
      std::string key;
      Argument content;
      if (!enter('e', "sv") || !string(key) || !variant(level + 1, content) || !exit()) return false;
      if (!entries.emplace(std::move(key), std::move(*content)).second) {
        return fail(invalidArgs("a dictionary has a key twice"));
      }
    }
    if (!exit()) return false;
    out = Value(std::move(entries));
    return true;
  }

  bool list(int level, Argument &out) {
    if (!enter('a', "v")) return false;
    List elements;
    while (!atEnd()) {
      Argument element;
      if (!variant(level + 1, element)) return false;
      elements.push_back(std::move(*element));
    }
    if (!exit()) return false;
    out = Value(std::move(elements));
    return true;
  }

  bool variant(int level, Argument &out) {
    if (!withinNesting(level)) return false;
    char type = 0;
    const char *contents = nullptr;
    if (!check(sd_bus_message_peek_type(message_, &type, &contents))) return false;
    const std::string_view inside = contents ? contents : "";
    return enter('v', contents) && content(inside, level, out) && exit();
  }

  bool content(std::string_view type, int level, Argument &out) {
    if (type == "s") {
      std::string text;
      if (!string(text)) return false;
      out = Value(std::move(text));
      return true;
    }
    if (type == "(s)") return enter('r', "s") && url("URL", out) && exit();
    if (type == "ay") return data(out);
    if (type == "(sxa{sv})") return error(level, out);
    if (type == "a{sv}") return dictionary(level, out);
    if (type == "av") return list(level, out);
    if (type == "x") {
      std::int64_t number = 0;
      if (!basic('x', &number)) return false;
      out = Value(number);
      return true;
    }
    if (type == "d") {
      double number = 0;
      if (!basic('d', &number)) return false;
      out = Value(number);
      return true;
    }
    if (type == "b") {
      int flag = 0;
      if (!basic('b', &flag)) return false;
      out = Value(flag != 0);
      return true;
    }
    return fail(invalidArgs("a value of the type \"" + std::string(type) + "\" stands for nothing here"));
  }

  bool withinNesting(int level) {
    return level <= maximumNesting ||
           fail(limitsExceeded("values are nested more than " + std::to_string(maximumNesting) + " deep"));
  }

  sd_bus_message *message_;
};

}  // namespace

std::variant<Arguments, MethodFailure> readArguments(sd_bus_message *message, const MessageRow &row) {
  Reader reader(message);
  if (!reader.hasSignature(row.signature)) return std::move(reader.failure);
  Arguments arguments(row.arguments().size());
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    if (!reader.argument(row.arguments()[i], arguments[i])) return std::move(reader.failure);
    if (std::optional<MethodFailure> refused = forbiddenKind(row, i, arguments[i])) return std::move(*refused);
  }
  return arguments;
}

std::variant<MethodValues, MethodFailure> readValues(sd_bus_message *message, const std::vector<MethodArgument> &types,
                                                     const std::string &signature) {
  Reader reader(message);
  if (!reader.hasSignature(signature)) return std::move(reader.failure);
  MethodValues values(types.size());
  for (std::size_t i = 0; i < types.size(); ++i) {
    if (!reader.value(types[i], values[i])) return std::move(reader.failure);
  }
  return values;
}

}  // namespace storix::wire
