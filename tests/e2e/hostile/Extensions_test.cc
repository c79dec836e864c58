// Attacks by an extension: answers that are none, too large, too many or never; processes that leave others
// behind.

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

struct Misdeed {
  const char *name;
  const char *script;
  /// In the log, or nothing.
  const char *line;
  /// Whether the request fails.
  bool fails = true;
};

void PrintTo(const Misdeed &misdeed, std::ostream *out) { *out << misdeed.name; }

class HostileExtensions : public HostileTest {
 protected:
  /// What it takes when the hostile provider's process runs as well.
  void startWithBoth(const std::string &script) {
    installHostile(script);
    startWithBystander();
    ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.hostile"));
    const auto granted = bystander->extendSandbox(itemURL(hostile, "item"), hostile, "c");
    ASSERT_TRUE(granted) << granted.error().message();
    descriptors = descriptorsInUse();
    memory = memoryInUse();
  }

  [[nodiscard]] Message startRequest() const {
    return Message::service("StartProvidingItemAtURL", "asasas",
                            itemArguments(itemURL(hostile, "item").absoluteString(), hostile, "c"));
  }
};

class Misdeeds : public HostileExtensions, public testing::WithParamInterface<Misdeed> {};

TEST_P(Misdeeds, FailTheirOwnRequestAloneAndOthersAreServedMeanwhile) {
  startWithBoth(GetParam().script);
  {
    RawClient waiting = serviceClient();
    ASSERT_TRUE(waiting.send(startRequest()));
    // Many requests of others are answered before anybody looks what became of that one.
    for (int i = 0; i < 20; ++i) ASSERT_NO_FATAL_FAILURE(serveBystander());
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "letter"));
    const std::optional<RawAnswer> answer = waiting.readAnswerTo(1);
    ASSERT_TRUE(answer) << "the client has lost its connection";
    EXPECT_EQ("", answer->errorName);
    EXPECT_EQ(GetParam().fails, answer->body.find("com.tessel.storix") != std::string::npos)
        << testing::PrintToString(answer->body) << testing::PrintToString(daemon->errorLines());
    if (*GetParam().line) {
      EXPECT_TRUE(daemon->waitForLine(GetParam().line));
    }
  }
  expectHealthy();
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, Misdeeds,
    testing::Values(
        Misdeed{"AnswerOfAnotherSignature", "signature", "Refused the reply to \"StartProvidingItemAtURL\""},
        Misdeed{"TwoErrorsWhereOneMayStand", "two-errors", "may have one value at most"},
        Misdeed{"DBusErrorAsAnswer", "bus-error", "was not answered: text"},
        Misdeed{"AnswerOfAHundredMegabytes", "megabytes", "a message is larger than 1048576 bytes"},
        Misdeed{"HalfAnAnswerAndAnExit", "half", "exited with status 0"},
        Misdeed{"ExitInsteadOfAnAnswer", "exit", "exited with status 3"},
        Misdeed{"CrashInsteadOfAnAnswer", "crash", "was killed by signal 9"},
        Misdeed{"ChildrenLeftBehind", "fork", "exited with status 0"},
        Misdeed{"JunkInsteadOfAnAnswer", "junk", "Ended the connection of extension org.sample.hostile"},
        Misdeed{"ValuesNestedTooDeep", "deep 20", "values are nested more than 16 deep"},
        Misdeed{"KeyThatStandsTwice", "key-twice", "a dictionary has a key twice"},
        Misdeed{"URLThatIsNoneInsideAnError", "bad-url", "Refused the reply to \"StartProvidingItemAtURL\""},
        Misdeed{"DescriptorsWithTheAnswer", "descriptors", "Ended the connection of extension org.sample.hostile"},
        Misdeed{"ErrorOfThirtyThousandDetails", "wide", "org.sample.wide"},
        Misdeed{"AnswerThatComesThreeTimes", "twice", "", false},
        Misdeed{"SignalsAndAnswersToNothing", "strays", "", false},
        Misdeed{"FloodOfOutput", "output", "line of a flood", false},
        Misdeed{"FloodOfCallsWhoseAnswersNobodyReads", "calls", "", false}),
    [](const auto &misdeed) { return std::string(misdeed.param.name); });

TEST_F(HostileExtensions, ExtensionThatNeverAnswersKeepsNobodyElseWaiting) {
  startWithBoth("never");
  {
    const RawClient waiting = serviceClient();
    for (std::uint32_t serial = 1; serial <= 100; ++serial) {
      ASSERT_TRUE(waiting.send(startRequest().numbered(serial)));
    }
    for (int i = 0; i < 100; ++i) ASSERT_NO_FATAL_FAILURE(serveBystander());
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "letter"));
  }
  expectHealthy();
}

TEST_F(HostileExtensions, ExtensionThatClosesItsConnectionAndStaysFailsItsRequestAlone) {
  startWithBoth("close");
  {
    RawClient waiting = serviceClient();
    ASSERT_TRUE(waiting.send(startRequest()));
    ASSERT_NO_FATAL_FAILURE(grantAndStart(*bystander, docs, "letter"));
    const std::optional<RawAnswer> answer = waiting.readAnswerTo(1);
    ASSERT_TRUE(answer);
    EXPECT_NE(std::string::npos, answer->body.find("com.tessel.storix"));
  }
  expectHealthy();
}

TEST_F(HostileExtensions, ExtensionThatExitsAtOnceIsGivenARestAndOthersAreServed) {
  session.installBundle("exits", R"({"KTBundleIdentifier": "org.sample.exits", "KTBundleExecutable": "provider",
      "KTBundleVersion": "1", "KTGroupContainers": ["group.x"], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
      "KTExtension": {"KTExtensionStorixDocumentGroup": "group.x"}})",
                        "/bin/false");
  startWithBystander();
  ASSERT_TRUE(daemon->waitForLine("Could not register storix provider org.sample.exits"));
  const std::size_t started = daemon->countLines("of the extension org.sample.exits.");
  EXPECT_LE(started, 3U);
  for (int i = 0; i < 20; ++i) {
    EXPECT_FALSE(bystander->extendSandbox(*URL::fileURLWithPath("/x"), "org.sample.exits", "c"));
  }
  // Each request would start it once more, if it were not resting.
  EXPECT_LE(daemon->countLines("Started process"), 8U);
  expectHealthy();
}

TEST_F(HostileExtensions, URLThatAnExtensionNamesOutsideItsContainerGetsNoToken) {
  startWithBoth("never");
  // The extension says that its item lies at /etc/passwd.
  session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": true})");
  ASSERT_TRUE(bystander->extendSandbox(itemURL(hostile, "item"), hostile, "org.sample.files"));
  const auto resolved = bystander->resolveBookmark("storix:org.sample.hostile/item");
  EXPECT_TRUE(!resolved || !resolved.value().token);
  expectHealthy();
}

/// An extension answers an error with so many lists inside each other, and the daemon answers the client one
/// whose underlying error that is.
class NestedErrors : public HostileExtensions {
 protected:
  SXError failureWith(int lists) {
    startWithBoth("deep " + std::to_string(lists));
    const Client::Outcome outcome = bystander->startProviding(itemURL(hostile, "item"), hostile, "c");
    descriptors = descriptorsInUse();
    return outcome ? *outcome : SXError("nothing failed", 0);
  }

  /// What stands in the innermost of the lists, and how many there are.
  static std::pair<Value, int> innermost(const SXError &error) {
    const SXError *answered = error.underlyingError();
    if (!answered || !answered->details().contains("key")) return {Value("no details: " + error.message()), 0};
    const Value *value = &answered->details().at("key");
    int lists = 0;
    for (; value->list() && value->list()->size() == 1; ++lists) value = &value->list()->front();
    return {*value, lists};
  }
};

TEST_F(NestedErrors, SixteenDeepReachTheClientWhole) {
  // Two errors, thirteen lists and the value.
  EXPECT_EQ(innermost(failureWith(13)), std::pair(Value(true), 13));
  expectHealthy();
}

TEST_F(NestedErrors, SeventeenDeepAreCutWithAWord) {
  EXPECT_EQ(innermost(failureWith(14)), std::pair(Value("(cut: nested too deeply)"), 13));
  expectHealthy();
}

TEST_F(NestedErrors, SixteenDeepOfTheExtensionAreReadAndSeventeenRefused) {
  // One error, the lists and the value.
  const SXError error = failureWith(14);
  ASSERT_TRUE(error.underlyingError());
  EXPECT_EQ(error.underlyingError()->domain(), "org.sample.deep");
  ASSERT_NO_FATAL_FAILURE(killHostile());
  instructHostile("deep 15");
  EXPECT_TRUE(bystander->startProviding(itemURL(hostile, "item"), hostile, "c"));
  EXPECT_TRUE(daemon->waitForLine("values are nested more than 16 deep"));
  expectHealthy();
}

TEST_F(HostileExtensions, BundleThatIsALinkToItselfIsLeftOutWithOneLineAndServedWhenItIsBack) {
  startWithBoth("never");
  const std::filesystem::path bundle = session.extensionsDirectory() / "hostile.appdex";
  const std::filesystem::path aside = session.directory() / "aside";
  std::filesystem::create_directory_symlink("/proc/self/fd", session.extensionsDirectory() / "proc.appdex");
  std::filesystem::rename(bundle, aside);
  std::filesystem::create_directory_symlink("hostile.appdex", bundle);
  ASSERT_TRUE(daemon->waitForLine("hostile.appdex/Info.kvs”: Too many levels of symbolic links"));

  // Others are found all the same.
  session.installProvider("org.sample.new");
  ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.new"));
  EXPECT_FALSE(bystander->extendSandbox(itemURL(hostile, "item"), hostile, "c"));
  const std::size_t before = daemon->errorLines().size();
  std::filesystem::remove(bundle);
  std::filesystem::rename(aside, bundle);
  ASSERT_TRUE(daemon->waitForLine("Registered storix provider extension org.sample.hostile", before));
  EXPECT_TRUE(bystander->extendSandbox(itemURL(hostile, "item"), hostile, "c"));
  EXPECT_EQ(1U, daemon->countLines("Too many levels of symbolic links"));
  EXPECT_EQ(1U, daemon->countLines("proc.appdex/Info.kvs”: No such file or directory"));
  // The new provider's process, and the hostile one's, stay for a while.
  descriptors = descriptorsInUse();
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
