#include "platform/URL.h"

#include <cstddef>

namespace storix {
namespace {

constexpr std::string_view scheme = "file://";

bool isUnescapedPathCharacter(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
         std::string_view("-._~!$&'()*+,;=:@/").find(c) != std::string_view::npos;
}

/// The value of a hexadecimal digit, or -1.
int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::string percentEscape(unsigned char byte) {
  constexpr std::string_view digits = "0123456789ABCDEF";
  return {'%', digits[byte >> 4], digits[byte & 0xF]};
}

/// Escapes what may not stand in a URL's path. Zero bytes, which no file name holds, are left out.
std::string percentEncoded(std::string_view path) {
  std::string encoded;
  encoded.reserve(path.size());
  for (char c : path) {
    if (isUnescapedPathCharacter(c)) {
      encoded += c;
    } else if (c != '\0') {
      encoded += percentEscape(static_cast<unsigned char>(c));
    }
  }
  return encoded;
}

/// Every escape in `text` is known to be well-formed.
std::string percentDecoded(std::string_view text) {
  std::string decoded;
  decoded.reserve(text.size());
  while (true) {
    const std::size_t escape = text.find('%');
    decoded += text.substr(0, escape);
    if (escape == std::string_view::npos) return decoded;
    decoded += static_cast<char>(hexValue(text[escape + 1]) * 16 + hexValue(text[escape + 2]));
    text.remove_prefix(escape + 3);
  }
}

std::string_view withoutTrailingSlashes(std::string_view text) {
  while (text.size() > 1 && text.ends_with('/')) text.remove_suffix(1);
  return text;
}

/// Why the text is no URL; empty when it is one.
std::string whyRefused(std::string_view text) {
  if (text.size() > URL::maximumLength) {
    return "the URL is longer than " + std::to_string(URL::maximumLength) + " bytes; use a shorter path";
  }
  if (!text.starts_with(scheme)) {
    return "the URL does not begin with \"file://\"; give an absolute file URL, as in \"file:///home/me/a.txt\"";
  }
  text.remove_prefix(scheme.size());
  if (!text.starts_with('/')) {
    return "after \"file://\" an absolute path must follow, and no host; write three slashes, as in "
           "\"file:///home/me/a.txt\"";
  }
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (c == '?') return "a file URL has no query; write \"%3F\" for a question mark in a file name";
    if (c == '#') return "a file URL has no fragment; write \"%23\" for a number sign in a file name";
    if (c != '%') {
      if (isUnescapedPathCharacter(c)) continue;
      const std::string escape = percentEscape(static_cast<unsigned char>(c));
      return "byte " + std::to_string(scheme.size() + i) + " may not stand in a URL as it is; write \"" + escape +
             "\" for it";
    }
    if (i + 2 >= text.size() || hexValue(text[i + 1]) < 0 || hexValue(text[i + 2]) < 0) {
      return "the percent sign at byte " + std::to_string(scheme.size() + i) +
             " is not followed by two hexadecimal digits; write \"%25\" for a percent sign in a file name";
    }
    const int byte = hexValue(text[i + 1]) * 16 + hexValue(text[i + 2]);
    if (byte == 0) return "\"%00\" is refused, since no file name holds a zero byte; leave it out";
    if (byte == '/') return "\"%2F\" is refused, since no file name holds a slash; write \"/\" between two components";
    i += 2;
  }
  return {};
}

}  // namespace

std::optional<URL> URL::fromString(std::string_view absoluteString) { return fromString(absoluteString, nullptr); }

std::optional<URL> URL::fromString(std::string_view absoluteString, std::string *outReason) {
  std::string reason = whyRefused(absoluteString);
  if (reason.empty()) return URL(std::string(absoluteString));
  if (outReason) *outReason = std::move(reason);
  return std::nullopt;
}

std::optional<URL> URL::fileURLWithPath(std::string_view path, bool isDirectory) {
  if (!path.starts_with('/') || path.find('\0') != std::string_view::npos) return std::nullopt;
  const bool endsInSlash = isDirectory || path.ends_with('/');
  path = withoutTrailingSlashes(path);
  std::string text = std::string(scheme) + percentEncoded(path);
  if (endsInSlash && path != "/") text += '/';
  return URL(std::move(text));
}

std::string URL::path() const {
  return percentDecoded(withoutTrailingSlashes(std::string_view(absoluteString_).substr(scheme.size())));
}

std::string URL::lastPathComponent() const {
  const std::string whole = path();
  return whole == "/" ? whole : whole.substr(whole.rfind('/') + 1);
}

URL URL::appendingPathComponent(std::string_view component, bool isDirectory) const {
  while (component.starts_with('/')) component.remove_prefix(1);
  const bool endsInSlash = isDirectory || component.ends_with('/');
  while (component.ends_with('/')) component.remove_suffix(1);
  std::string text = absoluteString_;
  if (!component.empty()) {
    if (!text.ends_with('/')) text += '/';
    text += percentEncoded(component);
  }
  if (endsInSlash && !text.ends_with('/')) text += '/';
  return URL(std::move(text));
}

URL URL::deletingLastPathComponent() const {
  std::string_view encodedPath = withoutTrailingSlashes(std::string_view(absoluteString_).substr(scheme.size()));
  encodedPath = withoutTrailingSlashes(encodedPath.substr(0, encodedPath.rfind('/') + 1));
  std::string text = std::string(scheme) + std::string(encodedPath);
  if (!text.ends_with('/')) text += '/';
  return URL(std::move(text));
}

std::string stringLastPathComponent(std::string_view text) {
  text = withoutTrailingSlashes(text);
  if (text == "/") return "/";
  const std::size_t slash = text.rfind('/');
  return std::string(slash == std::string_view::npos ? text : text.substr(slash + 1));
}

std::string stringByDeletingLastPathComponent(std::string_view text) {
  text = withoutTrailingSlashes(text);
  const std::size_t slash = text.rfind('/');
  if (slash == std::string_view::npos) return {};
  // One slash goes, unless it is the root's or one of several: those are part of the text that stays.
  const bool keepsSlash = slash == 0 || text[slash - 1] == '/';
  return std::string(text.substr(0, keepsSlash ? slash + 1 : slash));
}

std::string stringByAppendingPathComponent(std::string_view text, std::string_view component) {
  std::string appended(text);
  if (!appended.empty() && !appended.ends_with('/')) appended += '/';
  appended += component;
  return appended;
}

}  // namespace storix
