#include "tests/e2e/Session.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <sstream>

namespace storix::e2e {

namespace fs = std::filesystem;

Session::Session() {
  std::string pattern = (fs::temp_directory_path() / "storix-e2e.XXXXXX").string();
  directory_ = ::mkdtemp(pattern.data());
  for (const char *name : {"home", "extensions", "applications", "data", "programs"}) {
    fs::create_directory(directory_ / name);
  }
  environment = {
      {"HOME", (directory_ / "home").string()},
      {"PATH", "/usr/bin:/bin"},
      {"LANG", "C.UTF-8"},
      {"XDG_DATA_HOME", (directory_ / "data").string()},
      {"STORIX_RUNTIME_DIR", runtimeDirectory().string()},
      {"STORIX_EXTENSIONS_PATH", extensionsDirectory().string()},
      {"STORIX_APPLICATIONS_PATH", applicationsDirectory().string()},
      {"STORIX_LOG", "debug"},
  };
  // The sanitizers' options must reach the programs under test.
  for (const char *name : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "TSAN_OPTIONS", "LSAN_OPTIONS"}) {
    if (const char *value = std::getenv(name)) environment[name] = value;
  }
}

Session::~Session() {
  std::error_code ignored;
  fs::remove_all(directory_, ignored);
}

fs::path Session::storage(const std::string &identifier) const {
  return directory_ / "data/storix/groups" / ("group." + identifier) / "Storix Storage";
}

void Session::installProvider(const std::string &identifier, const std::string &script) {
  const fs::path staged = directory_ / (identifier + ".staged");
  fs::create_directory(staged);
  write(staged / "script", script);
  fs::copy_file(builtProgram("e2e_scripted_provider"), staged / "provider");
  write(staged / "Info.kvs", R"({"KTBundleIdentifier": ")" + identifier +
                                 R"(", "KTBundleExecutable": "provider", "KTBundleVersion": "1",
     "KTGroupContainers": ["group.)" +
                                 identifier + R"("], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
     "KTExtension": {"KTExtensionStorixDocumentGroup": "group.)" +
                                 identifier + R"("}})");
  fs::rename(staged, extensionsDirectory() / (identifier + ".appdex"));
}

void Session::installBundle(const std::string &name, const std::string &info, const fs::path &executable) {
  const fs::path staged = directory_ / (name + ".staged");
  fs::create_directory(staged);
  if (!executable.empty()) fs::copy_file(executable, staged / "provider");
  write(staged / "Info.kvs", info);
  fs::rename(staged, extensionsDirectory() / (name + ".appdex"));
}

void Session::removeBundle(const std::string &name) { fs::remove_all(extensionsDirectory() / (name + ".appdex")); }

void Session::beApplication(const std::string &identifier, const std::string &entitlements) {
  write(applicationsDirectory() / (identifier + ".kvs"), R"({"Executable": ")" +
                                                             fs::read_symlink("/proc/self/exe").string() +
                                                             R"(", "Entitlements": )" + entitlements + "}");
}

fs::path Session::installApplication(const std::string &identifier, const fs::path &program,
                                     const std::string &entitlements) {
  const fs::path copy = directory_ / "programs" / identifier;
  fs::copy_file(program, copy);
  write(applicationsDirectory() / (identifier + ".kvs"),
        R"({"Executable": ")" + copy.string() + R"(", "Entitlements": )" + entitlements + "}");
  return copy;
}

std::unique_ptr<Process> Session::launchDaemon() {
  return std::make_unique<Process>(std::vector<std::string>{builtProgram("storixd").string()}, environment);
}

std::unique_ptr<Process> Session::startDaemon() {
  std::unique_ptr<Process> daemon = launchDaemon();
  daemon->waitForLine("[INFO] Server starting.");
  return daemon;
}

void Session::write(const fs::path &file, const std::string &content) const {
  std::ofstream stream(file, std::ios::binary | std::ios::trunc);
  stream << content;
  ASSERT_TRUE(stream.flush()) << file;
}

std::string Session::read(const fs::path &file) {
  std::ifstream stream(file, std::ios::binary);
  std::ostringstream content;
  content << stream.rdbuf();
  return content.str();
}

fs::path builtProgram(const std::string &name) { return fs::path(STORIX_BINARY_DIR) / name; }

}  // namespace storix::e2e
