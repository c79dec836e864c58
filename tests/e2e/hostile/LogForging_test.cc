// Texts from outside that would be lines of the log, or more than text to who looks at it.

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

/// In every text that is brought in; whatever follows a line end or a return must not begin a line.
const std::string forged = "x\n[FORGED] line\r[FORGED] return\x1b[31m\x7f %s %n %@ %d";

class LogForging : public HostileTest {
 protected:
  /// The text was logged, and as text: no line was begun by it, and nothing in the log is more than text.
  void expectNothingForged(const std::string &escaped = R"(x\n[FORGED])") {
    EXPECT_TRUE(daemon->waitForLine(escaped));
    for (const std::string &line : daemon->errorLines()) {
      EXPECT_FALSE(line.starts_with("[FORGED]")) << line;
      for (const char character : line) {
        const auto byte = static_cast<unsigned char>(character);
        EXPECT_TRUE(byte >= ' ' && byte != 127) << line;
      }
      EXPECT_EQ(std::string::npos, line.find("\u2028")) << line;
      EXPECT_EQ(std::string::npos, line.find("\u0085")) << line;
    }
    expectHealthy();
  }
};

TEST_F(LogForging, ConsumerIdentifierIsText) {
  startWithBystander();
  ASSERT_TRUE(bystander->extendSandbox(itemURL(docs, "report"), docs, forged));
  (void)bystander->startProviding(itemURL(docs, "other"), docs, forged + "2");
  expectNothingForged();
}

TEST_F(LogForging, ProviderIdentifierOfARequestIsText) {
  startWithBystander();
  EXPECT_FALSE(bystander->extendSandbox(itemURL(docs, "report"), forged, "c"));
  expectNothingForged();
}

TEST_F(LogForging, URLIsText) {
  startWithBystander();
  // The library does not let such a URL through, so it goes byte for byte; a well-formed one has its line
  // ends escaped, and those of the file's name are not unescaped on their way into the log.
  {
    RawClient client = serviceClient();
    EXPECT_EQ(invalidArgs, client.call(Message::service("StartProvidingItemAtURL", "asasas",
                                                        itemArguments("file:///" + forged, docs, "c"))));
  }
  ASSERT_TRUE(bystander->extendSandbox(itemURL(docs, forged), docs, "c"));
  EXPECT_FALSE(bystander->startProviding(itemURL(docs, forged), docs, "c"));
  expectNothingForged();
}

TEST_F(LogForging, BookmarkableStringIsText) {
  startWithBystander();
  EXPECT_FALSE(bystander->resolveBookmark("storix:" + std::string(docs) + "/" + forged));
  EXPECT_FALSE(bystander->resolveBookmark(forged));
  expectNothingForged();
}

TEST_F(LogForging, ProvidersErrorAndOutputAreText) {
  installHostile("forge");
  startWithBystander();
  ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.hostile"));
  const URL url = itemURL("org.sample.hostile", "item");
  ASSERT_TRUE(bystander->extendSandbox(url, "org.sample.hostile", "c"));
  EXPECT_TRUE(bystander->startProviding(url, "org.sample.hostile", "c"));
  descriptors = descriptorsInUse();
  EXPECT_TRUE(daemon->waitForLine("Extension org.sample.hostile: [FORGED] line\\r[FORGED] return\\x1b[31m %s %n %@"));
  expectNothingForged(R"(text\n[FORGED])");
}

TEST_F(LogForging, DBusErrorOfAnExtensionIsText) {
  installHostile("bus-error");
  startWithBystander();
  ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.hostile"));
  const URL url = itemURL("org.sample.hostile", "item");
  ASSERT_TRUE(bystander->extendSandbox(url, "org.sample.hostile", "c"));
  EXPECT_TRUE(bystander->startProviding(url, "org.sample.hostile", "c"));
  descriptors = descriptorsInUse();
  expectNothingForged(R"(text\n[FORGED])");
}

TEST_F(LogForging, BundleIdentifierIsText) {
  const std::string identifier = "x\n[FORGED] line\r\x1b[31m %s %n";
  // It starts well, so that nobody waits for further attempts.
  installHostile("exit", R"(x\n[FORGED] line\r\u001b[31m %s %n)");
  startWithBystander();
  ASSERT_TRUE(daemon->waitForLine(R"(Registered storix provider extension x\n[FORGED])"));
  const URL url = itemURL(hostile, "item");
  ASSERT_TRUE(bystander->extendSandbox(url, identifier, "c"));
  EXPECT_TRUE(bystander->startProviding(url, identifier, "c"));
  EXPECT_TRUE(daemon->waitForLine(R"([FORGED] line\r\x1b[31m %s %n exited with status 3.)"));
  // From now on its process ends before it has logged in, until it is started no more.
  instructHostile("no-login");
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(bystander->stopProviding(url, identifier, "c"));
  EXPECT_TRUE(daemon->waitForLine(R"([FORGED] line\r\x1b[31m %s %n exited with status 4, before it had logged in.)"));
  EXPECT_TRUE(daemon->waitForLine("failed three times"));
  expectNothingForged();
}

TEST_F(LogForging, NamesOfBundlesAndManifestsAreText) {
  session.installBundle(forged, "this is no keyed-value text");
  session.write(session.applicationsDirectory() / (forged + ".kvs"), "nor is this");
  startWithBystander();
  expectNothingForged();
}

TEST_F(LogForging, ContentOfAnInfoFileIsText) {
  session.installBundle("wrong",
                        "{\"KTBundleIdentifier\": \"a\", \""
                        R"(x\n[FORGED])"
                        "\": 1, \"x\n[FORGED]\": nonsense}");
  startWithBystander();
  EXPECT_TRUE(daemon->waitForLine("wrong.appdex"));
  for (const std::string &line : daemon->errorLines()) EXPECT_FALSE(line.starts_with("[FORGED]")) << line;
  expectHealthy();
}

TEST_F(LogForging, NotificationNameIsText) {
  startWithBystander();
  {
    RawClient client = platformClient();
    EXPECT_EQ("", client.call(Message::platform("Notifications", "Post", "s", Body().string(forged))));
    EXPECT_EQ(invalidArgs, client.call(Message::platform("FileCoordination", "BeginRead", "sas",
                                                         Body().string("file:///" + forged).number(0))));
  }
  expectNothingForged("Refused \"BeginRead\"");
}

}  // namespace
}  // namespace storix::e2e
