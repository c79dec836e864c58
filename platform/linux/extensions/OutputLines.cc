#include "platform/linux/extensions/OutputLines.h"

#include <algorithm>
#include <utility>

namespace storix::linuxhost {

void OutputLines::append(std::string_view bytes) {
  while (!bytes.empty()) {
    const std::size_t end = std::min(bytes.find('\n'), bytes.size());
    const std::size_t room = lineLimit - line_.size();
    line_ += bytes.substr(0, std::min(end, room));
    if (end > room) isCut_ = true;
    if (end == bytes.size()) return;
    endLine();
    bytes.remove_prefix(end + 1);
  }
}

void OutputLines::finish() {
  if (!line_.empty()) endLine();
}

void OutputLines::endLine() {
  if (isCut_) line_ += " [cut]";
  isCut_ = false;
  // The buffer is this object's again before anyone else runs.
  const std::string line = std::exchange(line_, std::string());
  if (!line.empty()) takeLine_(line);
}

}  // namespace storix::linuxhost
