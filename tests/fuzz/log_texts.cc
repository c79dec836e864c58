// Texts from outside on their way into the log, and what an extension writes to its output.

#include "platform/Log.h"
#include "platform/linux/extensions/OutputLines.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;

namespace {

bool isPrintable(std::string_view text) {
  for (const char character : text) {
    const auto byte = static_cast<unsigned char>(character);
    if (byte < ' ' || byte == 127) return false;
  }
  // The control characters beyond ASCII, U+0080 to U+009F, and the separators of lines and paragraphs.
  for (std::size_t i = 0; i + 1 < text.size(); ++i) {
    const auto first = static_cast<unsigned char>(text[i]);
    const auto second = static_cast<unsigned char>(text[i + 1]);
    if (first == 0xc2 && second < 0xa0) return false;
    if (first == 0xe2 && second == 0x80 && i + 2 < text.size()) {
      const auto third = static_cast<unsigned char>(text[i + 2]);
      if (third == 0xa8 || third == 0xa9) return false;
    }
  }
  return storix::isUTF8(text);
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  require(isPrintable(storix::escapedForLog(text)), "an escaped text is not printable");
  std::size_t taken = 0;
  storix::linuxhost::OutputLines lines([&taken](std::string_view line) {
    require(line.size() <= storix::linuxhost::OutputLines::lineLimit + 16, "a line is longer than the limit");
    require(line.find('\n') == std::string_view::npos, "a line has a line end");
    taken += line.size();
  });
  // In two pieces, wherever the cut is.
  const std::size_t cut = size > 0 ? bytes[0] % size : 0;
  lines.append(text.substr(0, cut));
  lines.append(text.substr(cut));
  lines.finish();
  require(taken <= size + 64 * (size / storix::linuxhost::OutputLines::lineLimit + 1), "lines came from nowhere");
  return 0;
}
