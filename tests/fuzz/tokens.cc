// Tokens: nothing that was not sealed here is a token, and what was sealed reads as it was.

#include "platform/linux/identity/Tokens.h"
#include "tests/fuzz/FuzzDirectory.h"
#include "tests/fuzz/Target.h"

using storix::SandboxExtensionClass;
using storix::fuzz::require;
using storix::linuxhost::TokenPayload;
using storix::linuxhost::TokenSealer;

namespace {

const TokenSealer &sealer() {
  static const storix::fuzz::FuzzDirectory directory;
  static const storix::Result<TokenSealer> opened = TokenSealer::open(directory.path());
  require(opened.ok(), "there is no key");
  return opened.value();
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  require(!sealer().unseal(text), "an invented text is a token");

  // The bytes as a path, and the token with one character changed: where and how, the bytes say.
  if (size < 2 || size > 4096 || text.find('\0') != std::string_view::npos) return 0;
  const TokenPayload payload{SandboxExtensionClass::readWrite, "/" + std::string(text)};
  std::string token = sealer().seal(payload);
  const std::optional<TokenPayload> unsealed = sealer().unseal(token);
  require(!unsealed || *unsealed == payload, "a token says something else now");
  require(unsealed || payload.path.size() >= 4096, "a token is none");
  char &changed = token[bytes[0] * token.size() / 256];
  const auto other = static_cast<char>(bytes[1]);
  if (changed == other) return 0;
  changed = other;
  require(!sealer().unseal(token), "a changed token is one");
  require(!sealer().unseal(token.substr(0, token.size() - 1)), "a cut token is one");
  return 0;
}
