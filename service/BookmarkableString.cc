#include "service/BookmarkableString.h"

namespace storix {

namespace {

constexpr std::string_view prefix = "storix:";

}  // namespace

std::optional<BookmarkableString> BookmarkableString::parse(std::string_view text) {
  if (!text.starts_with(prefix)) return std::nullopt;
  const std::string_view rest = text.substr(prefix.size());
  const std::size_t divider = rest.find('/');
  if (divider == std::string_view::npos) return std::nullopt;
  const std::string_view provider = rest.substr(0, divider);
  const std::string_view item = rest.substr(divider + 1);
  if (provider.empty() || item.empty() || item.starts_with('/')) return std::nullopt;
  return BookmarkableString{std::string(provider), std::string(item)};
}

std::string BookmarkableString::text() const {
  std::string text(prefix);
  return text.append(providerIdentifier).append("/").append(itemIdentifier);
}

}  // namespace storix
