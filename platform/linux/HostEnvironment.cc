#include "platform/linux/HostEnvironment.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <optional>
#include <string_view>

#include "platform/linux/HostErrors.h"
#include "platform/linux/LogSinks.h"
#include "platform/linux/files/PathText.h"

namespace storix::linuxhost {

namespace {

/// Looks variables up, and notes what is wrong with them.
class Reader {
 public:
  explicit Reader(const EnvironmentVariables &variables) : variables_(variables) {}

  /// Null when it is unset.
  [[nodiscard]] const std::string *find(std::string_view name) const {
    const auto found = variables_.find(name);
    return found == variables_.end() ? nullptr : &found->second;
  }

  /// Empty when it is unset.
  [[nodiscard]] std::string text(std::string_view name) const {
    const std::string *value = find(name);
    return value ? *value : std::string();
  }

  /// The entries of a list, relative ones left out, each once.
  std::vector<std::string> paths(std::string_view name, std::vector<std::string> *warnings = nullptr) const {
    std::vector<std::string> entries;
    const std::string list = text(name);
    for (std::size_t start = 0; start < list.size();) {
      const std::size_t end = std::min(list.find(':', start), list.size());
      const std::string entry = withoutSlashes(list.substr(start, end - start));
      start = end + 1;
      if (entry.empty() || std::find(entries.begin(), entries.end(), entry) != entries.end()) continue;
      if (entry.starts_with('/')) {
        entries.push_back(entry);
      } else if (warnings) {
        warnings->push_back(std::string(name) + " names " + quotedPath(entry) +
                            ", which is left out since it is not an absolute path.");
      }
    }
    return entries;
  }

  /// A directory that XDG speaks of; empty when there is none to use.
  [[nodiscard]] std::string xdgDirectory(std::string_view name) const {
    const std::string path = withoutSlashes(text(name));
    return path.starts_with('/') ? path : std::string();
  }

  static std::string withoutSlashes(std::string path) {
    while (path.size() > 1 && path.ends_with('/')) path.pop_back();
    return path;
  }

 private:
  const EnvironmentVariables &variables_;
};

SXError refusal(std::string sentence) { return hostError(HostErrorCode::cannotStart, std::move(sentence)); }

/// Of the user database; empty when it knows none.
std::string homeOfUser() {
  std::array<char, 16384> buffer{};
  passwd entry{};
  passwd *found = nullptr;
  if (::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found) != 0 || !found || !found->pw_dir) {
    return {};
  }
  return found->pw_dir;
}

Result<std::string> readHomeDirectory(const Reader &reader) {
  std::string home = reader.text("HOME");
  if (home.empty()) home = homeOfUser();
  if (home.starts_with('/')) return Reader::withoutSlashes(home);
  if (home.empty()) return refusal("HOME is not set; set it to your home directory.");
  return refusal("HOME is " + quotedPath(home) + ", which is not an absolute path; set it to your home directory.");
}

Result<std::string> readRuntimeDirectory(const Reader &reader) {
  const std::string own = reader.text("STORIX_RUNTIME_DIR");
  if (own.starts_with('/')) return Reader::withoutSlashes(own);
  if (!own.empty()) {
    return refusal("STORIX_RUNTIME_DIR is " + quotedPath(own) +
                   ", which is not an absolute path; set it to one, or unset it.");
  }
  const std::string session = reader.xdgDirectory("XDG_RUNTIME_DIR");
  if (!session.empty()) return session + "/storix";
  const std::string given = reader.text("XDG_RUNTIME_DIR");
  return refusal((given.empty() ? "XDG_RUNTIME_DIR is not set"
                                : "XDG_RUNTIME_DIR is " + quotedPath(given) + ", which is not an absolute path") +
                 "; start the daemon in a user's session, or set STORIX_RUNTIME_DIR to a directory for its sockets.");
}

/// `name` below each data directory.
std::vector<std::string> belowDataDirectories(const std::vector<std::string> &dataDirectories, std::string_view name) {
  std::vector<std::string> directories;
  directories.reserve(dataDirectories.size());
  for (const std::string &directory : dataDirectories) {
    directories.push_back(directory + "/storix/" + std::string(name));
  }
  return directories;
}

void readPlaces(const Reader &reader, HostEnvironment &environment) {
  std::string dataHome = reader.xdgDirectory("XDG_DATA_HOME");
  if (dataHome.empty()) dataHome = environment.homeDirectory + "/.local/share";
  std::vector<std::string> dataDirectories = reader.paths("XDG_DATA_DIRS");
  if (dataDirectories.empty()) dataDirectories = {"/usr/local/share", "/usr/share"};
  dataDirectories.insert(dataDirectories.begin(), dataHome);

  environment.extensionPlaces.groupContainersDirectory = dataHome + "/storix/groups";
  environment.extensionPlaces.extensionDirectories = reader.find("STORIX_EXTENSIONS_PATH")
                                                         ? reader.paths("STORIX_EXTENSIONS_PATH", &environment.warnings)
                                                         : belowDataDirectories(dataDirectories, "extensions");
  environment.applicationDirectories = reader.find("STORIX_APPLICATIONS_PATH")
                                           ? reader.paths("STORIX_APPLICATIONS_PATH", &environment.warnings)
                                           : belowDataDirectories(dataDirectories, "applications");
}

void readLogSettings(const Reader &reader, HostEnvironment &environment) {
  environment.logsToJournal = isJournalStream(reader.text("JOURNAL_STREAM"), STDERR_FILENO);
  const std::string level = reader.text("STORIX_LOG");
  if (level.empty()) return;
  if (const std::optional<LogSeverity> severity = logSeverityNamed(level)) {
    environment.logSeverity = *severity;
  } else {
    environment.warnings.push_back("STORIX_LOG is “" + escapedForLog(level) +
                                   "”, which is none of fault, default, info and debug; default is used.");
  }
}

void readConfinement(const Reader &reader, HostEnvironment &environment) {
  const std::string word = reader.text("STORIX_CONFINEMENT");
  if (word.empty() || word == "preferred") return;
  environment.confinement = word == "off" ? ConfinementPolicy::off : ConfinementPolicy::required;
  if (word == "off" || word == "required") return;
  environment.warnings.push_back("STORIX_CONFINEMENT is “" + escapedForLog(word) +
                                 "”, which is none of off, preferred and required; required is used.");
}

std::vector<std::string> environmentForExtensions(const EnvironmentVariables &variables,
                                                  const HostEnvironment &environment) {
  std::vector<std::string> entries = {"HOME=" + environment.homeDirectory,
                                      "STORIX_RUNTIME_DIR=" + environment.runtimeDirectory};
  for (const auto &[name, value] : variables) {
    if (name == "PATH" || name == "LANG" || name.starts_with("XDG_")) entries.push_back(name + "=" + value);
  }
  return entries;
}

}  // namespace

EnvironmentVariables processEnvironment() {
  EnvironmentVariables variables;
  for (char **entry = environ; entry && *entry; ++entry) {
    const std::string_view text = *entry;
    const std::size_t equals = text.find('=');
    if (equals != std::string_view::npos)
      variables.try_emplace(std::string(text.substr(0, equals)), text.substr(equals + 1));
  }
  return variables;
}

Result<HostEnvironment> HostEnvironment::fromVariables(const EnvironmentVariables &variables) {
  const Reader reader(variables);
  HostEnvironment environment;
  Result<std::string> home = readHomeDirectory(reader);
  if (!home) return home.error();
  environment.homeDirectory = std::move(home.value());
  Result<std::string> runtime = readRuntimeDirectory(reader);
  if (!runtime) return runtime.error();
  environment.runtimeDirectory = std::move(runtime.value());
  readPlaces(reader, environment);
  environment.sessionRuntimeDirectory = reader.xdgDirectory("XDG_RUNTIME_DIR");
  readConfinement(reader, environment);
  readLogSettings(reader, environment);
  environment.extensionEnvironment = environmentForExtensions(variables, environment);
  return environment;
}

ConfinementPlaces HostEnvironment::confinementPlaces() const {
  ConfinementPlaces places;
  places.homeDirectory = homeDirectory;
  places.extensions = extensionPlaces;
  places.hidden = {runtimeDirectory, homeDirectory + "/Library/Storix", "/proc", "/sys", "/dev", "/run/user",
                   "/run/dbus"};
  if (!sessionRuntimeDirectory.empty()) places.hidden.push_back(sessionRuntimeDirectory);
  places.unwritable = extensionPlaces.extensionDirectories;
  places.unwritable.insert(places.unwritable.end(), applicationDirectories.begin(), applicationDirectories.end());
  return places;
}

}  // namespace storix::linuxhost
