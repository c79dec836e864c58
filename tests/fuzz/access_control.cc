// The file with the grants: what is understood answers questions, and can be changed and written.

#include "access/AccessControlMap.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "tests/fuzz/Target.h"

using storix::AccessControlMap;
using storix::fuzz::require;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  auto read = storix::linuxhost::parseKeyedValues(storix::fuzz::textOf(bytes, size), "input");
  if (!read) return 0;
  const storix::Dictionary content = read.value();
  auto made = AccessControlMap::fromValue(std::move(read.value()));
  if (!made) {
    require(!made.error().message().empty(), "a refusal says nothing");
    return 0;
  }
  AccessControlMap &map = made.value();
  require(map.dictionary() == content, "reading changed the grants");
  const bool wasThere = map.contains("provider", "item", "consumer");
  require(map.add("provider", "item", "consumer") != wasThere, "a grant is added twice, or not at all");
  require(map.contains("provider", "item", "consumer"), "a grant that was added is not there");
  require(storix::linuxhost::keyedValueText(map.dictionary()).ok(), "the grants cannot be written");
  require(map.remove("provider", "item", "consumer"), "a grant that is there cannot be removed");
  require(!map.contains("provider", "item", "consumer"), "a grant that was removed is there");
  return 0;
}
