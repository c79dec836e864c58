// Keyed-value text: what is understood can be written, and reads back as the same.

#include "platform/linux/files/KeyedValueFile.h"
#include "tests/fuzz/Target.h"

using storix::Dictionary;
using storix::Result;
using storix::fuzz::require;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const Result<Dictionary> read = storix::linuxhost::parseKeyedValues(storix::fuzz::textOf(bytes, size), "input");
  if (!read) {
    require(!read.error().message().empty(), "a refusal says nothing");
    return 0;
  }
  const Result<std::string> text = storix::linuxhost::keyedValueText(read.value());
  require(text.ok(), "what was read cannot be written");
  const Result<Dictionary> again = storix::linuxhost::parseKeyedValues(text.value(), "own text");
  require(again.ok(), "what was written cannot be read");
  require(again.value() == read.value(), "what was written reads differently");
  const Result<std::string> textAgain = storix::linuxhost::keyedValueText(again.value());
  require(textAgain.ok() && textAgain.value() == text.value(), "the same content gives two texts");
  return 0;
}
