#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace storix::example {

/// A relative path ("reports/50% of é.txt") as it stands in a URL: everything but the unreserved
/// characters and the slashes between components is percent-encoded.
std::string percentEncodedPath(std::string_view path);

/// The decoded path of a reference as servers write it, absolute ("/dav/a%20b") or with scheme and host
/// in front: query and fragment dropped, without a slash at its end (but for the root itself). None for
/// what is no such path, or whose components could lead astray: empty ones, ".", "..", a zero byte or
/// an escaped slash, a broken escape.
std::optional<std::string> decodedPathOfReference(std::string_view reference);

/// The text without the spaces, tabs and line ends around it.
std::string_view trimmed(std::string_view text);

/// Whether the bytes are UTF-8 without zero bytes.
bool isUTF8(std::string_view text);

}  // namespace storix::example
