#include "platform/fake/FakeFiles.h"

#include <algorithm>
#include <deque>
#include <system_error>
#include <utility>
#include <vector>

namespace storix::fake {
namespace {

class FakeInputStream : public InputStream {
 public:
  FakeInputStream(std::string path, Result<Value> content) : path_(std::move(path)), content_(std::move(content)) {}

  [[nodiscard]] const std::string &path() const { return path_; }
  [[nodiscard]] const Result<Value> &content() const { return content_; }

 private:
  std::string path_;
  Result<Value> content_;
};

SXError fileError(std::errc reason, const std::string &doing) { return posixError(static_cast<int>(reason), doing); }

std::deque<std::string> componentsOf(std::string_view path) {
  std::deque<std::string> components;
  while (!path.empty()) {
    const std::size_t slash = path.find('/');
    if (slash != 0) components.emplace_back(path.substr(0, slash));
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return components;
}

std::string joined(const std::string &directory, const std::string &name) {
  return directory == "/" ? "/" + name : directory + "/" + name;
}

std::string parentOf(const std::string &path) {
  const std::size_t slash = path.rfind('/');
  return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

std::string_view mutabilityName(KeyedValueMutability mutability) {
  switch (mutability) {
    case KeyedValueMutability::immutable:
      return "immutable";
    case KeyedValueMutability::containers:
      return "containers";
    case KeyedValueMutability::containersAndLeaves:
      return "containersAndLeaves";
  }
  return "unknown";
}

/// Whether keyed-value text can carry it.
bool isKeyedValue(const Value &value) {
  static const std::set<ValueKind> kinds{ValueKind::boolean, ValueKind::number, ValueKind::string, ValueKind::list,
                                         ValueKind::dictionary};
  return kinds.contains(value.kind()) && holdsOnlyKinds(value, kinds);
}

void setFault(std::map<std::string, SXError> &faults, const std::string &path, std::optional<SXError> error) {
  faults.erase(path);
  if (error) faults.emplace(path, *std::move(error));
}

const SXError *faultAt(const std::map<std::string, SXError> &faults, const std::string &path) {
  const auto found = faults.find(path);
  return found == faults.end() ? nullptr : &found->second;
}

void setMember(std::set<std::string> &paths, const std::string &path, bool member) {
  if (member) {
    paths.insert(path);
  } else {
    paths.erase(path);
  }
}

}  // namespace

const FakeFiles::Node *FakeFiles::nodeAt(const std::string &path) const {
  const auto found = nodes_.find(path);
  return found == nodes_.end() ? nullptr : &found->second;
}

FakeFiles::Resolved FakeFiles::resolve(const std::string &path, int linksLeft) const {
  std::string resolved = "/";
  std::deque<std::string> rest = componentsOf(path);
  while (!rest.empty()) {
    const std::string component = std::move(rest.front());
    rest.pop_front();
    if (component == ".") continue;
    if (component == "..") {
      resolved = parentOf(resolved);
      continue;
    }
    std::string next = joined(resolved, component);
    const Node *node = nodeAt(next);
    const LinkNode *link = node ? std::get_if<LinkNode>(node) : nullptr;
    if (!link) {
      resolved = std::move(next);
      continue;
    }
    if (linksLeft-- == 0) return {path, nullptr};
    if (link->target.starts_with('/')) resolved = "/";
    const std::deque<std::string> target = componentsOf(link->target);
    rest.insert(rest.begin(), target.begin(), target.end());
  }
  return {resolved, nodeAt(resolved)};
}

void FakeFiles::put(const std::string &path, Node node) {
  for (std::string above = parentOf(path); above != "/"; above = parentOf(above)) {
    nodes_.try_emplace(above, DirectoryNode{});
  }
  nodes_.insert_or_assign(path, std::move(node));
}

void FakeFiles::makeDirectory(const std::string &path) {
  const std::lock_guard lock(mutex_);
  put(path, DirectoryNode{});
}

void FakeFiles::writeFile(const std::string &path, Value content) {
  const std::lock_guard lock(mutex_);
  put(path, std::move(content));
}

void FakeFiles::writeCorruptFile(const std::string &path, std::string bytes) {
  const std::lock_guard lock(mutex_);
  put(path, CorruptNode{std::move(bytes)});
}

void FakeFiles::makeSymbolicLink(const std::string &path, std::string target) {
  const std::lock_guard lock(mutex_);
  put(path, LinkNode{std::move(target)});
}

void FakeFiles::remove(const std::string &path) {
  const std::lock_guard lock(mutex_);
  std::erase_if(
      nodes_, [&path](const auto &entry) { return entry.first == path || entry.first.starts_with(joined(path, "")); });
}

bool FakeFiles::exists(const std::string &path) const {
  const std::lock_guard lock(mutex_);
  return resolve(path).node != nullptr;
}

std::optional<Value> FakeFiles::content(const std::string &path) const {
  const std::lock_guard lock(mutex_);
  const Node *node = resolve(path).node;
  const Value *value = node ? std::get_if<Value>(node) : nullptr;
  return value ? std::optional(*value) : std::nullopt;
}

std::optional<std::string> FakeFiles::corruptBytes(const std::string &path) const {
  const std::lock_guard lock(mutex_);
  const Node *node = resolve(path).node;
  const CorruptNode *corrupt = node ? std::get_if<CorruptNode>(node) : nullptr;
  return corrupt ? std::optional(corrupt->bytes) : std::nullopt;
}

std::size_t FakeFiles::writeCount(const std::string &path) const {
  const std::lock_guard lock(mutex_);
  const auto found = writeCounts_.find(path);
  return found == writeCounts_.end() ? 0 : found->second;
}

void FakeFiles::setUnopenable(const std::string &path, bool unopenable) {
  const std::lock_guard lock(mutex_);
  setMember(unopenable_, path, unopenable);
}

void FakeFiles::setUnwritable(const std::string &path, bool unwritable) {
  const std::lock_guard lock(mutex_);
  setMember(unwritable_, path, unwritable);
}

void FakeFiles::setReadError(const std::string &path, std::optional<SXError> error) {
  const std::lock_guard lock(mutex_);
  setFault(readErrors_, path, std::move(error));
}

void FakeFiles::setCreateDirectoryError(const std::string &path, std::optional<SXError> error) {
  const std::lock_guard lock(mutex_);
  setFault(createDirectoryErrors_, path, std::move(error));
}

void FakeFiles::setRelationshipError(const std::string &directoryPath, std::optional<SXError> error) {
  const std::lock_guard lock(mutex_);
  setFault(relationshipErrors_, directoryPath, std::move(error));
}

bool FakeFiles::fileExists(const std::string &path) {
  trace_.add("fileExists " + path);
  return exists(path);
}

std::optional<SXError> FakeFiles::createDirectory(const std::string &path, bool withIntermediateDirectories) {
  trace_.add("createDirectory " + path + (withIntermediateDirectories ? " with intermediates" : ""));
  const std::string doing = "Cannot make the directory " + path;
  const std::lock_guard lock(mutex_);
  if (const SXError *error = faultAt(createDirectoryErrors_, path)) return *error;
  const Resolved target = resolve(path);
  if (target.node) {
    const bool isDirectory = std::holds_alternative<DirectoryNode>(*target.node);
    if (isDirectory && withIntermediateDirectories) return std::nullopt;
    return fileError(std::errc::file_exists, doing);
  }
  for (std::string above = parentOf(target.path); above != "/"; above = parentOf(above)) {
    const Node *node = nodeAt(above);
    if (!node && !withIntermediateDirectories) return fileError(std::errc::no_such_file_or_directory, doing);
    if (node && !std::holds_alternative<DirectoryNode>(*node)) return fileError(std::errc::not_a_directory, doing);
  }
  put(target.path, DirectoryNode{});
  return std::nullopt;
}

std::unique_ptr<InputStream> FakeFiles::openFileInputStream(const std::string &path) {
  trace_.add("openFileInputStream " + path);
  const std::lock_guard lock(mutex_);
  const Node *node = resolve(path).node;
  if (!node || unopenable_.contains(path)) return nullptr;
  if (const SXError *error = faultAt(readErrors_, path)) return std::make_unique<FakeInputStream>(path, *error);
  if (const Value *value = std::get_if<Value>(node)) return std::make_unique<FakeInputStream>(path, *value);
  if (std::holds_alternative<CorruptNode>(*node)) {
    const SXError corrupt(std::string(filesErrorDomain), 1,
                          {{"description", "The file " + path + " is no keyed-value text."}});
    return std::make_unique<FakeInputStream>(path, corrupt);
  }
  return nullptr;
}

Result<Value> FakeFiles::readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability) {
  const auto *file = dynamic_cast<FakeInputStream *>(&stream);
  if (!file) return fileError(std::errc::invalid_argument, "Cannot read a stream that another host opened");
  trace_.add("readKeyedValueStream " + file->path() + " " + std::string(mutabilityName(mutability)));
  return file->content();
}

bool FakeFiles::writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path) {
  trace_.add("writeKeyedValueFileAtomically " + path + " " + escapedForLog(logDescription(content)));
  const std::lock_guard lock(mutex_);
  if (unwritable_.contains(path) || !isKeyedValue(content)) return false;
  const Resolved directory = resolve(parentOf(path));
  if (!directory.node || !std::holds_alternative<DirectoryNode>(*directory.node)) return false;
  const std::string target = joined(directory.path, path.substr(path.rfind('/') + 1));
  const Node *there = nodeAt(target);
  if (there && std::holds_alternative<DirectoryNode>(*there)) return false;
  put(target, Value(content));
  ++writeCounts_[path];
  return true;
}

Result<DirectoryRelationship> FakeFiles::directoryRelationship(const std::optional<URL> &directory,
                                                               const std::optional<URL> &item) {
  trace_.add("directoryRelationship " + logDescription(directory) + " " + logDescription(item));
  if (!directory) return fileError(std::errc::invalid_argument, "Cannot compare with a directory without a URL");
  const std::lock_guard lock(mutex_);
  if (const SXError *error = faultAt(relationshipErrors_, directory->path())) return *error;
  const Resolved outer = resolve(directory->path());
  if (!outer.node) return fileNotFoundForReading(*directory);
  if (!item) return fileError(std::errc::invalid_argument, "Cannot compare an item without a URL");
  const Resolved inner = resolve(item->path());
  if (inner.path == outer.path) return DirectoryRelationship::same;
  return inner.path.starts_with(joined(outer.path, "")) || outer.path == "/" ? DirectoryRelationship::contains
                                                                             : DirectoryRelationship::other;
}

}  // namespace storix::fake
