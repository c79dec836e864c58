#include "platform/linux/identity/FlatpakInfo.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <map>
#include <system_error>

#include "platform/Log.h"

namespace storix::linuxhost {
namespace {

constexpr std::string_view policyPrefix = "Policy ";
constexpr std::string_view blanks = " \t";

using Group = std::map<std::string, std::string, std::less<>>;
using Groups = std::map<std::string, Group, std::less<>>;

std::string_view withoutBlanks(std::string_view text) {
  const std::size_t start = text.find_first_not_of(blanks);
  if (start == std::string_view::npos) return {};
  return text.substr(start, text.find_last_not_of(blanks) - start + 1);
}

bool hasControlCharacter(std::string_view text) {
  return std::any_of(text.begin(), text.end(),
                     [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7F; });
}

/// Escapes other than these, such as the one before the separator of a list, stay as they are.
std::string unescaped(std::string_view text) {
  static const std::map<char, char> escapes{{'s', ' '}, {'n', '\n'}, {'t', '\t'}, {'r', '\r'}, {'\\', '\\'}};
  std::string result;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const auto escape = text[i] == '\\' && i + 1 < text.size() ? escapes.find(text[i + 1]) : escapes.end();
    if (escape == escapes.end()) {
      result += text[i];
    } else {
      result += escape->second;
      ++i;
    }
  }
  return result;
}

std::optional<std::string_view> groupName(std::string_view line) {
  if (line.size() < 3 || line.front() != '[' || line.back() != ']') return std::nullopt;
  const std::string_view name = line.substr(1, line.size() - 2);
  if (name.find_first_of("[]") != std::string_view::npos || hasControlCharacter(name)) return std::nullopt;
  return name;
}

bool addEntry(Group &group, std::string_view line) {
  const std::size_t sign = line.find('=');
  if (sign == std::string_view::npos) return false;
  const std::string_view key = withoutBlanks(line.substr(0, sign));
  if (key.empty() || key.data() != line.data() || hasControlCharacter(key)) return false;
  std::string_view value = line.substr(sign + 1);
  value.remove_prefix(std::min(value.find_first_not_of(blanks), value.size()));
  return group.emplace(key, unescaped(value)).second;
}

std::optional<Groups> parseGroups(std::string_view text) {
  if (!isUTF8(text) || text.find('\0') != std::string_view::npos) return std::nullopt;
  Groups groups;
  Group *group = nullptr;
  while (!text.empty()) {
    const std::size_t end = text.find('\n');
    std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    if (line.ends_with('\r')) line.remove_suffix(1);
    if (line.starts_with('#') || withoutBlanks(line).empty()) continue;
    if (line.front() == '[') {
      const std::optional<std::string_view> name = groupName(line);
      if (!name) return std::nullopt;
      const auto [place, isNew] = groups.emplace(*name, Group());
      if (!isNew) return std::nullopt;
      group = &place->second;
    } else if (!group || !addEntry(*group, line)) {
      return std::nullopt;
    }
  }
  return groups;
}

/// An optional sign and digits, with a fraction or without.
bool isDecimalNumber(std::string_view text) {
  if (text.starts_with('-')) text.remove_prefix(1);
  const auto digits = [](std::string_view part) {
    return !part.empty() && part.find_first_not_of("0123456789") == std::string_view::npos;
  };
  const std::size_t point = text.find('.');
  return digits(text.substr(0, point)) && (point == std::string_view::npos || digits(text.substr(point + 1)));
}

Value entitlementFromText(const std::string &text) {
  if (text == "true" || text == "false") return text == "true";
  if (!isDecimalNumber(text)) return text;
  const char *const end = text.data() + text.size();
  std::int64_t whole = 0;
  if (const auto result = std::from_chars(text.data(), end, whole); result.ec == std::errc() && result.ptr == end) {
    return whole;
  }
  double real = 0;
  const auto result = std::from_chars(text.data(), end, real);
  return result.ec == std::errc() && std::isfinite(real) ? Value(real) : Value(text);
}

}  // namespace

std::optional<FlatpakInfo> parseFlatpakInfo(std::string_view text) {
  const std::optional<Groups> groups = parseGroups(text);
  if (!groups) return std::nullopt;
  FlatpakInfo info;
  for (const auto &[name, group] : *groups) {
    if (name == "Application") {
      const auto found = group.find("name");
      if (found != group.end() && !found->second.empty()) info.applicationName = found->second;
    } else if (name.starts_with(policyPrefix)) {
      const std::string subsystem(std::string_view(name).substr(policyPrefix.size()));
      for (const auto &[key, value] : group) {
        info.entitlements.insert_or_assign(subsystem + "." + key, entitlementFromText(value));
      }
    }
  }
  return info;
}

}  // namespace storix::linuxhost
