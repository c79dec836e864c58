#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace storix {

/// The text that names one item of one provider, wherever its file lies:
/// "storix:" + provider identifier + "/" + item identifier.
///
/// Nothing is escaped. The provider identifier has no "/" and the item identifier may have some, so
/// the first "/" divides them.
struct BookmarkableString {
  std::string providerIdentifier;
  std::string itemIdentifier;

  /// None unless the text starts with "storix:" in just this case, followed by a provider
  /// identifier, "/" and an item identifier whose part up to its own first "/" is not empty.
  static std::optional<BookmarkableString> parse(std::string_view text);

  [[nodiscard]] std::string text() const;
};

}  // namespace storix
