#include "platform/linux/identity/Tokens.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/linux/files/PathText.h"
#include "platform/linux/identity/ProcessFiles.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr std::string_view version = "storix1.";
constexpr char readWriteClass = 'w';
constexpr std::size_t randomBytes = 16;
constexpr std::size_t macBytes = crypto_auth_BYTES;
/// A path is at most 4096 bytes, and base64 makes four of three.
constexpr std::size_t tokenLimit = 8192;
constexpr int encoding = sodium_base64_VARIANT_URLSAFE_NO_PADDING;

constexpr const char *keyName = "token-key";
constexpr const char *newKeyName = ".token-key.new";
constexpr mode_t keyMode = 0600;

const unsigned char *bytesOf(std::string_view text) { return reinterpret_cast<const unsigned char *>(text.data()); }

std::string encoded(const unsigned char *bytes, std::size_t count) {
  std::string text(sodium_base64_encoded_len(count, encoding), '\0');
  sodium_bin2base64(text.data(), text.size(), bytes, count, encoding);
  text.pop_back();  // Its zero byte.
  return text;
}

/// None for every text but the one that `encoded` makes: the library takes some bytes beyond ASCII for
/// letters of its alphabet.
std::optional<std::string> decoded(std::string_view text) {
  std::string bytes(text.size(), '\0');
  std::size_t count = 0;
  if (sodium_base642bin(reinterpret_cast<unsigned char *>(bytes.data()), bytes.size(), text.data(), text.size(),
                        nullptr, &count, nullptr, encoding) != 0) {
    return std::nullopt;
  }
  bytes.resize(count);
  if (encoded(bytesOf(bytes), bytes.size()) != text) return std::nullopt;
  return bytes;
}

/// The key, if the file is one that was written here.
std::optional<std::string> readKey(int directory, std::size_t size) {
  struct stat status {};
  if (::fstatat(directory, keyName, &status, AT_SYMLINK_NOFOLLOW) != 0) return std::nullopt;
  const bool ours = S_ISREG(status.st_mode) && (status.st_mode & 07777) == keyMode && status.st_uid == ::geteuid() &&
                    status.st_nlink == 1;
  if (!ours) return std::nullopt;
  std::optional<std::string> key = readSmallFile(directory, keyName, size);
  if (key && key->size() != size) key.reset();
  return key;
}

/// 0, or an errno. One daemon at a time has the runtime directory, so nobody else does this meanwhile.
int writeKey(int directory, const unsigned char *key, std::size_t size) {
  if (::unlinkat(directory, newKeyName, 0) != 0 && errno != ENOENT) return errno;
  const UniqueFd fd(::openat(directory, newKeyName, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, keyMode));
  if (!fd || ::fchmod(fd.get(), keyMode) != 0) return errno;
  const ssize_t written = ::write(fd.get(), key, size);
  if (written != static_cast<ssize_t>(size)) return written < 0 ? errno : EIO;
  if (::renameat(directory, newKeyName, directory, keyName) == 0) return 0;
  const int error = errno;
  ::unlinkat(directory, newKeyName, 0);
  return error;
}

}  // namespace

Result<TokenSealer> TokenSealer::open(const std::string &runtimeDirectory) {
  static_assert(keyBytes == crypto_auth_KEYBYTES);
  if (sodium_init() < 0) return posixError(ENOSYS, "Cannot prepare the library that seals tokens");
  const UniqueFd directory(::open(runtimeDirectory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory) return posixError(errno, "Cannot open the runtime directory " + quotedPath(runtimeDirectory));

  TokenSealer sealer;
  if (const std::optional<std::string> key = readKey(directory.get(), keyBytes)) {
    key->copy(reinterpret_cast<char *>(sealer.key_.data()), keyBytes);
    return sealer;
  }
  if (::faccessat(directory.get(), keyName, F_OK, AT_SYMLINK_NOFOLLOW) == 0) {
    sx_default_log().notice("[NOTICE] Replacing the token key in %@, which was not written by this daemon.",
                            runtimeDirectory);
  }
  randombytes_buf(sealer.key_.data(), keyBytes);
  if (const int error = writeKey(directory.get(), sealer.key_.data(), keyBytes)) {
    return posixError(error, "Cannot write the token key into the runtime directory " + quotedPath(runtimeDirectory));
  }
  return sealer;
}

std::string TokenSealer::seal(const TokenPayload &payload) const {
  std::string bytes(1 + randomBytes, readWriteClass);
  randombytes_buf(bytes.data() + 1, randomBytes);
  bytes += payload.path;
  const std::string sealed = std::string(version) + encoded(bytesOf(bytes), bytes.size());
  std::array<unsigned char, macBytes> mac{};
  crypto_auth(mac.data(), bytesOf(sealed), sealed.size(), key_.data());
  return sealed + "." + encoded(mac.data(), mac.size());
}

std::optional<TokenPayload> TokenSealer::unseal(std::string_view token) const {
  if (token.size() > tokenLimit || !token.starts_with(version)) return std::nullopt;
  const std::size_t end = token.rfind('.');
  const std::string_view sealed = token.substr(0, end);
  const std::optional<std::string> mac = decoded(token.substr(end + 1));
  if (sealed.size() < version.size() || !mac || mac->size() != macBytes ||
      crypto_auth_verify(bytesOf(*mac), bytesOf(sealed), sealed.size(), key_.data()) != 0) {
    return std::nullopt;
  }
  const std::optional<std::string> bytes = decoded(sealed.substr(version.size()));
  if (!bytes || bytes->size() <= 1 + randomBytes || bytes->front() != readWriteClass) return std::nullopt;
  return TokenPayload{SandboxExtensionClass::readWrite, bytes->substr(1 + randomBytes)};
}

}  // namespace storix::linuxhost
