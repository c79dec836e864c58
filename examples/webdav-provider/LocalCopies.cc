#include "examples/webdav-provider/LocalCopies.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <filesystem>
#include <utility>

#include "examples/webdav-provider/KeyedValues.h"

namespace storix::example {

namespace {

constexpr int conflictNamesAtMost = 1000;
constexpr std::size_t companionAtMost = 64 * 1024;

std::string lastComponent(const std::string &path) { return path.substr(path.rfind('/') + 1); }

}  // namespace

Result<LocalCopies> LocalCopies::open(const std::string &directory) {
  auto tree = FolderTree::open(directory);
  if (!tree) return tree.error();
  return LocalCopies(directory, std::move(tree.value()));
}

Result<std::optional<LocalCopies::File>> LocalCopies::find(const std::string &path) const {
  auto file = tree_.openFile(path);
  if (!file) {
    if (file.error().code() == ENOENT) return std::optional<File>();
    return file.error();
  }
  struct stat status {};
  if (::fstat(file.value().get(), &status) != 0) return posixError(errno, "looking at \"" + path + "\"");
  return std::optional(File{std::move(file.value()), FileStamp::of(status)});
}

Result<UniqueFd> LocalCopies::openPartial(const std::string &path, std::int64_t good) const {
  auto incoming = tree_.openIncoming();
  if (!incoming) return incoming.error();
  UniqueFd file(::openat(incoming.value().get(), ItemStates::key(path).c_str(),
                         O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0)
    return posixError(errno, "making a temporary file for \"" + path + "\"");
  if (::ftruncate(file.get(), status.st_size < good ? 0 : good) != 0) {
    return posixError(errno, "preparing the download of \"" + path + "\"");
  }
  return file;
}

void LocalCopies::discardPartial(const std::string &path) const {
  if (auto incoming = tree_.openIncoming()) ::unlinkat(incoming.value().get(), ItemStates::key(path).c_str(), 0);
}

void LocalCopies::discardForgotten(const ItemStates &states) const {
  auto incoming = tree_.openIncoming();
  if (!incoming) return;
  std::error_code failed;
  for (std::filesystem::directory_iterator entry(directory_ + "/.incoming", failed), end; !failed && entry != end;
       entry.increment(failed)) {
    const std::string key = entry->path().filename().string();
    const auto state = states.readByKey(key);
    if (!state || state->partialLength == 0) ::unlinkat(incoming.value().get(), key.c_str(), 0);
  }
}

Result<FileStamp> LocalCopies::place(const std::string &path, int partial, std::optional<time_t> modificationTime,
                                     Replacing replacing) const {
  auto parent = tree_.openParentMakingIt(path);
  if (!parent) return parent.error();
  auto incoming = tree_.openIncoming();
  if (!incoming) return incoming.error();
  const std::string name = lastComponent(path);
  if (modificationTime) {
    const std::array<timespec, 2> times{timespec{0, UTIME_OMIT}, timespec{*modificationTime, 0}};
    ::futimens(partial, times.data());
  }
  struct stat status {};
  if (::fstatat(parent.value().get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode) &&
      ::fchmod(partial, status.st_mode & 0777U) != 0) {
    return posixError(errno, "setting the permissions of \"" + path + "\"");
  }
  if (::fstat(partial, &status) != 0) return posixError(errno, "looking at the download of \"" + path + "\"");
  if (::fsync(partial) != 0 ||
      ::renameat2(incoming.value().get(), ItemStates::key(path).c_str(), parent.value().get(), name.c_str(),
                  replacing == Replacing::no ? RENAME_NOREPLACE : 0) != 0 ||
      ::fsync(parent.value().get()) != 0) {
    return posixError(errno, "putting \"" + path + "\" in place");
  }
  return FileStamp::of(status);
}

Result<std::string> LocalCopies::keepUnderConflictName(const std::string &path) const {
  auto parent = tree_.openParentMakingIt(path);
  if (!parent) return parent.error();
  const std::string name = lastComponent(path);
  for (int n = 1; n <= conflictNamesAtMost; ++n) {
    std::string kept = conflictName(path, n);
    if (::linkat(parent.value().get(), name.c_str(), parent.value().get(), lastComponent(kept).c_str(), 0) == 0) {
      if (::fsync(parent.value().get()) != 0) return posixError(errno, "keeping \"" + kept + "\"");
      return kept;
    }
    if (errno != EEXIST) return posixError(errno, "keeping \"" + path + "\" as \"" + kept + "\"");
  }
  return posixError(EEXIST, "keeping \"" + path + "\" under another name");
}

std::optional<SXError> LocalCopies::makeDirectory(const std::string &path) const {
  if (auto refused = FolderTree::checkPath(path)) return refused;
  auto made = tree_.openParentMakingIt(path + "/x");
  return made ? std::nullopt : std::optional(made.error());
}

Result<std::optional<std::string>> LocalCopies::readCompanion(const std::string &path) const {
  if (auto refused = FolderTree::checkPath(path)) return *refused;
  const auto parent = tree_.openParentMakingIt(path);
  if (!parent) return parent.error();
  const std::string name = "." + lastComponent(path);
  const UniqueFd file(::openat(parent.value().get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!file && errno == ENOENT) return std::optional<std::string>();
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return posixError(EEXIST, "reading the companion of \"" + path + "\"");
  }
  auto text = readWhole(file.get(), companionAtMost);
  if (!text) return posixError(EEXIST, "reading the companion of \"" + path + "\"");
  return std::optional(std::move(text.value()));
}

std::vector<std::string> LocalCopies::items() const {
  std::vector<std::string> found;
  std::error_code failed;
  for (std::filesystem::recursive_directory_iterator entry(directory_, failed), end; !failed && entry != end;
       entry.increment(failed)) {
    std::string path = entry->path().string().substr(directory_.size() + 1);
    std::error_code gone;
    if (FolderTree::checkPath(path)) {
      entry.disable_recursion_pending();
    } else if (entry->symlink_status(gone).type() == std::filesystem::file_type::regular) {
      found.push_back(std::move(path));
    }
  }
  return found;
}

std::string conflictName(const std::string &path, int n) {
  constexpr std::string_view mark = " (conflict";
  const std::size_t name = path.rfind('/') + 1;
  const std::size_t dot = path.rfind('.');
  const std::size_t end = dot == std::string::npos || dot <= name ? path.size() : dot;
  std::string stem = path.substr(0, end);
  int own = 0;
  if (const std::size_t begin = stem.rfind(mark); begin != std::string::npos && begin > name && stem.ends_with(')')) {
    const std::string number = stem.substr(begin + mark.size(), stem.size() - 1 - begin - mark.size());
    int parsed = 0;
    const char *last = number.data() + number.size();
    if (number.empty()) {
      own = 1;
    } else if (const auto [rest, error] = std::from_chars(number.data() + 1, last, parsed);
               number[0] == ' ' && error == std::errc() && rest == last && parsed > 1 && parsed < 1'000'000) {
      own = parsed;
    }
    if (own > 0) stem.resize(begin);
  }
  const int number = own + n;
  return stem + (number == 1 ? " (conflict)" : " (conflict " + std::to_string(number) + ")") + path.substr(end);
}

}  // namespace storix::example
