#include "platform/linux/extensions/ConfinementWishes.h"

#include <algorithm>

#include "platform/linux/files/KeyedValueFile.h"

namespace storix::linuxhost {

namespace {

/// An absolute path, or one below the home directory, that goes straight down.
bool isPlainPath(std::string_view path) {
  if (path.starts_with("~/")) path.remove_prefix(1);
  if (!path.starts_with('/') || path.find('\0') != std::string_view::npos) return false;
  while (!path.empty()) {
    path.remove_prefix(1);
    const std::size_t end = std::min(path.find('/'), path.size());
    const std::string_view component = path.substr(0, end);
    if (component == "." || component == "..") return false;
    path.remove_prefix(end);
  }
  return true;
}

std::string withoutRepeatedSlashes(std::string_view path) {
  std::string plain;
  for (const char character : path) {
    if (character != '/' || !plain.ends_with('/')) plain += character;
  }
  if (plain.size() > 1 && plain.ends_with('/') && plain != "~/") plain.pop_back();
  return plain;
}

Result<std::vector<std::string>> pathsOf(const std::string &key, const Value &value) {
  std::vector<std::string> paths;
  const List *list = value.list();
  if (!list) return keyedValueFormatError("\"" + key + "\" in \"KTSandbox\" must be a list of paths.");
  for (const Value &entry : *list) {
    const std::string *path = entry.string();
    if (!path || !isPlainPath(*path)) {
      return keyedValueFormatError(
          "\"" + key +
          "\" in \"KTSandbox\" must hold paths that are absolute or begin with \"~/\", without \".\" "
          "and \"..\".");
    }
    paths.push_back(withoutRepeatedSlashes(*path));
  }
  return paths;
}

}  // namespace

Result<ConfinementWishes> confinementWishes(const Dictionary &info) {
  ConfinementWishes wishes;
  const auto found = info.find(confinementWishesKey);
  if (found == info.end()) return wishes;
  const Dictionary *content = found->second.dictionary();
  if (!content) return keyedValueFormatError("\"KTSandbox\" must be a dictionary.");
  for (const auto &[key, value] : *content) {
    if (key == "network") {
      const bool *network = value.boolean();
      if (!network) return keyedValueFormatError("\"network\" in \"KTSandbox\" must be true or false.");
      wishes.network = *network;
    } else if (key == "readOnly" || key == "readWrite") {
      Result<std::vector<std::string>> paths = pathsOf(key, value);
      if (!paths) return paths.error();
      (key == "readOnly" ? wishes.readOnly : wishes.readWrite) = std::move(paths.value());
    } else {
      return keyedValueFormatError("\"KTSandbox\" holds \"" + key +
                                   "\"; it may hold \"network\", \"readOnly\" and \"readWrite\" alone.");
    }
  }
  for (const std::string &path : wishes.readOnly) {
    if (std::find(wishes.readWrite.begin(), wishes.readWrite.end(), path) == wishes.readWrite.end()) continue;
    return keyedValueFormatError("\"KTSandbox\" asks for " + path + " in both \"readOnly\" and \"readWrite\".");
  }
  return wishes;
}

}  // namespace storix::linuxhost
