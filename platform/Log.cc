#include "platform/Log.h"

#include <algorithm>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"

namespace storix {
namespace {

constexpr std::string_view absentText = "(null)";

bool isPrintableASCII(char c) { return c >= 0x20 && c < 0x7F; }

/// One character of UTF-8 at the start of `text`: its length in bytes (0 when there is none that is
/// well-formed) and its code point.
struct Character {
  std::size_t length = 0;
  std::uint32_t codePoint = 0;
};

Character firstCharacter(std::string_view text) {
  const auto byteAt = [text](std::size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned char lead = byteAt(0);
  if (lead < 0x80) return {1, lead};
  std::size_t length = 0;
  std::uint32_t smallest = 0;
  std::uint32_t codePoint = 0;
  if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2, smallest = 0x80, codePoint = lead & 0x1F;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3, smallest = 0x800, codePoint = lead & 0x0F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4, smallest = 0x10000, codePoint = lead & 0x07;
  }
  if (length == 0 || text.size() < length) return {};
  for (std::size_t i = 1; i < length; ++i) {
    if ((byteAt(i) & 0xC0) != 0x80) return {};
    codePoint = (codePoint << 6) | (byteAt(i) & 0x3FU);
  }
  const bool isSurrogate = codePoint >= 0xD800 && codePoint <= 0xDFFF;
  if (codePoint < smallest || isSurrogate || codePoint > 0x10FFFF) return {};
  return {length, codePoint};
}

/// Control characters, and the two separators that some readers take for the end of a line.
bool mustBeEscaped(std::uint32_t codePoint) {
  return codePoint < 0x20 || (codePoint >= 0x7F && codePoint <= 0x9F) || codePoint == 0x2028 || codePoint == 0x2029;
}

void appendEscaped(std::string &to, std::string_view bytes) {
  constexpr std::string_view digits = "0123456789abcdef";
  for (char c : bytes) {
    switch (c) {
      case '\n':
        to += "\\n";
        break;
      case '\r':
        to += "\\r";
        break;
      case '\t':
        to += "\\t";
        break;
      default:
        const auto byte = static_cast<unsigned char>(c);
        to += {'\\', 'x', digits[byte >> 4], digits[byte & 0xF]};
    }
  }
}

std::string realDescription(double number) {
  std::array<char, 32> text{};
  const std::to_chars_result result = std::to_chars(text.data(), text.data() + text.size(), number);
  return std::string(text.data(), result.ptr);
}

template <class Element, class Describe>
std::string listDescription(const std::vector<Element> &list, Describe describe) {
  std::string text = "(";
  for (const Element &element : list) {
    if (text.size() > 1) text += ", ";
    text += describe(element);
  }
  return text + ")";
}

/// Domain, code and the message where there is one.
std::string shortDescription(const SXError &error) {
  std::string text = error.domain() + " " + std::to_string(error.code());
  if (const std::optional<std::string> message = error.stringDetail("description")) text += " \"" + *message + "\"";
  return text;
}

}  // namespace

bool isUTF8(std::string_view text) {
  for (;;) {
    const auto *const unusual = std::find_if(text.begin(), text.end(), [](char c) { return (c & 0x80) != 0; });
    text.remove_prefix(static_cast<std::size_t>(unusual - text.begin()));
    if (text.empty()) return true;
    const std::size_t length = firstCharacter(text).length;
    if (length == 0) return false;
    text.remove_prefix(length);
  }
}

std::string escapedForLog(std::string_view text) {
  std::string escaped;
  escaped.reserve(text.size());
  while (!text.empty()) {
    if (isPrintableASCII(text.front())) {
      escaped += text.front();
      text.remove_prefix(1);
      continue;
    }
    const Character character = firstCharacter(text);
    const std::size_t length = character.length == 0 ? 1 : character.length;
    if (character.length == 0 || mustBeEscaped(character.codePoint)) {
      appendEscaped(escaped, text.substr(0, length));
    } else {
      escaped += text.substr(0, length);
    }
    text.remove_prefix(length);
  }
  return escaped;
}

std::string valueLogDescription(const Value &value) {
  if (const bool *flag = value.boolean()) return *flag ? "true" : "false";
  if (const std::int64_t *whole = value.integer()) return std::to_string(*whole);
  if (const double *number = value.real()) return realDescription(*number);
  if (const std::string *text = value.string()) return *text;
  if (const URL *url = value.url()) return logDescription(*url);
  if (const Data *data = value.data()) return "<" + std::to_string(data->bytes.size()) + " bytes>";
  if (const List *list = value.list()) return listDescription(*list, valueLogDescription);
  if (const Dictionary *dictionary = value.dictionary()) return logDescription(*dictionary);
  if (const SXError *error = value.error()) return logDescription(*error);
  return std::string(absentText);
}

std::string logDescription(std::string_view text) { return std::string(text); }

std::string logDescription(const URL &url) { return url.absoluteString(); }

std::string logDescription(const SXError &error) {
  std::string text = shortDescription(error);
  if (const SXError *underlying = error.underlyingError()) text += " (caused by " + shortDescription(*underlying) + ")";
  return text;
}

std::string logDescription(const Dictionary &dictionary) {
  std::string text = "{";
  for (const auto &[key, value] : dictionary) {
    if (text.size() > 1) text += "; ";
    text += key + " = " + valueLogDescription(value);
  }
  return text + "}";
}

std::string logDescription(const std::vector<std::string> &list) {
  return listDescription(list, [](const std::string &text) { return text; });
}

LogSink *LogHandle::sinkIfEnabled(LogSeverity severity) {
  ProcessScope *scope = ProcessScope::currentOrNull();
  if (!scope) return nullptr;
  LogSink &sink = scope->platform().logSink();
  return sink.isEnabled(severity) ? &sink : nullptr;
}

std::string LogHandle::format(std::string_view text, const std::string *arguments) {
  std::string message;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      message += text[i];
      continue;
    }
    ++i;
    message += *arguments++;
  }
  return message;
}

const LogHandle &sx_default_log() {
  static const LogHandle handle;
  return handle;
}

void endProcessForProgrammingError(std::string_view what) {
  sx_default_log().fault("[ERROR] Ending the process after a programming error: %@", what);
  const std::string line = "storix: programming error: " + escapedForLog(what) + "\n";
  std::fputs(line.c_str(), stderr);
  std::abort();
}

}  // namespace storix
