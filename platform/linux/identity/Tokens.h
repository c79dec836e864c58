#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/PlatformServices.h"
#include "platform/Result.h"

namespace storix::linuxhost {

/// What a token says: how its bearer may open which path.
struct TokenPayload {
  SandboxExtensionClass extensionClass = SandboxExtensionClass::readWrite;
  std::string path;
  friend bool operator==(const TokenPayload &, const TokenPayload &) = default;
};

/// Makes the texts of tokens and tells them from forgeries; docs/tokens.md has the format. Holds the
/// key, which every daemon on the same runtime directory shares. Thread-safe: nothing changes.
class TokenSealer {
 public:
  /// Reads the key from the runtime directory, or makes one. A key file that could not have been
  /// written here (another size, mode, owner or kind) is replaced, and its tokens die with it.
  static Result<TokenSealer> open(const std::string &runtimeDirectory);

  [[nodiscard]] std::string seal(const TokenPayload &payload) const;

  /// None unless the text was made by `seal` with this key. Nothing of the payload is looked at
  /// before that is certain.
  [[nodiscard]] std::optional<TokenPayload> unseal(std::string_view token) const;

 private:
  static constexpr std::size_t keyBytes = 32;
  TokenSealer() = default;

  std::array<unsigned char, keyBytes> key_{};
};

}  // namespace storix::linuxhost
