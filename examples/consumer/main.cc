// An application that is given documents, as small as it can be:
//
//   consumer open TOKEN [--content]       opens the document of a token (base64 text)
//   consumer resolve STRING [--content]   finds the document of a bookmarkable string, and opens it
//
// It prints the document's SHA-256, or its content. Exit status: 0, 1 when the document could not be
// opened, 2 for a wrong call.

#include <sodium.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "storix/Client.h"

namespace {

int complain(const storix::SXError &error) {
  std::fprintf(stderr, "consumer: %s\n", error.message().c_str());
  return 1;
}

std::optional<storix::Data> tokenFrom(std::string_view text) {
  storix::Data token{std::string(text.size(), '\0')};
  std::size_t size = 0;
  if (sodium_base642bin(reinterpret_cast<unsigned char *>(token.bytes.data()), token.bytes.size(), text.data(),
                        text.size(), nullptr, &size, nullptr, sodium_base64_VARIANT_ORIGINAL) != 0) {
    return std::nullopt;
  }
  token.bytes.resize(size);
  return token;
}

std::string hexadecimal(const std::array<unsigned char, crypto_hash_sha256_BYTES> &hash) {
  std::string text(2 * hash.size() + 1, '\0');
  sodium_bin2hex(text.data(), text.size(), hash.data(), hash.size());
  text.pop_back();
  return text;
}

/// Prints the content, or its checksum.
int show(int document, bool content) {
  crypto_hash_sha256_state state;
  crypto_hash_sha256_init(&state);
  auto buffer = std::make_unique<std::array<unsigned char, std::size_t{256} << 10>>();
  for (;;) {
    const ssize_t count = ::read(document, buffer->data(), buffer->size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return complain(storix::posixError(errno, "reading the document"));
    if (count == 0) break;
    const auto size = static_cast<std::size_t>(count);
    crypto_hash_sha256_update(&state, buffer->data(), size);
    if (content && std::fwrite(buffer->data(), 1, size, stdout) != size) {
      return complain(storix::posixError(errno, "writing the content"));
    }
  }
  std::array<unsigned char, crypto_hash_sha256_BYTES> hash{};
  crypto_hash_sha256_final(&state, hash.data());
  if (!content) std::printf("%s\n", hexadecimal(hash).c_str());
  return std::fflush(stdout) == 0 ? 0 : complain(storix::posixError(errno, "writing the content"));
}

int open(storix::Client &client, std::string_view token, bool content) {
  const auto data = tokenFrom(token);
  if (!data) return complain(storix::posixError(EINVAL, "reading the token"));
  const auto document = client.open(*data);
  return document ? show(document.value().get(), content) : complain(document.error());
}

int resolve(storix::Client &client, const std::string &bookmarkableString, bool content) {
  const auto granted = client.resolveBookmark(bookmarkableString);
  if (!granted) return complain(granted.error());
  const auto document = client.openDocument(granted.value());
  return document ? show(document.value().get(), content) : complain(document.error());
}

}  // namespace

int main(int count, char **values) {
  const std::string_view verb = count > 1 ? values[1] : "";
  const bool content = count == 4 && std::string_view(values[3]) == "--content";
  if ((count != 3 && !content) || (verb != "open" && verb != "resolve")) {
    std::fprintf(stderr, "usage: consumer open TOKEN [--content]\n       consumer resolve STRING [--content]\n");
    return 2;
  }
  storix::Client client;
  return verb == "open" ? open(client, values[2], content) : resolve(client, values[2], content);
}
