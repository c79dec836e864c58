// Names of systemd units and the text of /proc/<pid>/cgroup, a name of which the process may choose.

#include "platform/linux/identity/UnitNames.h"
#include "tests/fuzz/Target.h"

using storix::fuzz::require;

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  const std::string_view text = storix::fuzz::textOf(bytes, size);
  if (const auto identifier = storix::linuxhost::applicationIdentifierFromUnit(text)) {
    require(!identifier->empty(), "a unit names an application without a name");
    require(text.starts_with("app-"), "a unit that is no application's names one");
  }
  if (const auto identifier = storix::linuxhost::applicationIdentifierFromCgroup(text)) {
    require(!identifier->empty(), "a control group names an application without a name");
  }
  return 0;
}
