#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <variant>

#include "platform/PlatformServices.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// A tree of directories, keyed-value files and symbolic links in memory, with the faults that a test
/// puts in. Paths are absolute; what a test makes gets the directories above it. Thread-safe.
class FakeFiles {
 public:
  explicit FakeFiles(Trace &trace) : trace_(trace) {}

  // --- What tests arrange and look at; none of it is traced

  void makeDirectory(const std::string &path);
  void writeFile(const std::string &path, Value content);
  /// A file that is no keyed-value text.
  void writeCorruptFile(const std::string &path, std::string bytes);
  /// `target` is absolute, or relative to the directory of the link.
  void makeSymbolicLink(const std::string &path, std::string target);
  void remove(const std::string &path);

  [[nodiscard]] bool exists(const std::string &path) const;
  /// What a file holds; none when there is none or it is corrupt.
  [[nodiscard]] std::optional<Value> content(const std::string &path) const;
  /// The bytes of a corrupt file, else none.
  [[nodiscard]] std::optional<std::string> corruptBytes(const std::string &path) const;
  /// How often the file was written through the platform, successfully.
  [[nodiscard]] std::size_t writeCount(const std::string &path) const;

  // Faults; the last argument takes them back.
  void setUnopenable(const std::string &path, bool unopenable = true);
  void setUnwritable(const std::string &path, bool unwritable = true);
  void setReadError(const std::string &path, std::optional<SXError> error);
  void setCreateDirectoryError(const std::string &path, std::optional<SXError> error);
  /// The answer of every comparison with that directory, whose path this is.
  void setRelationshipError(const std::string &directoryPath, std::optional<SXError> error);

  // --- The platform's operations

  bool fileExists(const std::string &path);
  std::optional<SXError> createDirectory(const std::string &path, bool withIntermediateDirectories);
  std::unique_ptr<InputStream> openFileInputStream(const std::string &path);
  Result<Value> readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability);
  bool writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path);
  Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                      const std::optional<URL> &item);

 private:
  struct DirectoryNode {};
  struct CorruptNode {
    std::string bytes;
  };
  struct LinkNode {
    std::string target;
  };
  using Node = std::variant<DirectoryNode, Value, CorruptNode, LinkNode>;
  /// A path with links and ".." resolved as far as it exists, the rest appended.
  struct Resolved {
    std::string path;
    const Node *node = nullptr;  // null when nothing is there
  };

  // All of these with `mutex_` held.
  [[nodiscard]] Resolved resolve(const std::string &path, int linksLeft = 40) const;
  [[nodiscard]] const Node *nodeAt(const std::string &path) const;
  void put(const std::string &path, Node node);

  Trace &trace_;
  mutable std::mutex mutex_;
  std::map<std::string, Node> nodes_{{"/", DirectoryNode{}}};
  std::map<std::string, std::size_t> writeCounts_;
  std::set<std::string> unopenable_;
  std::set<std::string> unwritable_;
  std::map<std::string, SXError> readErrors_;
  std::map<std::string, SXError> createDirectoryErrors_;
  std::map<std::string, SXError> relationshipErrors_;
};

}  // namespace storix::fake
