#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <csignal>
#include <filesystem>

#include "platform/linux/extensions/ExtensionHostTest.h"

namespace storix::linuxhost {
namespace {

using ::testing::HasSubstr;

using ExtensionFailureTest = ExtensionHostTest;

TEST_F(ExtensionFailureTest, CrashFailsExactlyTheMessagesInFlight) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  Later<Answer> before = askLater(extension, one, "x");
  EXPECT_EQ(before.wait().text, "x");
  Later<Answer> silent = askLater(extension, two, "silence");
  const pid_t process = processOf(extension, one);
  Later<Answer> crash = askLater(extension, one, "crash");
  for (Later<Answer> *answer : {&silent, &crash}) {
    const Answer got = answer->wait();
    EXPECT_TRUE(isCode(got.failure, HostErrorCode::extensionKilled));
    EXPECT_THAT(got.failure->message(), HasSubstr("org.answers was killed by signal 9 (Killed)"));
    EXPECT_EQ(answer->count(), 1);
  }
  EXPECT_EQ(::kill(process, 0), -1) << "it is reaped when the failure is told";
  EXPECT_EQ(before.count(), 1);
  EXPECT_EQ(extension->extensionContextForRequest(one), nullptr);
  EXPECT_EQ(extension->extensionContextForRequest(two), nullptr);
  EXPECT_NE(processOf(extension, beginWell(extension)), process);
}

TEST_F(ExtensionFailureTest, RequestWithoutAMessageInFlightHearsOfTheCrashWithItsNextOne) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  EXPECT_THAT(ask(extension, one, "exit").failure->message(), HasSubstr("exited with status 3."));
  ASSERT_NE(extension->extensionContextForRequest(two), nullptr);
  const Answer late = ask(extension, two, "x");
  EXPECT_TRUE(isCode(late.failure, HostErrorCode::extensionExited));
}

TEST_F(ExtensionFailureTest, AnswerThatWasSentBeforeTheExitArrives) {
  const Record extension = installedRecord("answers");
  EXPECT_EQ(textFor(extension, beginWell(extension), "answer-and-exit"), "the last words");
}

TEST_F(ExtensionFailureTest, ErrorReplyFailsTheMessageAndEndsTheRequestAlone) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  const Watched process(processOf(extension, one));
  const Answer failed = ask(extension, one, "bus-error");
  ASSERT_TRUE(failed.failure);
  EXPECT_THAT(failed.failure->message(), HasSubstr("no such luck"));
  EXPECT_EQ(extension->extensionContextForRequest(one), nullptr);
  EXPECT_EQ(textFor(extension, two, "x"), "x");
  // Nobody may ever cancel a request whose connection has reported a failure.
  EXPECT_TRUE(ask(extension, two, "bus-error").failure);
  time_.advance(10s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionFailureTest, ReplyOfAnotherSignatureFailsTheMessage) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  EXPECT_TRUE(ask(extension, one, "wrong-signature").failure);
  EXPECT_EQ(textFor(extension, two, "x"), "x");
}

TEST_F(ExtensionFailureTest, ConnectionThatIsClosedByALivingProcessSaysSo) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  Later<Answer> answer = askLater(extension, request, "close");
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  ASSERT_TRUE(time_.waitForTaskIn(5s));
  EXPECT_EQ(answer.count(), 0) << "the exit may still come";
  time_.advance(1s);
  EXPECT_TRUE(isCode(answer.wait().failure, HostErrorCode::connectionClosed));
  time_.advance(4s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionFailureTest, MessageBeyondThoseThatMayWaitFailsAtOnceAndOthersAreAnswered) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier silent = beginWell(extension);
  const RequestIdentifier refused = beginWell(extension);
  const pid_t process = processOf(extension, silent);
  std::vector<Later<Answer>> waiting;
  waiting.reserve(4096);
  for (int i = 0; i < 4096; ++i) waiting.push_back(askLater(extension, silent, "silence"));
  const Answer failed = ask(extension, refused, "x");
  ASSERT_TRUE(failed.failure);
  EXPECT_EQ(failed.failure->details().at("busError"), Value("org.freedesktop.DBus.Error.LimitsExceeded"));
  EXPECT_THAT(failed.failure->message(), HasSubstr("extension org.answers, pid " + std::to_string(process) +
                                                   " has not answered 4096 messages yet"));
  EXPECT_EQ(extension->extensionContextForRequest(refused), nullptr) << "its request has ended";
  for (const Later<Answer> &answer : waiting) ASSERT_EQ(answer.count(), 0);
  ::kill(process, SIGKILL);
  for (Later<Answer> &answer : waiting) {
    ASSERT_TRUE(isCode(answer.wait().failure, HostErrorCode::extensionKilled));
  }
  EXPECT_EQ(textFor(extension, beginWell(extension), "x"), "x");
}

TEST_F(ExtensionFailureTest, BeginBeyondThoseThatMayWaitForTheStartFailsAtOnce) {
  const Record extension = installedRecord("never-logs-in");
  std::vector<Later<Begun>> waiting;
  waiting.reserve(1024);
  for (int i = 0; i < 1024; ++i) waiting.push_back(beginLater(extension));
  const std::optional<SXError> refused = failureOf(extension);
  EXPECT_TRUE(isCode(refused, HostErrorCode::tooManyRequests));
  EXPECT_EQ(refused->message(), "1024 requests wait already until the process of the extension " +
                                    extension->description() + " has started; try again when it has.");
  for (const Later<Begun> &begun : waiting) ASSERT_EQ(begun.count(), 0);
  time_.advance(10s);
  for (Later<Begun> &begun : waiting) ASSERT_TRUE(isCode(begun.wait().error, HostErrorCode::loginTimedOut));
  // There is room again.
  Later<Begun> next = beginLater(extension);
  time_.advance(10s);
  EXPECT_TRUE(isCode(next.wait().error, HostErrorCode::loginTimedOut));
}

TEST_F(ExtensionFailureTest, MissingExecutableFailsTheBegin) {
  install("answers");
  std::filesystem::remove(directory_ / "extensions/answers.appdex/answers");
  const std::optional<SXError> error = failureOf(record());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), posixErrorDomain);
  EXPECT_EQ(error->code(), ENOENT);
  EXPECT_THAT(error->message(), HasSubstr(directory_ / "extensions/answers.appdex/answers"));
  EXPECT_THAT(error->message(), HasSubstr("No such file or directory"));
}

TEST_F(ExtensionFailureTest, FileThatIsNotExecutableFailsTheBegin) {
  install("answers");
  std::filesystem::remove(directory_ / "extensions/answers.appdex/answers");
  directory_.makeFile("extensions/answers.appdex/answers", "text");
  const std::optional<SXError> error = failureOf(record());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), posixErrorDomain);
  EXPECT_EQ(error->code(), EACCES);
}

TEST_F(ExtensionFailureTest, ExecutableOutsideTheBundleFailsTheBegin) {
  directory_.makeFile("extensions/x.appdex/Info.kvs",
                      R"({"KTExtensionPointIdentifier": "point", "KTBundleExecutable": "../../run"})");
  EXPECT_TRUE(isCode(failureOf(record()), HostErrorCode::noExecutable));
}

TEST_F(ExtensionFailureTest, ProcessThatExitsBeforeItsLoginFailsTheBeginWithItsStatus) {
  const std::optional<SXError> error = failureOf(installedRecord("exits-at-once"));
  EXPECT_TRUE(isCode(error, HostErrorCode::extensionExited));
  EXPECT_THAT(error->message(), HasSubstr("org.exits-at-once exited with status 7, before it had logged in"));
}

TEST_F(ExtensionFailureTest, ProcessThatIsKilledBeforeItsLoginFailsTheBeginWithTheSignal) {
  const std::optional<SXError> error = failureOf(installedRecord("dies-at-once"));
  EXPECT_TRUE(isCode(error, HostErrorCode::extensionKilled));
  EXPECT_THAT(error->message(), HasSubstr("killed by signal 9"));
}

TEST_F(ExtensionFailureTest, LoginThatTakesTooLongFailsAllBeginsAndEndsTheProcess) {
  const Record extension = installedRecord("never-logs-in");
  Later<Begun> first = beginLater(extension);
  Later<Begun> second = beginLater(extension);
  const Watched process(startedProcess());
  time_.advance(9s);
  time_.advance(1s);
  for (Later<Begun> *begun : {&first, &second}) {
    const std::optional<SXError> error = begun->wait().error;
    EXPECT_TRUE(isCode(error, HostErrorCode::loginTimedOut));
    EXPECT_THAT(error->message(), HasSubstr("did not finish its login within 10 seconds"));
  }
  ASSERT_TRUE(time_.waitForTaskIn(5s));
  EXPECT_TRUE(process.isRunning());
  // Where the start was still on its way it ends the process once more, with a time of its own.
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (process.isRunning() && std::chrono::steady_clock::now() < deadline) time_.advance(5s);
  EXPECT_FALSE(process.isRunning());
}

TEST_F(ExtensionFailureTest, NonsenseInsteadOfALoginFailsTheBegin) {
  Later<Begun> begun = beginLater(installedRecord("sends-nonsense"));
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  time_.advance(1s);
  const std::optional<SXError> error = begun.wait().error;
  EXPECT_TRUE(isCode(error, HostErrorCode::connectionClosed));
  EXPECT_THAT(error->message(), HasSubstr("The login of the extension org.sends-nonsense failed"));
}

TEST_F(ExtensionFailureTest, SocketThatIsClosedInsteadOfALoginFailsTheBegin) {
  Later<Begun> begun = beginLater(installedRecord("closes-at-once"));
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  time_.advance(1s);
  EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::connectionClosed));
}

TEST_F(ExtensionFailureTest, ThirdFailureInTenSecondsMeansTenSecondsOfRest) {
  const Record extension = installedRecord("exits-at-once");
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(isCode(failureOf(extension), HostErrorCode::extensionExited));
  const std::optional<SXError> error = failureOf(extension);
  EXPECT_TRUE(isCode(error, HostErrorCode::startingTooOften));
  EXPECT_THAT(error->message(), HasSubstr("failed three times within 10 seconds"));
  ASSERT_TRUE(error->underlyingError());
  EXPECT_TRUE(isCode(*error->underlyingError(), HostErrorCode::extensionExited));
  time_.advance(9s);
  EXPECT_TRUE(isCode(failureOf(extension), HostErrorCode::startingTooOften));
  // Before the executor comes to it, the extension still rests.
  time_.advance(1s);
  std::optional<SXError> after;
  do {
    after = failureOf(extension);
  } while (isCode(after, HostErrorCode::startingTooOften));
  EXPECT_TRUE(isCode(after, HostErrorCode::extensionExited)) << "it is started again";
}

TEST_F(ExtensionFailureTest, CrashesCountAsFailuresAndOneCrashCountsOnce) {
  const Record extension = installedRecord("answers");
  for (int i = 0; i < 3; ++i) {
    const RequestIdentifier one = beginWell(extension);
    const RequestIdentifier two = beginWell(extension);
    Later<Answer> silent = askLater(extension, two, "silence");
    EXPECT_TRUE(ask(extension, one, "crash").failure);
    EXPECT_TRUE(silent.wait().failure);
  }
  EXPECT_TRUE(isCode(failureOf(extension), HostErrorCode::startingTooOften));
}

TEST_F(ExtensionFailureTest, FailuresThatLieFurtherApartAreForgotten) {
  const Record extension = installedRecord("exits-at-once");
  for (int i = 0; i < 6; ++i) {
    EXPECT_TRUE(isCode(failureOf(extension), HostErrorCode::extensionExited));
    ASSERT_TRUE(time_.waitForTaskIn(10s));
    time_.advance(10s);
    // The executor has to come to it before the next failure.
    std::promise<void> reached;
    pool_.execute([&reached] { reached.set_value(); });
    reached.get_future().wait();
  }
}

TEST_F(ExtensionFailureTest, ProcessThatLeavesWhileItHasNothingToDoDoesNotCountAsFailed) {
  const Record extension = installedRecord("answers");
  for (int i = 0; i < 4; ++i) {
    const RequestIdentifier request = beginWell(extension);
    const pid_t process = processOf(extension, request);
    const Watched watched(process);
    extension->cancelExtensionRequest(request);
    watched.endWith(SIGUSR1);
    waitUntilReaped(process);
  }
}

TEST_F(ExtensionFailureTest, OtherExtensionsGoOnWhileOneRests) {
  const Record failing = installedRecord("exits-at-once");
  for (int i = 0; i < 3; ++i) static_cast<void>(failureOf(failing));
  std::filesystem::remove_all(directory_ / "extensions");
  makeHost(true);
  const Record other = installedRecord("answers");
  EXPECT_TRUE(isCode(failureOf(failing), HostErrorCode::startingTooOften));
  EXPECT_EQ(textFor(other, beginWell(other), "x"), "x");
}

}  // namespace
}  // namespace storix::linuxhost
