#pragma once

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "tests/e2e/Process.h"

namespace storix::e2e {

/// A user's session in a directory of its own: home, runtime directory, installed extensions and
/// applications. Everything is removed at the end.
class Session {
 public:
  Session();
  ~Session();
  Session(const Session &) = delete;
  Session &operator=(const Session &) = delete;

  [[nodiscard]] const std::filesystem::path &directory() const { return directory_; }
  [[nodiscard]] std::filesystem::path runtimeDirectory() const { return directory_ / "run"; }
  [[nodiscard]] std::filesystem::path extensionsDirectory() const { return directory_ / "extensions"; }
  [[nodiscard]] std::filesystem::path applicationsDirectory() const { return directory_ / "applications"; }
  [[nodiscard]] std::filesystem::path accessControlFile() const {
    return directory_ / "home/Library/Storix/AccessControl.kvs";
  }
  [[nodiscard]] std::filesystem::path serviceSocket() const { return runtimeDirectory() / "com.tessel.Storix"; }
  [[nodiscard]] std::filesystem::path platformSocket() const { return runtimeDirectory() / "com.tessel.Platform"; }
  /// "Storix Storage" in the group container of a provider that `installProvider` made.
  [[nodiscard]] std::filesystem::path storage(const std::string &identifier) const;

  /// What every program of the session runs with; change it before starting one.
  Process::Environment environment;

  /// Installs the scripted provider under this identifier. `script` is what it shall do, as
  /// tests/e2e/ScriptedProvider.cc tells; empty: everything right.
  void installProvider(const std::string &identifier, const std::string &script = "");
  /// Installs a bundle whose Info.kvs is that text; with an executable if one is named.
  void installBundle(const std::string &name, const std::string &info, const std::filesystem::path &executable = {});
  void removeBundle(const std::string &name);

  /// Makes the running test program itself the application of that identifier.
  void beApplication(const std::string &identifier, const std::string &entitlements);
  /// A copy of a program, as an application of its own.
  std::filesystem::path installApplication(const std::string &identifier, const std::filesystem::path &program,
                                           const std::string &entitlements = "{}");

  /// Starts `storixd` and gives it back at once, debug log switched on unless the environment says
  /// otherwise.
  std::unique_ptr<Process> launchDaemon();
  /// The same, and waits until it listens.
  std::unique_ptr<Process> startDaemon();

  void write(const std::filesystem::path &file, const std::string &content) const;
  [[nodiscard]] static std::string read(const std::filesystem::path &file);

 private:
  std::filesystem::path directory_;
};

/// A program of the build under test.
std::filesystem::path builtProgram(const std::string &name);

}  // namespace storix::e2e
