#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>

#include "tests/e2e/E2ETest.h"
#include "tests/e2e/hostile/RawClient.h"

namespace storix::e2e {

inline constexpr const char *invalidArgs = "org.freedesktop.DBus.Error.InvalidArgs";
inline constexpr const char *limitsExceeded = "org.freedesktop.DBus.Error.LimitsExceeded";
inline constexpr const char *accessDenied = "org.freedesktop.DBus.Error.AccessDenied";
inline constexpr const char *noSuchClaim = "com.tessel.Platform.Error.NoSuchClaim";
inline constexpr const char *invalidToken = "com.tessel.Platform.Error.InvalidToken";
inline constexpr const char *notAFile = "com.tessel.Platform.Error.NotAFile";
inline constexpr const char *noProof = "com.tessel.Platform.Error.NoProof";

/// One attack on a daemon that serves a well-behaved client, the bystander, and a well-behaved provider.
/// Each case ends with `expectHealthy`: both are served as before, and what the attack cost is given back.
class HostileTest : public E2ETest {
 protected:
  static constexpr const char *docs = "org.sample.docs";

  /// How much more memory than before may stay with the process. Its allocator keeps what it has once had
  /// in use; the sanitizers keep freed memory back on purpose, ASan 256 MiB of it, TSan four words of
  /// shadow for each.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  static constexpr std::size_t memoryThatMayStay = std::size_t{1} << 30;
#else
  static constexpr std::size_t memoryThatMayStay = std::size_t{24} << 20;
#endif

  static constexpr const char *hostile = "org.sample.hostile";

  HostileTest() { session.installProvider(docs); }

  /// Installs a provider that misbehaves as tests/e2e/hostile/HostileProvider.cc tells, and whose items are
  /// those of "org.sample.hostile" whatever its identifier is.
  void installHostile(const std::string &script, const std::string &identifier = hostile) {
    std::filesystem::create_directories(session.storage(hostile));
    const std::filesystem::path staged = session.directory() / "hostile.staged";
    std::filesystem::create_directory(staged);
    session.write(staged / "script", script);
    std::filesystem::copy_file(builtProgram("e2e_hostile_provider"), staged / "provider");
    session.write(staged / "Info.kvs",
                  R"({"KTBundleIdentifier": ")" + identifier + R"(", "KTBundleExecutable": "provider",
        "KTBundleVersion": "1", "KTGroupContainers": ["group.org.sample.hostile"],
        "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
        "KTExtension": {"KTExtensionStorixDocumentGroup": "group.org.sample.hostile"}})");
    std::filesystem::rename(staged, session.extensionsDirectory() / "hostile.appdex");
  }
  /// What its next process shall do.
  void instructHostile(const std::string &script) {
    session.write(session.extensionsDirectory() / "hostile.appdex/script", script);
  }
  /// Ends its process, and waits until the daemon knows.
  void killHostile() {
    const std::string beginning = "[INFO] Started process ";
    pid_t process = 0;
    for (const std::string &line : daemon->errorLines()) {
      const std::size_t position = line.find(beginning);
      if (position == std::string::npos || line.find(hostile) == std::string::npos) continue;
      process = static_cast<pid_t>(std::stol(line.substr(position + beginning.size())));
    }
    ASSERT_GT(process, 0) << "it was never started";
    const std::size_t before = daemon->errorLines().size();
    ASSERT_EQ(0, ::kill(process, SIGKILL));
    ASSERT_TRUE(daemon->waitForLine("was killed by signal 9", before));
  }

  /// Starts the daemon, and takes what it has in use when all of it is running.
  void startWithBystander() {
    start();
    bystander = makeClient();
    grantAndStart(*bystander, docs, "report");
    // Two at once, so that no thread is started for the first time later.
    serveNewClient();
    descriptors = descriptorsInUse();
    memory = memoryInUse();
  }

  [[nodiscard]] std::string procOf(const char *name) const {
    return "/proc/" + std::to_string(daemon->processIdentifier()) + "/" + name;
  }
  [[nodiscard]] std::size_t descriptorsInUse() const {
    const std::filesystem::directory_iterator entries(procOf("fd"));
    return static_cast<std::size_t>(std::distance(begin(entries), end(entries)));
  }
  /// What the process has for itself, in bytes.
  [[nodiscard]] std::size_t memoryInUse() const {
    std::ifstream status(procOf("status"));
    for (std::string word; status >> word;) {
      std::size_t kilobytes = 0;
      if (word == "RssAnon:" && status >> kilobytes) return kilobytes << 10;
    }
    ADD_FAILURE() << "the daemon is gone";
    return 0;
  }

  void serveBystander() {
    const Client::Outcome woken = bystander->wakeUp();
    ASSERT_FALSE(woken) << woken->message();
  }
  /// A client that comes now gets a document.
  void serveNewClient() {
    const std::unique_ptr<Client> client = makeClient();
    grantAndStart(*client, docs, "letter");
  }

  /// The daemon's state comes back; it does so in its own threads, so it is asked again as long as it
  /// does not, and each time serves the bystander.
  template <class Reading>
  void expectToComeDown(const char *what, std::size_t bound, const Reading &reading) {
    const auto end = std::chrono::steady_clock::now() + deadline;
    std::size_t last = reading();
    while (last > bound && std::chrono::steady_clock::now() < end) {
      ASSERT_NO_FATAL_FAILURE(serveBystander());
      last = reading();
    }
    EXPECT_LE(last, bound) << what;
  }

  void expectHealthy() {
    ASSERT_FALSE(daemon->hasEnded()) << "the daemon has ended";
    ASSERT_NO_FATAL_FAILURE(serveBystander());
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "report"));
    ASSERT_NO_FATAL_FAILURE(serveNewClient());
    expectToComeDown("descriptors in use", descriptors, [this] { return descriptorsInUse(); });
    expectToComeDown("memory in use", memory + memoryThatMayStay, [this] { return memoryInUse(); });
  }

  [[nodiscard]] RawClient serviceClient(RawClient::Login login = RawClient::Login::done) const {
    return RawClient(session.serviceSocket(), login);
  }
  [[nodiscard]] RawClient platformClient() const { return RawClient(session.platformSocket()); }

  /// The text of the URL of an item of "org.sample.docs".
  [[nodiscard]] std::string docURL(const std::string &item) const { return itemURL(docs, item).absoluteString(); }

  std::unique_ptr<Client> bystander;
  std::size_t descriptors = 0;
  std::size_t memory = 0;
};

}  // namespace storix::e2e
