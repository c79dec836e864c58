#include "examples/webdav-provider/DavPath.h"

#include <rapidjson/encodings.h>
#include <rapidjson/memorystream.h>

namespace storix::example {

namespace {

bool isUnreserved(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' || c == '.' ||
         c == '_' || c == '~';
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

/// One component; none where it could lead astray.
std::optional<std::string> decodedComponent(std::string_view text) {
  std::string decoded;
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      decoded += text[i];
      continue;
    }
    if (i + 2 >= text.size()) return std::nullopt;
    const int high = hexDigit(text[i + 1]);
    const int low = hexDigit(text[i + 2]);
    if (high < 0 || low < 0) return std::nullopt;
    decoded += static_cast<char>(high * 16 + low);
    i += 2;
  }
  const bool leadsAstray = decoded.empty() || decoded == "." || decoded == ".." ||
                           decoded.find('/') != std::string::npos || decoded.find('\0') != std::string::npos;
  return leadsAstray ? std::nullopt : std::optional(std::move(decoded));
}

}  // namespace

std::string percentEncodedPath(std::string_view path) {
  constexpr std::string_view digits = "0123456789ABCDEF";
  std::string encoded;
  for (const char c : path) {
    if (isUnreserved(c) || c == '/') {
      encoded += c;
    } else {
      const auto byte = static_cast<unsigned char>(c);
      encoded += '%';
      encoded += digits[byte >> 4U];
      encoded += digits[byte & 15U];
    }
  }
  return encoded;
}

std::optional<std::string> decodedPathOfReference(std::string_view reference) {
  reference = trimmed(reference);
  if (!reference.starts_with('/')) {
    const std::size_t scheme = reference.find("://");
    if (scheme == std::string_view::npos) return std::nullopt;
    const std::size_t slash = reference.find('/', scheme + 3);
    if (slash == std::string_view::npos) return "/";
    reference.remove_prefix(slash);
  } else if (reference.starts_with("//")) {
    return std::nullopt;
  }
  reference = reference.substr(0, reference.find_first_of("?#"));
  while (reference.ends_with('/')) reference.remove_suffix(1);
  std::string path;
  while (!reference.empty()) {
    reference.remove_prefix(1);
    const std::size_t slash = reference.find('/');
    const auto component = decodedComponent(reference.substr(0, slash));
    if (!component) return std::nullopt;
    path += '/' + *component;
    if (slash == std::string_view::npos) break;
    reference.remove_prefix(slash);
  }
  return path.empty() ? "/" : path;
}

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view space = " \t\r\n";
  const std::size_t begin = text.find_first_not_of(space);
  if (begin == std::string_view::npos) return {};
  return text.substr(begin, text.find_last_not_of(space) - begin + 1);
}

bool isUTF8(std::string_view text) {
  rapidjson::MemoryStream stream(text.data(), text.size());
  while (stream.Tell() < text.size()) {
    unsigned codepoint = 0;
    if (!rapidjson::UTF8<>::Decode(stream, &codepoint) || codepoint == 0 || stream.Tell() > text.size()) return false;
  }
  return true;
}

}  // namespace storix::example
