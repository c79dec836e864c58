#pragma once

#include <sys/types.h>

#include <cstddef>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Value.h"
#include "wire/UniqueFd.h"

namespace storix::bench {

/// A program that runs beside the benchmark, on the processors that this process has at the start of
/// it; ended and reaped when the object goes. What it prints goes to a file.
class Program {
 public:
  Program(std::vector<std::string> arguments, const std::map<std::string, std::string> &environment,
          const std::filesystem::path &output);
  ~Program();
  Program(const Program &) = delete;
  Program &operator=(const Program &) = delete;

  [[nodiscard]] pid_t processIdentifier() const { return processIdentifier_; }
  /// The memory that it alone uses, and its share of what it uses with others, in bytes.
  [[nodiscard]] double proportionalSetSize() const;

 private:
  pid_t processIdentifier_ = -1;
};

/// A user's session in a directory of its own, on a disk and not in memory, removed at the end.
class Scene {
 public:
  Scene();
  ~Scene();
  Scene(const Scene &) = delete;
  Scene &operator=(const Scene &) = delete;

  [[nodiscard]] const std::filesystem::path &directory() const { return directory_; }
  [[nodiscard]] std::filesystem::path home() const { return directory_ / "home"; }
  [[nodiscard]] std::filesystem::path extensions() const { return directory_ / "extensions"; }
  [[nodiscard]] std::filesystem::path accessControlFile() const;
  /// "Storix Storage" in the group container of an installed provider.
  [[nodiscard]] std::filesystem::path storage(const std::string &identifier) const;
  [[nodiscard]] std::string serviceSocket() const { return directory_ / "run/com.tessel.Storix"; }
  [[nodiscard]] std::string platformSocket() const { return directory_ / "run/com.tessel.Platform"; }
  [[nodiscard]] std::map<std::string, std::string> environment() const;

  /// Makes the benchmark an application that may do everything.
  void beApplication(const std::string &identifier) const;
  /// A bundle with a program of this build, and its provided-items directory.
  void installProvider(const std::string &identifier, const std::string &program) const;
  void writeGrants(const Dictionary &grants) const;

  [[nodiscard]] static std::string read(const std::filesystem::path &file);

  [[nodiscard]] std::unique_ptr<Program> startDaemon() const;
  /// One of the programs to compare with, on that socket; gives it back when it listens.
  [[nodiscard]] std::unique_ptr<Program> startBare(std::vector<std::string> arguments) const;

 private:
  std::filesystem::path directory_;
};

std::filesystem::path builtProgram(const std::string &name);

/// A connected socket; tries until somebody listens at the path.
UniqueFd connectTo(const std::string &path);

/// The file's content to the disk: a new file beside it, fsync, rename, fsync of the directory.
void writeDurably(const std::filesystem::path &file, const std::string &content);

/// Provider -> consumer -> "AllowedItemIDs", with so many grants: all of one consumer, or spread over
/// providers and consumers.
Dictionary grants(std::size_t count, bool spread);
struct Grant {
  std::string provider;
  std::string item;
  std::string consumer;
};
Grant grantNumber(std::size_t index, bool spread);

}  // namespace storix::bench
