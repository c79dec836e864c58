#include "platform/linux/extensions/ExtensionHost.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdlib>
#include <future>

#include "platform/linux/extensions/ExtensionHostTest.h"
#include "platform/linux/extensions/ExtensionLauncher.h"
#include "platform/linux/extensions/OutputLines.h"

namespace storix::linuxhost {
namespace {

using ::testing::Contains;
using ::testing::HasSubstr;

TEST_F(ExtensionHostTest, ProcessIsStartedOnceAndSharedByAllOpenRequests) {
  const Record extension = installedRecord("answers");
  Later<Begun> first = beginLater(extension);
  Later<Begun> second = beginLater(extension);
  const RequestIdentifier one = first.wait().request.value();
  const RequestIdentifier two = second.wait().request.value();
  EXPECT_NE(one, two);
  const RequestIdentifier three = beginWell(extension);
  const pid_t process = processOf(extension, one);
  EXPECT_EQ(processOf(extension, two), process);
  EXPECT_EQ(processOf(extension, three), process);
}

TEST_F(ExtensionHostTest, RequestIdentifierIsAUUIDAsText) {
  const Record extension = installedRecord("answers");
  EXPECT_THAT(beginWell(extension).uuid, ::testing::MatchesRegex("[0-9a-f]+-[0-9a-f]+-4[0-9a-f]+-[0-9a-f]+-[0-9a-f]+"));
}

TEST_F(ExtensionHostTest, EnvironmentIsBuiltAndHoldsNothingElse) {
  const Record extension = installedRecord(
      "answers", R"(, "KTGroupContainers": ["g"], "KTExtension": {"KTExtensionStorixDocumentGroup": "g"})");
  std::string expected = "HOME=/home/u\nPATH=/bin\nSTORIX_BUNDLE_PATH=" + (directory_ / "extensions/answers.appdex") +
                         "\nSTORIX_EXTENSION_FD=3\nSTORIX_GROUP_CONTAINER=" + (directory_ / "groups/g") +
                         "\nSTORIX_RUNTIME_DIR=/run/x\n";
  EXPECT_EQ(textFor(extension, beginWell(extension), "environment"), expected);
}

TEST_F(ExtensionHostTest, GroupContainerIsUnsetWithoutADocumentGroup) {
  const Record extension = installedRecord("answers");
  EXPECT_THAT(textFor(extension, beginWell(extension), "environment"), ::testing::Not(HasSubstr("STORIX_GROUP")));
}

TEST_F(ExtensionHostTest, OnlyItsSocketIsInherited) {
  // Neither this one, though nobody marked it, nor anything of the host's.
  const UniqueFd stray(::open("/dev/zero", O_RDONLY));
  const Record extension = installedRecord("answers");
  EXPECT_EQ(textFor(extension, beginWell(extension), "descriptors"), "0 /dev/null\n1 pipe\n2 pipe\n3 socket\n");
}

TEST_F(ExtensionHostTest, WorkingDirectoryIsTheBundleAndSignalsAreAtTheirDefaults) {
  struct sigaction ignore {};
  ignore.sa_handler = SIG_IGN;
  struct sigaction before {};
  ::sigaction(SIGPIPE, &ignore, &before);
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(textFor(extension, request, "directory"), directory_ / "extensions/answers.appdex");
  EXPECT_EQ(textFor(extension, request, "signals"), "parent death " + std::to_string(SIGKILL));
  ::sigaction(SIGPIPE, &before, nullptr);
}

TEST_F(ExtensionHostTest, OutputGoesToTheLogLineByLine) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(textFor(extension, request, "print"), "printed");
  EXPECT_TRUE(ask(extension, request, "exit").failure);  // reaped by now, its output read to the end
  const std::vector<std::string> lines = platform_->log().texts();
  const std::string prefix = "[NOTICE] Extension org.answers: ";
  EXPECT_THAT(lines, Contains(prefix + "out one"));
  EXPECT_THAT(lines, Contains(prefix + "out two"));
  EXPECT_THAT(lines, Contains(prefix + "no end"));
  EXPECT_THAT(lines, Contains(prefix + "err"));
  EXPECT_THAT(lines, Contains(prefix + std::string(OutputLines::lineLimit, 'x') + " [cut]"));
  EXPECT_THAT(lines, Contains(prefix + escapedForLog("forged\x1b[2J\x01line")));
}

TEST_F(ExtensionHostTest, IdleProcessIsEndedTenSecondsAfterTheLastRequest) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  const Watched process(processOf(extension, one));
  extension->cancelExtensionRequest(one);
  time_.advance(20s);
  EXPECT_EQ(textFor(extension, two, "x"), "x") << "one request is still open";
  extension->cancelExtensionRequest(two);
  EXPECT_EQ(extension->extensionContextForRequest(two), nullptr);
  time_.advance(10s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionHostTest, NewRequestWithinTheIdleTimeKeepsTheProcess) {
  const Record extension = installedRecord("answers");
  RequestIdentifier request = beginWell(extension);
  const pid_t process = processOf(extension, request);
  extension->cancelExtensionRequest(request);
  time_.advance(9s);
  request = beginWell(extension);
  time_.advance(9s);
  EXPECT_EQ(processOf(extension, request), process);
  extension->cancelExtensionRequest(request);
  extension->cancelExtensionRequest(request);
  time_.advance(9s);
  EXPECT_EQ(processOf(extension, beginWell(extension)), process) << "the idle time begins anew";
}

TEST_F(ExtensionHostTest, IdleTimeCountsFromTheLastOfSeveralRequests) {
  const Record extension = installedRecord("answers");
  RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  extension->cancelExtensionRequest(request);
  time_.advance(6s);
  request = beginWell(extension);
  extension->cancelExtensionRequest(request);
  time_.advance(4s);
  ASSERT_TRUE(time_.waitForTaskIn(6s));
  EXPECT_TRUE(process.isRunning());
  time_.advance(6s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionHostTest, OneTaskWaitsForTheIdleTimeHoweverManyRequestsEnd) {
  const Record extension = installedRecord("answers");
  extension->cancelExtensionRequest(beginWell(extension));
  const std::size_t waiting = time_.delayedCount();
  for (int i = 0; i < 100; ++i) extension->cancelExtensionRequest(beginWell(extension));
  EXPECT_EQ(time_.delayedCount(), waiting);
}

TEST_F(ExtensionHostTest, ProcessThatOutlivesItsConnectionGetsTheTerminationSignal) {
  const Record extension = installedRecord("stays");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  expectEndByTheFirstSignal(extension, request, process);
}

TEST_F(ExtensionHostTest, ProcessThatIgnoresTheTerminationSignalIsKilled) {
  const Record extension = installedRecord("ignores-termination");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  expectEndByTheSecondSignal(extension, request, process);
}

TEST_F(ExtensionHostTest, RequestThatComesWhileTheIdleProcessEndsGetsANewOne) {
  const Record extension = installedRecord("stays");
  const RequestIdentifier request = beginWell(extension);
  const pid_t old = processOf(extension, request);
  extension->cancelExtensionRequest(request);
  time_.advance(10s);
  ASSERT_TRUE(time_.waitForTaskIn(5s));
  const RequestIdentifier next = beginWell(extension);
  EXPECT_NE(processOf(extension, next), old);
  time_.advance(10s);
  EXPECT_EQ(textFor(extension, next, "x"), "x") << "the end of the old process is not the new one's";
}

TEST_F(ExtensionHostTest, RequestsOfAReplacedRecordGoOnWithTheirProcess) {
  const Record old = installedRecord("answers");
  const RequestIdentifier request = beginWell(old);
  const pid_t process = processOf(old, request);
  install("answers", R"(, "KTBundleVersion": "2")");
  ASSERT_TRUE(time_.waitForTaskIn(100ms));
  Record renewed;
  do {
    time_.advance(100ms);
    renewed = record();
  } while (renewed == old);
  EXPECT_FALSE(renewed->isEqual(*old));
  EXPECT_TRUE(renewed->isEqual(*renewed));
  const RequestIdentifier next = beginWell(renewed);
  EXPECT_NE(processOf(renewed, next), process);
  EXPECT_EQ(processOf(old, request), process);
  renewed->cancelExtensionRequest(request);
  EXPECT_NE(old->extensionContextForRequest(request), nullptr) << "another record's request is unknown";
}

TEST_F(ExtensionHostTest, RecordThatIsGoneEndsItsProcess) {
  Record extension = installedRecord("answers");
  const Watched process(processOf(extension, beginWell(extension)));
  extension.reset();
  std::filesystem::remove_all(directory_ / "extensions/answers.appdex");
  ASSERT_TRUE(time_.waitForTaskIn(100ms));
  // Until the removal has settled and the list without it has taken the place of the other.
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (process.isRunning() && std::chrono::steady_clock::now() < deadline) {
    time_.advance(100ms);
    std::this_thread::yield();
  }
  EXPECT_FALSE(process.isRunning());
}

TEST_F(ExtensionHostTest, WithoutAContextClassARequestHasNoContext) {
  makeHost(false);
  const Record extension = installedRecord("answers");
  EXPECT_EQ(extension->extensionContextForRequest(beginWell(extension)), nullptr);
}

TEST_F(ExtensionHostTest, UnknownRequestsAreIgnored) {
  const Record extension = installedRecord("answers");
  extension->cancelExtensionRequest({"unknown"});
  EXPECT_EQ(extension->extensionContextForRequest({"unknown"}), nullptr);
}

TEST_F(ExtensionHostTest, BundleRecordsAreFoundByIdentifier) {
  install("answers", R"(, "KTGroupContainers": ["g"])");
  const std::shared_ptr<BundleRecord> found = host_->bundleRecordForIdentifier("org.answers");
  ASSERT_TRUE(found);
  EXPECT_EQ(found->groupContainerURLs().size(), 1U);
  EXPECT_FALSE(host_->bundleRecordForIdentifier("org.other"));
  EXPECT_FALSE(host_->bundleRecordForIdentifier(std::nullopt));
}

TEST_F(ExtensionHostTest, ProcessIsKnownAsItsExtensions) {
  const Record extension = installedRecord("answers");
  EXPECT_FALSE(host_->isProcessOfExtension(*extension->identifier(), 0));
  const pid_t process = processOf(extension, beginWell(extension));
  EXPECT_TRUE(host_->isProcessOfExtension(*extension->identifier(), process));
  EXPECT_FALSE(host_->isProcessOfExtension("org.sample.other", process));
  EXPECT_FALSE(host_->isProcessOfExtension(*extension->identifier(), ::getpid()));
}

TEST_F(ExtensionHostTest, EndOfTheHostEndsAndReapsAllProcesses) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  Later<Answer> inFlight = askLater(extension, request, "silence");
  host_.reset();
  EXPECT_FALSE(hasChildren());
  EXPECT_TRUE(isCode(inFlight.wait().failure, HostErrorCode::hostEnding));
  EXPECT_TRUE(isCode(failureOf(extension), HostErrorCode::hostEnding));
}

TEST_F(ExtensionHostTest, EndOfTheHostKillsWhatDoesNotEnd) {
  const Record extension = installedRecord("ignores-termination");
  static_cast<void>(beginWell(extension));
  host_.reset();
  EXPECT_FALSE(hasChildren());
}

TEST_F(ExtensionHostTest, AProcessThatADebuggerHoldsAfterItsEndIsReapedWhenItLetsGo) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  const std::string tracer = textFor(extension, request, "be-traced");
  ASSERT_NE(std::atoi(tracer.c_str()), 0) << tracer;
  const pid_t process = processOf(extension, request);
  const Watched watched(process);
  Later<Answer> leaving = askLater(extension, request, "leave");
  EXPECT_TRUE(watched.waitForExit());
  ::kill(std::atoi(tracer.c_str()), SIGKILL);
  EXPECT_TRUE(isCode(leaving.wait().failure, HostErrorCode::extensionExited));
  waitUntilReaped(process);
}

TEST_F(ExtensionHostTest, EndOfTheHostReapsAProcessThatADebuggerHeldAfterItsEnd) {
  const Record extension = installedRecord("answers");
  const std::string tracer = textFor(extension, beginWell(extension), "be-traced");
  ASSERT_NE(std::atoi(tracer.c_str()), 0) << tracer;
  auto ended = std::async(std::launch::async, [this] { host_.reset(); });
  // The process has gone at the first signal, but cannot be reaped, and so gets the second one too.
  static_cast<void>(waitForLine("with signal 9"));
  ::kill(std::atoi(tracer.c_str()), SIGKILL);
  ended.wait();
  EXPECT_FALSE(hasChildren());
}

TEST_F(ExtensionHostTest, EndOfTheHostFailsTheBeginsThatWait) {
  const Record extension = installedRecord("never-logs-in");
  Later<Begun> begun = beginLater(extension);
  host_.reset();
  EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::hostEnding));
  EXPECT_FALSE(hasChildren());
}

TEST(ExtensionLauncherTest, ChildrenDieWithTheDaemon) {
  // The grandchild must come to this process when its parent is gone, so that its end can be seen.
  ASSERT_EQ(::prctl(PR_SET_CHILD_SUBREAPER, 1), 0);
  TestDirectory directory;
  const std::string executable = directory.makeLink("never-logs-in", STORIX_TEST_EXTENSION);
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const pid_t daemon = ::fork();
  if (daemon == 0) {
    auto *launcher = new ExtensionLauncher;
    LaunchDescription description;
    description.executable = executable;
    description.workingDirectory = "/";
    description.socket.reset(::open("/dev/null", O_RDWR | O_CLOEXEC));
    launcher->launch(std::move(description), [end = ends[1]](const Result<LaunchedProcess> &process) {
      pid_t child = -1;
      if (process) {
        // The pipe ends when the program runs: the kernel knows by then what the child wants of it.
        pollfd running{process.value().execFailure.get(), POLLIN, 0};
        ::poll(&running, 1, -1);
        child = process.value().processIdentifier;
      }
      static_cast<void>(!::write(end, &child, sizeof(child)));
    });
    launcher->waitUntilIdle();
    ::kill(::getpid(), SIGKILL);
  }
  pid_t child = 0;
  ASSERT_EQ(::read(ends[0], &child, sizeof(child)), static_cast<ssize_t>(sizeof(child)));
  ::close(ends[0]);
  ::close(ends[1]);
  ASSERT_GT(child, 0);
  int status = 0;
  ASSERT_EQ(::waitpid(daemon, &status, 0), daemon);
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFSIGNALED(status));
  EXPECT_EQ(WTERMSIG(status), SIGKILL);
  ::prctl(PR_SET_CHILD_SUBREAPER, 0);
}

}  // namespace
}  // namespace storix::linuxhost
