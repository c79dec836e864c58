#include "platform/linux/identity/UnitNames.h"

#include <algorithm>
#include <vector>

#include "platform/Log.h"

namespace storix::linuxhost {
namespace {

std::optional<std::string_view> withoutSuffix(std::string_view text, std::string_view suffix) {
  if (!text.ends_with(suffix)) return std::nullopt;
  text.remove_suffix(suffix.size());
  return text;
}

std::vector<std::string_view> split(std::string_view text, char separator) {
  std::vector<std::string_view> parts;
  for (;;) {
    const std::size_t end = text.find(separator);
    parts.push_back(text.substr(0, end));
    if (end == std::string_view::npos) return parts;
    text.remove_prefix(end + 1);
  }
}

std::string unescaped(std::string_view text) {
  constexpr std::string_view escapedDash = "\\x2d";
  std::string result;
  while (!text.empty()) {
    const bool dash = text.starts_with(escapedDash);
    result += dash ? '-' : text.front();
    text.remove_prefix(dash ? escapedDash.size() : 1);
  }
  return result;
}

/// The path of the peer in systemd's own hierarchy: the unified one, or on older systems a named one.
std::string_view cgroupPath(std::string_view cgroupText) {
  std::string_view named;
  for (const std::string_view line : split(cgroupText, '\n')) {
    const std::size_t first = line.find(':');
    const std::size_t second = first == std::string_view::npos ? first : line.find(':', first + 1);
    if (second == std::string_view::npos) continue;
    const std::string_view controllers = line.substr(first + 1, second - first - 1);
    const std::string_view path = line.substr(second + 1);
    if (controllers.empty() && path != "/") return path;
    if (controllers == "name=systemd") named = path;
  }
  return named;
}

}  // namespace

std::optional<std::string> applicationIdentifierFromUnit(std::string_view unit) {
  constexpr std::string_view prefix = "app-";
  if (!unit.starts_with(prefix)) return std::nullopt;
  unit.remove_prefix(prefix.size());

  // What is left is [<launcher>-]<identifier> and, of a scope, -<random>.
  std::vector<std::string_view> parts;
  if (const std::optional<std::string_view> scope = withoutSuffix(unit, ".scope")) {
    parts = split(*scope, '-');
    if (parts.size() < 2 || parts.back().empty()) return std::nullopt;
    parts.pop_back();
  } else if (const std::optional<std::string_view> service = withoutSuffix(unit, ".service")) {
    const std::size_t at = service->find('@');
    if (at != std::string_view::npos && at + 1 == service->size()) return std::nullopt;
    parts = split(service->substr(0, at), '-');
  }
  const auto isEmpty = [](std::string_view part) { return part.empty(); };
  if (parts.empty() || parts.size() > 2 || std::any_of(parts.begin(), parts.end(), isEmpty)) return std::nullopt;
  std::string identifier = unescaped(parts.back());
  if (!isUTF8(identifier)) return std::nullopt;
  return identifier;
}

std::optional<std::string> applicationIdentifierFromCgroup(std::string_view cgroupText) {
  const std::vector<std::string_view> components = split(cgroupPath(cgroupText), '/');
  for (auto component = components.rbegin(); component != components.rend(); ++component) {
    if (std::optional<std::string> identifier = applicationIdentifierFromUnit(*component)) return identifier;
  }
  return std::nullopt;
}

}  // namespace storix::linuxhost
