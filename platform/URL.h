#pragma once

#include <compare>
#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace storix {

/// An absolute file URL ("file:///..."), kept as its percent-encoded text.
///
/// A value: copy it freely, use it from any thread. Two URLs are equal when their texts are equal;
/// a directory URL ends in "/" and so differs from the URL of the same path without it.
class URL {
 public:
  /// The longest text that is parsed, in bytes.
  static constexpr std::size_t maximumLength = 64 * 1024;

  /// Parses the text of a URL. None unless it is "file://" + "/" + path, where the path holds only
  /// characters that RFC 3986 allows in one and well-formed percent escapes. A host, a query, a
  /// fragment, the escapes %00 and %2F (no file name holds a zero byte or a slash) and a text longer
  /// than `maximumLength` are refused.
  static std::optional<URL> fromString(std::string_view absoluteString);

  /// As `fromString`, and says in words why a text is refused.
  static std::optional<URL> fromString(std::string_view absoluteString, std::string *outReason);

  /// The URL of an absolute path, given as bytes of the file system. None when the path is not
  /// absolute or holds a zero byte. The URL of a directory, or of a path that ends in "/", does so too.
  static std::optional<URL> fileURLWithPath(std::string_view path, bool isDirectory = false);

  /// The text as it was parsed or made; nothing but ASCII.
  [[nodiscard]] const std::string &absoluteString() const { return absoluteString_; }

  /// The path, percent escapes decoded, without a "/" at its end (but for the root itself).
  [[nodiscard]] std::string path() const;

  /// The bytes by which the file system knows the path; the same as `path` on every host so far.
  [[nodiscard]] std::string fileSystemRepresentation() const { return path(); }

  [[nodiscard]] bool hasDirectoryPath() const { return absoluteString_.ends_with('/'); }

  /// The last component of the path, decoded; "/" for the root.
  [[nodiscard]] std::string lastPathComponent() const;

  /// The URL with one more component (or several, separated by "/"), given undecoded as bytes. Zero
  /// bytes, which no file name holds, are left out.
  [[nodiscard]] URL appendingPathComponent(std::string_view component, bool isDirectory = false) const;

  /// The URL of the directory that holds this one, as a directory URL; the root gives the root.
  [[nodiscard]] URL deletingLastPathComponent() const;

  friend bool operator==(const URL &, const URL &) = default;
  friend auto operator<=>(const URL &, const URL &) = default;

 private:
  explicit URL(std::string absoluteString) : absoluteString_(std::move(absoluteString)) {}

  std::string absoluteString_;
};

/// Path operations on a text, as text: nothing is decoded or encoded, and a double slash stays.
/// "file:///a/b/" has the last component "b" and without it is "file:///a"; "file:///a" without its
/// own is "file:///".
std::string stringLastPathComponent(std::string_view text);
std::string stringByDeletingLastPathComponent(std::string_view text);
std::string stringByAppendingPathComponent(std::string_view text, std::string_view component);

}  // namespace storix
