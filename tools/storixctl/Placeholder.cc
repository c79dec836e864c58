#include "tools/storixctl/Placeholder.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <string>

#include "platform/linux/files/KeyedValueFile.h"
#include "wire/UniqueFd.h"

namespace storix::ctl {

namespace {

constexpr off_t largest = 64 * 1024;

std::optional<std::uint64_t> byteCountOf(const Dictionary &content, std::string_view key) {
  const auto found = content.find(key);
  const std::int64_t *number = found == content.end() ? nullptr : found->second.integer();
  return number && *number >= 0 ? std::optional(static_cast<std::uint64_t>(*number)) : std::nullopt;
}

}  // namespace

Placeholder readPlaceholder(const URL &document) {
  const std::string name = "." + document.lastPathComponent();
  const std::string path = document.deletingLastPathComponent().appendingPathComponent(name).path();
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_size > largest) return {};
  const auto content = linuxhost::readKeyedValues(file.get(), name, largest);
  if (!content) return {};
  return {byteCountOf(content.value(), "size"), byteCountOf(content.value(), "received")};
}

}  // namespace storix::ctl
