#include "bench/Scene.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/statfs.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <thread>

#include "bench/Measure.h"
#include "platform/linux/files/KeyedValueFile.h"

namespace storix::bench {

namespace fs = std::filesystem;

namespace {

constexpr std::chrono::seconds patience{60};
constexpr std::size_t spreadProviders = 10;
constexpr std::size_t spreadConsumers = 100;

void write(const fs::path &file, const std::string &content) {
  std::ofstream stream(file, std::ios::binary | std::ios::trunc);
  stream << content;
  if (!stream.flush()) giveUp("Cannot write " + file.string());
}

std::vector<char *> pointers(std::vector<std::string> &texts) {
  std::vector<char *> all;
  all.reserve(texts.size() + 1);
  for (std::string &text : texts) all.push_back(text.data());
  all.push_back(nullptr);
  return all;
}

/// Where a file system in memory would make every fsync free.
fs::path placeOnDisk() {
  const char *named = std::getenv("TMPDIR");
  for (const fs::path &place : {fs::path(named ? named : "/tmp"), fs::path("/var/tmp")}) {
    constexpr long inMemory = 0x01021994;
    struct statfs status {};
    if (::statfs(place.c_str(), &status) == 0 && status.f_type != inMemory) return place;
  }
  return fs::temp_directory_path();
}

}  // namespace

Program::Program(std::vector<std::string> arguments, const std::map<std::string, std::string> &environment,
                 const fs::path &output) {
  std::vector<std::string> variables;
  variables.reserve(environment.size());
  for (const auto &[name, value] : environment) variables.push_back(name + "=" + value);
  const std::vector<char *> argv = pointers(arguments);
  const std::vector<char *> envp = pointers(variables);
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  ::posix_spawn_file_actions_addopen(&actions, 1, output.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  ::posix_spawn_file_actions_adddup2(&actions, 1, 2);
  const int error = ::posix_spawn(&processIdentifier_, argv[0], &actions, nullptr, argv.data(), envp.data());
  ::posix_spawn_file_actions_destroy(&actions);
  if (error != 0) giveUp("Cannot start " + arguments[0] + ": " + std::strerror(error));
}

Program::~Program() {
  ::kill(processIdentifier_, SIGTERM);
  const auto deadline = std::chrono::steady_clock::now() + patience;
  while (::waitpid(processIdentifier_, nullptr, WNOHANG) == 0) {
    if (std::chrono::steady_clock::now() > deadline) ::kill(processIdentifier_, SIGKILL);
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
}

double Program::proportionalSetSize() const {
  std::ifstream file("/proc/" + std::to_string(processIdentifier_) + "/smaps_rollup");
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with("Pss:")) return std::strtod(line.c_str() + 4, nullptr) * 1024;
  }
  giveUp("The memory of process " + std::to_string(processIdentifier_) + " cannot be read.");
}

Scene::Scene() {
  std::string pattern = (placeOnDisk() / "storix-bench.XXXXXX").string();
  if (!::mkdtemp(pattern.data())) giveUp("Cannot make a directory " + pattern);
  directory_ = pattern;
  for (const char *name : {"home", "extensions", "applications", "data"}) fs::create_directory(directory_ / name);
}

Scene::~Scene() {
  std::error_code ignored;
  fs::remove_all(directory_, ignored);
}

fs::path Scene::accessControlFile() const { return home() / "Library/Storix/AccessControl.kvs"; }

fs::path Scene::storage(const std::string &identifier) const {
  return directory_ / "data/storix/groups" / ("group." + identifier) / "Storix Storage";
}

std::map<std::string, std::string> Scene::environment() const {
  std::map<std::string, std::string> variables{
      {"HOME", home()},
      {"PATH", "/usr/bin:/bin"},
      {"LANG", "C.UTF-8"},
      {"XDG_DATA_HOME", directory_ / "data"},
      {"STORIX_RUNTIME_DIR", directory_ / "run"},
      {"STORIX_EXTENSIONS_PATH", extensions()},
      {"STORIX_APPLICATIONS_PATH", directory_ / "applications"},
  };
  for (const char *name : {"ASAN_OPTIONS", "UBSAN_OPTIONS", "TSAN_OPTIONS", "LSAN_OPTIONS"}) {
    if (const char *value = std::getenv(name)) variables[name] = value;
  }
  return variables;
}

void Scene::beApplication(const std::string &identifier) const {
  write(directory_ / "applications" / (identifier + ".kvs"),
        R"({"Executable": ")" + fs::read_symlink("/proc/self/exe").string() +
            R"(", "Entitlements": {"com.tessel.storix.acl-read": true, "com.tessel.storix.acl-write": true}})");
}

void Scene::installProvider(const std::string &identifier, const std::string &program) const {
  const fs::path staged = directory_ / (identifier + ".staged");
  const std::string group = "group." + identifier;
  fs::create_directory(staged);
  fs::copy_file(builtProgram(program), staged / "provider");
  write(staged / "Info.kvs",
        R"({"KTBundleIdentifier": ")" + identifier +
            R"(", "KTBundleExecutable": "provider", "KTBundleVersion": "1", "KTGroupContainers": [")" + group +
            R"("], "KTExtensionPointIdentifier": "com.tessel.storix-nonui", )" +
            R"("KTExtension": {"KTExtensionStorixDocumentGroup": ")" + group + R"("}})");
  fs::create_directories(storage(identifier));
  fs::permissions(storage(identifier).parent_path(), fs::perms::owner_all);
  fs::rename(staged, extensions() / (identifier + ".appdex"));
}

std::string Scene::read(const fs::path &file) {
  const UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
  std::string content(4096, '\0');
  const ssize_t count = fd ? ::read(fd.get(), content.data(), content.size()) : -1;
  if (count < 0) giveUp("Cannot read " + file.string());
  content.resize(static_cast<std::size_t>(count));
  return content;
}

void Scene::writeGrants(const Dictionary &content) const {
  fs::create_directories(accessControlFile().parent_path());
  if (const auto error = linuxhost::writeKeyedValueFile(content, accessControlFile())) giveUp(error->message());
}

std::unique_ptr<Program> Scene::startDaemon() const {
  auto daemon = std::make_unique<Program>(std::vector<std::string>{builtProgram("storixd")}, environment(),
                                          directory_ / "daemon.log");
  (void)connectTo(serviceSocket());
  return daemon;
}

std::unique_ptr<Program> Scene::startBare(std::vector<std::string> arguments) const {
  const std::string socket = arguments.at(1);
  arguments.insert(arguments.begin(), builtProgram("storix_bench_bare"));
  std::error_code ignored;
  fs::remove(socket, ignored);
  auto program = std::make_unique<Program>(std::move(arguments), environment(), directory_ / "bare.log");
  (void)connectTo(socket);
  return program;
}

fs::path builtProgram(const std::string &name) { return fs::read_symlink("/proc/self/exe").parent_path() / name; }

UniqueFd connectTo(const std::string &path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) giveUp("The path of a socket is too long: " + path);
  std::strcpy(address.sun_path, path.c_str());
  const auto deadline = std::chrono::steady_clock::now() + patience;
  for (;;) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (fd && ::connect(fd.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0) return fd;
    if (std::chrono::steady_clock::now() > deadline) giveUp("Nobody listens at " + path);
    std::this_thread::sleep_for(std::chrono::microseconds(50));
  }
}

void writeDurably(const fs::path &file, const std::string &content) {
  const fs::path staged = file.string() + ".new";
  const UniqueFd directory(::open(file.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const UniqueFd fd(::open(staged.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  if (!directory || !fd || ::write(fd.get(), content.data(), content.size()) != static_cast<ssize_t>(content.size()) ||
      ::fsync(fd.get()) != 0 || ::rename(staged.c_str(), file.c_str()) != 0 || ::fsync(directory.get()) != 0) {
    giveUp("Cannot write " + file.string() + ": " + std::strerror(errno));
  }
}

Grant grantNumber(std::size_t index, bool spread) {
  const std::string item = "Documents/Folder/Document " + std::to_string(100'000 + index) + ".txt";
  if (!spread) return {"org.sample.provider", item, "org.sample.consumer"};
  return {"org.sample.provider" + std::to_string(index % spreadProviders), item,
          "org.sample.consumer" + std::to_string(index / spreadProviders % spreadConsumers)};
}

Dictionary grants(std::size_t count, bool spread) {
  Dictionary all;
  for (std::size_t i = 0; i < count; ++i) {
    Grant grant = grantNumber(i, spread);
    Value &consumers = all.try_emplace(grant.provider, Dictionary()).first->second;
    Value &fields = consumers.dictionary()->try_emplace(grant.consumer, Dictionary()).first->second;
    Value &items = fields.dictionary()->try_emplace("AllowedItemIDs", List()).first->second;
    items.list()->emplace_back(std::move(grant.item));
  }
  return all;
}

}  // namespace storix::bench
