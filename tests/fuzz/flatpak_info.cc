// .flatpak-info: the text by which a sandbox says who is in it.

#include "platform/Log.h"
#include "platform/linux/identity/FlatpakInfo.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  const std::optional<storix::linuxhost::FlatpakInfo> info = storix::linuxhost::parseFlatpakInfo(text);
  if (!info) return 0;
  require(storix::isUTF8(text), "a text that is not UTF-8 was understood");
  require(!info->applicationName || !info->applicationName->empty(), "an empty name counts");
  for (const auto &[name, value] : info->entitlements) {
    require(name.find('.') != std::string::npos, "an entitlement has no subsystem");
    require(value.boolean() || value.integer() || value.real() || value.string(), "an entitlement is of another kind");
  }
  return 0;
}
