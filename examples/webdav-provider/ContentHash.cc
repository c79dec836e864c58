#include "examples/webdav-provider/ContentHash.h"

#include <unistd.h>

#include <array>
#include <cerrno>

namespace storix::example {

void ContentHash::reset() { ::crypto_generichash_init(&state_, nullptr, 0, crypto_generichash_BYTES); }

void ContentHash::add(std::string_view bytes) {
  ::crypto_generichash_update(&state_, reinterpret_cast<const unsigned char *>(bytes.data()), bytes.size());
}

std::string ContentHash::finish() {
  std::array<unsigned char, crypto_generichash_BYTES> hash{};
  ::crypto_generichash_final(&state_, hash.data(), hash.size());
  std::array<char, 2 * crypto_generichash_BYTES + 1> text{};
  ::sodium_bin2hex(text.data(), text.size(), hash.data(), hash.size());
  return text.data();
}

std::string ContentHash::of(std::string_view text) {
  ContentHash hash;
  hash.add(text);
  return hash.finish();
}

Result<std::string> ContentHash::ofFile(int file) {
  constexpr std::size_t step = std::size_t{256} << 10;
  const auto buffer = std::make_unique<std::array<char, step>>();
  ContentHash hash;
  for (off_t offset = 0;;) {
    const ssize_t count = ::pread(file, buffer->data(), buffer->size(), offset);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return posixError(errno, "reading a document");
    if (count == 0) return hash.finish();
    hash.add({buffer->data(), static_cast<std::size_t>(count)});
    offset += count;
  }
}

}  // namespace storix::example
