#pragma once

#include <array>
#include <concepts>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "platform/SXError.h"
#include "platform/URL.h"
#include "platform/Value.h"

namespace storix {

enum class LogSeverity { debug, info, standard, fault };

/// Where log lines go. Thread-safe.
class LogSink {
 public:
  virtual ~LogSink() = default;
  [[nodiscard]] virtual bool isEnabled(LogSeverity severity) const = 0;
  /// One message, without a line end in it.
  virtual void write(LogSeverity severity, std::string_view message) = 0;
};

/// Writes a text with control characters (and bytes that are not UTF-8) escaped, so that no
/// identifier or error text from outside can end a line or begin another.
std::string escapedForLog(std::string_view text);

/// Whether the text is well-formed UTF-8.
[[nodiscard]] bool isUTF8(std::string_view text);

std::string valueLogDescription(const Value &value);

/// What "%@" prints for a value. Absent prints as "(null)". Unescaped.
std::string logDescription(std::string_view text);
std::string logDescription(const URL &url);
std::string logDescription(const SXError &error);
template <std::same_as<Value> T>
std::string logDescription(const T &value) {
  return valueLogDescription(value);
}
std::string logDescription(const Dictionary &dictionary);
std::string logDescription(const std::vector<std::string> &list);

template <class T>
concept HasLogDescription = requires(const T &value) {
  { value.description() } -> std::convertible_to<std::string>;
};
template <HasLogDescription T>
std::string logDescription(const T &value) {
  return value.description();
}
template <class T>
std::string logDescription(const std::shared_ptr<T> &value) {
  return value ? logDescription(*value) : std::string("(null)");
}
template <class T>
std::string logDescription(const std::optional<T> &value) {
  return value ? logDescription(*value) : std::string("(null)");
}

/// The literal text of a log line with "%@", "%s" and "%d", checked against the arguments' number
/// and types when compiling: "%d" takes an integer, "%s" a text, "%@" anything with a description.
template <class... Arguments>
class LogFormat {
 public:
  template <class Text>
  requires std::convertible_to<const Text &, std::string_view>
  consteval LogFormat(const Text &text) : text_(text) {
    std::size_t argument = 0;
    for (std::size_t i = 0; i < text_.size(); ++i) {
      if (text_[i] != '%') continue;
      ++i;
      if (argument == sizeof...(Arguments)) throw "more placeholders than arguments";
      if (i == text_.size() || (text_[i] != '@' && text_[i] != 's' && text_[i] != 'd')) throw "unknown placeholder";
      if ((text_[i] == 'd') != isInteger[argument]) throw "%d takes an integer, and an integer takes %d";
      if (text_[i] == 's' && !isText[argument]) throw "%s takes a text";
      ++argument;
    }
    if (argument != sizeof...(Arguments)) throw "more arguments than placeholders";
  }

  [[nodiscard]] std::string_view text() const { return text_; }

 private:
  static constexpr std::array<bool, sizeof...(Arguments) + 1> isInteger{
      (std::integral<std::remove_cvref_t<Arguments>>)..., false};
  static constexpr std::array<bool, sizeof...(Arguments) + 1> isText{
      (std::convertible_to<const Arguments &, std::string_view>)..., false};

  std::string_view text_;
};

/// The shared log handle. Messages go to the sink of the current process scope's platform; without
/// a scope they are dropped.
class LogHandle {
 public:
  template <class... Arguments>
  void debug(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments &...arguments) const {
    log(LogSeverity::debug, format.text(), arguments...);
  }
  template <class... Arguments>
  void info(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments &...arguments) const {
    log(LogSeverity::info, format.text(), arguments...);
  }
  /// The default severity.
  template <class... Arguments>
  void notice(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments &...arguments) const {
    log(LogSeverity::standard, format.text(), arguments...);
  }
  /// The highest severity.
  template <class... Arguments>
  void fault(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments &...arguments) const {
    log(LogSeverity::fault, format.text(), arguments...);
  }

 private:
  static LogSink *sinkIfEnabled(LogSeverity severity);
  static std::string format(std::string_view text, const std::string *arguments);

  template <class T>
  static std::string print(const T &argument) {
    if constexpr (std::integral<T>) {
      return std::to_string(argument);
    } else {
      return escapedForLog(logDescription(argument));
    }
  }

  template <class... Arguments>
  static void log(LogSeverity severity, std::string_view text, const Arguments &...arguments) {
    LogSink *sink = sinkIfEnabled(severity);
    if (!sink) return;
    const std::array<std::string, sizeof...(Arguments) + 1> printed{print(arguments)..., std::string()};
    sink->write(severity, format(text, printed.data()));
  }
};

const LogHandle &sx_default_log();

/// Logs what went wrong and ends the process: for programming errors alone, never for input.
[[noreturn]] void endProcessForProgrammingError(std::string_view what);

}  // namespace storix
