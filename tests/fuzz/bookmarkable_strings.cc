// Bookmarkable strings: what is understood is written as it was.

#include "service/BookmarkableString.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  const std::optional<storix::BookmarkableString> parsed = storix::BookmarkableString::parse(text);
  if (!parsed) return 0;
  require(parsed->text() == text, "the text is another one now");
  require(!parsed->providerIdentifier.empty(), "there is no provider");
  require(parsed->providerIdentifier.find('/') == std::string::npos, "the provider's identifier has a slash");
  require(!parsed->itemIdentifier.empty(), "there is no item");
  return 0;
}
