#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

using StartUp = E2ETest;

constexpr const char *lockedDevice = R"({"lockState": 1, "unlockedSinceBoot": false})";

std::vector<std::string> identifiers(const Result<std::vector<ProviderDescription>> &providers) {
  std::vector<std::string> result;
  EXPECT_TRUE(providers) << (providers ? "" : providers.error().message());
  if (!providers) return result;
  for (const ProviderDescription &provider : providers.value()) result.push_back(provider.identifier);
  return result;
}

TEST_F(StartUp, NoRequestIsAnsweredBeforeTheRegistryHasCalledBack) {
  // Where a confined extension sees it.
  const fs::path container = session.storage("org.sample.slow").parent_path();
  fs::create_directories(container);
  const fs::path gate = container / "gate";
  ASSERT_EQ(0, ::mkfifo(gate.c_str(), 0600));
  session.installProvider("org.sample.slow", "setup hold " + gate.string());
  start();
  ASSERT_TRUE(daemon->waitForLine("holding setup"));

  const std::unique_ptr<Client> client = makeClient();
  std::promise<Client::Outcome> answer;
  client->wakeUp([&answer](const Client::Outcome &outcome) { answer.set_value(outcome); });
  std::ofstream(gate) << "go";

  ASSERT_FALSE(answer.get_future().get());
  const auto registered = daemon->waitForLine("[INFO] Registered storix provider extension org.sample.slow");
  const auto accepted = daemon->waitForLine("[INFO] New connection accepted.");
  ASSERT_TRUE(registered && accepted);
  EXPECT_LT(*registered, *accepted);
}

TEST_F(StartUp, LockedDeviceIsServedAtOnceAndItsProvidersComeWithTheFirstUnlock) {
  session.installProvider("org.sample.docs");
  fs::create_directory(session.runtimeDirectory());
  fs::permissions(session.runtimeDirectory(), fs::perms::owner_all);
  session.write(session.runtimeDirectory() / "vaultkeepd.kvs", lockedDevice);
  start();
  ASSERT_TRUE(daemon->waitForLine("[INFO] Not instantiating storix providers until first unlock."));
  const std::unique_ptr<Client> client = makeClient();
  EXPECT_FALSE(client->wakeUp());
  EXPECT_TRUE(identifiers(client->providers()).empty());

  EXPECT_FALSE(client->postNotification("com.tessel.mobile.vaultkeepd.first_unlock"));
  ASSERT_TRUE(daemon->waitForLine("[INFO] Registered storix provider extension org.sample.docs"));
  EXPECT_EQ(std::vector<std::string>{"org.sample.docs"}, identifiers(client->providers()));
}

TEST_F(StartUp, SecondUnlockStartsNoSecondDiscovery) {
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  ASSERT_FALSE(client->wakeUp());
  EXPECT_FALSE(client->postNotification("com.tessel.mobile.vaultkeepd.first_unlock"));
  EXPECT_FALSE(client->postNotification("com.tessel.mobile.vaultkeepd.first_unlock"));
  ASSERT_FALSE(client->wakeUp());
  EXPECT_EQ(1U, daemon->countLines("[INFO] Updating provider list."));
}

TEST_F(StartUp, ProviderThatFailsRegistrationThreeTimesStaysListedAndTheNextOneIsRegistered) {
  session.installProvider("org.sample.a");
  session.installProvider("org.sample.b", "setup fail no disk today");
  session.installProvider("org.sample.c");
  start();
  const std::unique_ptr<Client> client = makeClient();
  EXPECT_EQ((std::vector<std::string>{"org.sample.a", "org.sample.b", "org.sample.c"}),
            identifiers(client->providers()));

  const auto first = daemon->waitForLine("[INFO] Registered storix provider extension org.sample.a");
  const auto twoLeft =
      daemon->waitForLine("[NOTICE] Trying to register storix provider extension org.sample.b again. Tries left: 2");
  const auto oneLeft =
      daemon->waitForLine("[NOTICE] Trying to register storix provider extension org.sample.b again. Tries left: 1");
  const auto given = daemon->waitForLine("[ERROR] Could not register storix provider org.sample.b.");
  const auto third = daemon->waitForLine("[INFO] Registered storix provider extension org.sample.c");
  const auto accepted = daemon->waitForLine("[INFO] New connection accepted.");
  ASSERT_TRUE(first && twoLeft && oneLeft && given && third && accepted);
  EXPECT_LT(*first, *twoLeft);
  EXPECT_LT(*twoLeft, *oneLeft);
  EXPECT_LT(*oneLeft, *given);
  EXPECT_LT(*given, *third);
  EXPECT_LT(*third, *accepted);
  EXPECT_EQ(3U, daemon->countLines("[ERROR] Storix provider extension org.sample.b failed to initialize."));
}

TEST_F(StartUp, FirstLinesNameTheProgramAndTheDebugLog) {
  start();
  const auto starting = daemon->waitForLine("[NOTICE] " + builtProgram("storixd").string() + " starting.");
  const auto debug = daemon->waitForLine("[DEBUG] Debug logging enabled.");
  ASSERT_TRUE(starting && debug);
  EXPECT_LT(*starting, *debug);
}

TEST_F(StartUp, TerminationEndsEverythingCleanly) {
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  stop();
  EXPECT_FALSE(fs::exists(session.serviceSocket()));
  EXPECT_FALSE(fs::exists(session.platformSocket()));
  const Client::Outcome outcome = client->wakeUp();
  ASSERT_TRUE(outcome);
  EXPECT_TRUE(isClientError(*outcome, ClientErrorCode::notReachable) ||
              isClientError(*outcome, ClientErrorCode::connectionLost))
      << outcome->message();
}

TEST_F(StartUp, SecondDaemonSaysSoAndEndsAndTheFirstOneServesOn) {
  start();
  const Finished second = run({builtProgram("storixd").string()}, session.environment);
  EXPECT_EQ(1, second.status);
  EXPECT_NE(std::string::npos, second.errors.find(session.runtimeDirectory().string())) << second.errors;
  EXPECT_FALSE(makeClient()->wakeUp());
}

TEST_F(StartUp, SocketsOfADaemonThatWasKilledAreReplaced) {
  start();
  ASSERT_FALSE(makeClient()->wakeUp());
  daemon->signal(SIGKILL);
  daemon->wait();
  ASSERT_TRUE(fs::exists(session.serviceSocket()));
  start();
  EXPECT_FALSE(makeClient()->wakeUp());
}

TEST_F(StartUp, MissingRuntimeDirectoryIsSaidInASentence) {
  session.environment.erase("STORIX_RUNTIME_DIR");
  session.environment.erase("XDG_RUNTIME_DIR");
  const Finished finished = run({builtProgram("storixd").string()}, session.environment);
  EXPECT_EQ(1, finished.status);
  EXPECT_NE(std::string::npos, finished.errors.find("XDG_RUNTIME_DIR")) << finished.errors;
}

TEST_F(StartUp, RuntimeDirectoryThatOthersMayEnterIsRefused) {
  fs::create_directory(session.runtimeDirectory());
  fs::permissions(session.runtimeDirectory(), fs::perms(0755));
  const Finished finished = run({builtProgram("storixd").string()}, session.environment);
  EXPECT_EQ(1, finished.status);
  EXPECT_NE(std::string::npos, finished.errors.find("chmod 700")) << finished.errors;
}

TEST_F(StartUp, RuntimeDirectoryOfAnotherUserIsRefused) {
  fs::path directory = "/usr";  // root's, when somebody else runs the tests
  if (::geteuid() == 0) {
    directory = session.runtimeDirectory();
    fs::create_directory(directory);
    fs::permissions(directory, fs::perms::owner_all);
    constexpr uid_t somebodyElse = 12345;
    ASSERT_EQ(0, ::chown(directory.c_str(), somebodyElse, somebodyElse));
  }
  session.environment["STORIX_RUNTIME_DIR"] = directory.string();
  const Finished finished = run({builtProgram("storixd").string()}, session.environment);
  EXPECT_EQ(1, finished.status);
  EXPECT_NE(std::string::npos, finished.errors.find("belongs to another user")) << finished.errors;
}

TEST_F(StartUp, UnknownOptionIsAUsageError) {
  const Finished finished = run({builtProgram("storixd").string(), "--fast"}, session.environment);
  EXPECT_NE(0, finished.status);
  EXPECT_NE(std::string::npos, finished.errors.find("--fast")) << finished.errors;
}

}  // namespace
}  // namespace storix::e2e
