#include "platform/linux/ExtensionHost.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <future>
#include <thread>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/ExtensionProcess.h"
#include "platform/linux/HostErrors.h"
#include "platform/linux/InstalledExtension.h"
#include "platform/linux/SteppedTime.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using namespace std::chrono_literals;

const ProtocolDescription vendorProtocol{"_KTStorixVendor",
                                         "com.tessel.StorixVendor",
                                         "/com/tessel/StorixVendor",
                                         {{"_identifierForItemAtURL:completion:",
                                           "IdentifierForItemAtURL",
                                           {{"URL", ValueKind::URL}},
                                           {{"error", ValueKind::error}, {"itemIdentifier", ValueKind::string}}}}};

using Record = std::shared_ptr<ExtensionRecord>;

struct Begun {
  std::optional<RequestIdentifier> request;
  std::optional<SXError> error;
};

/// What became of one message.
struct Answer {
  std::optional<std::string> text;
  /// What the error handler got.
  std::optional<SXError> failure;
};

/// A result that a handler gives later, and how often it has been given.
template <class T>
class Later {
 public:
  void give(T value) {
    if (state_->count.fetch_add(1) == 0) state_->promise.set_value(std::move(value));
  }
  T wait() {
    if (state_->future.wait_for(60s) != std::future_status::ready) {
      ADD_FAILURE() << "nothing came";
      return {};
    }
    return state_->future.get();
  }
  [[nodiscard]] int count() const { return state_->count; }

 private:
  struct State {
    std::promise<T> promise;
    std::future<T> future = promise.get_future();
    std::atomic<int> count{0};
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

bool isCode(const std::optional<SXError> &error, HostErrorCode code) {
  return error && error->domain() == platformErrorDomain && error->code() == static_cast<std::int64_t>(code);
}

/// A process that the test watches, though the host is its parent.
class Watched {
 public:
  explicit Watched(pid_t process) : pidfd_(static_cast<int>(::syscall(SYS_pidfd_open, process, 0))) {
    EXPECT_TRUE(pidfd_) << process;
  }
  [[nodiscard]] bool isRunning() const { return !hasExited(0); }
  [[nodiscard]] bool waitForExit() const { return hasExited(60'000); }

 private:
  [[nodiscard]] bool hasExited(int milliseconds) const {
    pollfd waiting{pidfd_.get(), POLLIN, 0};
    return ::poll(&waiting, 1, milliseconds) == 1;
  }
  UniqueFd pidfd_;
};

class ExtensionHostTest : public ::testing::Test {
 protected:
  ExtensionHostTest() { makeHost(true); }

  void makeHost(bool withContextClass) {
    host_.reset();
    host_ = std::make_unique<ExtensionHost>(
        ExtensionPlaces{{directory_ / "extensions"}, directory_ / "groups"},
        std::vector<std::string>{"HOME=/home/u", "PATH=/bin", "STORIX_RUNTIME_DIR=/run/x"}, time_, loop_);
    if (!withContextClass) return;
    host_->registerExtensionContextClass("_KTStorixExtensionHostContext",
                                         {[]() -> const LinkInterface & { return vendorInterface(); },
                                          []() -> const LinkInterface & { return vendorInterface(); },
                                          [](std::shared_ptr<AuxiliaryConnection> connection) {
                                            return std::make_shared<ExtensionContext>(std::move(connection));
                                          }});
  }

  static const LinkInterface &vendorInterface() {
    static const LinkInterface interface(vendorProtocol);
    return interface;
  }

  /// Installs the test's extension, which behaves as its executable is called.
  std::string install(const std::string &behaviour, const std::string &more = {}) {
    const std::string bundle = "extensions/" + behaviour + ".appdex";
    directory_.makeFile(bundle + "/Info.kvs",
                        R"({"KTBundleIdentifier": "org.)" + behaviour +
                            R"(", "KTExtensionPointIdentifier": "point", "KTBundleExecutable": ")" + behaviour + "\"" +
                            more + "}");
    if (!std::filesystem::exists(directory_ / (bundle + "/" + behaviour))) {
      directory_.makeLink(bundle + "/" + behaviour, STORIX_TEST_EXTENSION);
    }
    return directory_ / bundle;
  }

  /// The record of the one extension that is installed.
  Record record() {
    Later<std::vector<Record>> found;
    const auto matching =
        host_->beginMatchingExtensions({{std::string(extensionPointAttribute), "point"}},
                                       [found](std::vector<Record> records, const std::optional<SXError> &) mutable {
                                         found.give(std::move(records));
                                       });
    const std::vector<Record> records = found.wait();
    EXPECT_EQ(records.size(), 1U);
    return records.empty() ? nullptr : records.front();
  }

  Record installedRecord(const std::string &behaviour, const std::string &more = {}) {
    install(behaviour, more);
    return record();
  }

  static Later<Begun> beginLater(const Record &record) {
    Later<Begun> begun;
    const auto inside = std::make_shared<std::atomic<bool>>(true);
    record->beginExtensionRequest(
        [begun, inside, thread = std::this_thread::get_id()](const auto &request, const auto &error) mutable {
          EXPECT_FALSE(*inside && thread == std::this_thread::get_id()) << "the handler ran inside the call";
          begun.give({request, error});
        });
    *inside = false;
    return begun;
  }

  static Begun begin(const Record &record) { return beginLater(record).wait(); }

  static RequestIdentifier beginWell(const Record &record) {
    const Begun begun = begin(record);
    EXPECT_FALSE(begun.error) << begun.error->message();
    EXPECT_TRUE(begun.request);
    return begun.request.value_or(RequestIdentifier{});
  }

  static Later<Answer> askLater(const Record &record, const RequestIdentifier &request, const std::string &what) {
    Later<Answer> answer;
    const std::shared_ptr<ExtensionContext> context = record->extensionContextForRequest(request);
    if (!context) {
      ADD_FAILURE() << "no context";
      return answer;
    }
    const std::shared_ptr<RemoteObject> proxy =
        context->auxiliaryConnection()->remoteProxyWithErrorHandler([answer](SXError error) mutable {
          answer.give({std::nullopt, std::move(error)});
        });
    proxy->send(0, {Value(*URL::fileURLWithPath("/" + what))}, [answer](const Arguments &values) mutable {
      answer.give({values.at(1) ? std::optional(*values.at(1)->string()) : std::nullopt, std::nullopt});
    });
    return answer;
  }

  static Answer ask(const Record &record, const RequestIdentifier &request, const std::string &what) {
    return askLater(record, request, what).wait();
  }

  static std::string textFor(const Record &record, const RequestIdentifier &request, const std::string &what) {
    const Answer answer = ask(record, request, what);
    EXPECT_FALSE(answer.failure) << answer.failure->message();
    return answer.text.value_or("");
  }

  static pid_t processOf(const Record &record, const RequestIdentifier &request) {
    return static_cast<pid_t>(std::stol("0" + textFor(record, request, "pid")));
  }

  static std::optional<SXError> failureOf(const Record &record) { return begin(record).error; }

  /// The process of the extension that was started, as the log tells.
  pid_t startedProcess() {
    const std::string beginning = "[INFO] Started process ";
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    while (std::chrono::steady_clock::now() < deadline) {
      for (const std::string &line : platform_->log().texts()) {
        if (line.starts_with(beginning)) return static_cast<pid_t>(std::stol(line.substr(beginning.size())));
      }
      std::this_thread::yield();
    }
    ADD_FAILURE() << "no process was started";
    return 0;
  }

  static void waitUntilReaped(pid_t process) {
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    while (::kill(process, 0) == 0 && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    EXPECT_EQ(::kill(process, 0), -1);
  }

  static bool hasChildren() {
    siginfo_t information{};
    return ::waitid(P_ALL, 0, &information, WEXITED | WNOHANG | WNOWAIT) == 0;
  }

  TestDirectory directory_;
  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
  ThreadPool pool_;
  SteppedTime time_{pool_};
  IoLoop loop_{pool_};
  std::unique_ptr<ExtensionHost> host_;
};

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

TEST_F(ExtensionHostTest, ProcessThatOutlivesItsConnectionGetsTheTerminationSignal) {
  const Record extension = installedRecord("stays");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  extension->cancelExtensionRequest(request);
  time_.advance(10s);
  ASSERT_TRUE(time_.waitForTaskIn(5s));
  EXPECT_TRUE(process.isRunning());
  time_.advance(5s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionHostTest, ProcessThatIgnoresTheTerminationSignalIsKilled) {
  const Record extension = installedRecord("ignores-termination");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(processOf(extension, request));
  extension->cancelExtensionRequest(request);
  time_.advance(10s);
  ASSERT_TRUE(time_.waitForTaskIn(10s));
  time_.advance(5s);
  EXPECT_TRUE(process.isRunning());
  time_.advance(5s);
  EXPECT_TRUE(process.waitForExit());
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

TEST_F(ExtensionHostTest, CrashFailsExactlyTheMessagesInFlight) {
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

TEST_F(ExtensionHostTest, RequestWithoutAMessageInFlightHearsOfTheCrashWithItsNextOne) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  EXPECT_THAT(ask(extension, one, "exit").failure->message(), HasSubstr("exited with status 3."));
  ASSERT_NE(extension->extensionContextForRequest(two), nullptr);
  const Answer late = ask(extension, two, "x");
  EXPECT_TRUE(isCode(late.failure, HostErrorCode::extensionExited));
}

TEST_F(ExtensionHostTest, AnswerThatWasSentBeforeTheExitArrives) {
  const Record extension = installedRecord("answers");
  EXPECT_EQ(textFor(extension, beginWell(extension), "answer-and-exit"), "the last words");
}

TEST_F(ExtensionHostTest, ErrorReplyFailsTheMessageAndEndsTheRequestAlone) {
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

TEST_F(ExtensionHostTest, ReplyOfAnotherSignatureFailsTheMessage) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier one = beginWell(extension);
  const RequestIdentifier two = beginWell(extension);
  EXPECT_TRUE(ask(extension, one, "wrong-signature").failure);
  EXPECT_EQ(textFor(extension, two, "x"), "x");
}

TEST_F(ExtensionHostTest, ConnectionThatIsClosedByALivingProcessSaysSo) {
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

TEST_F(ExtensionHostTest, MissingExecutableFailsTheBegin) {
  install("answers");
  std::filesystem::remove(directory_ / "extensions/answers.appdex/answers");
  const std::optional<SXError> error = failureOf(record());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), posixErrorDomain);
  EXPECT_EQ(error->code(), ENOENT);
  EXPECT_THAT(error->message(), HasSubstr(directory_ / "extensions/answers.appdex/answers"));
  EXPECT_THAT(error->message(), HasSubstr("No such file or directory"));
}

TEST_F(ExtensionHostTest, FileThatIsNotExecutableFailsTheBegin) {
  install("answers");
  std::filesystem::remove(directory_ / "extensions/answers.appdex/answers");
  directory_.makeFile("extensions/answers.appdex/answers", "text");
  const std::optional<SXError> error = failureOf(record());
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), posixErrorDomain);
  EXPECT_EQ(error->code(), EACCES);
}

TEST_F(ExtensionHostTest, ExecutableOutsideTheBundleFailsTheBegin) {
  directory_.makeFile("extensions/x.appdex/Info.kvs",
                      R"({"KTExtensionPointIdentifier": "point", "KTBundleExecutable": "../../run"})");
  EXPECT_TRUE(isCode(failureOf(record()), HostErrorCode::noExecutable));
}

TEST_F(ExtensionHostTest, ProcessThatExitsBeforeItsLoginFailsTheBeginWithItsStatus) {
  const std::optional<SXError> error = failureOf(installedRecord("exits-at-once"));
  EXPECT_TRUE(isCode(error, HostErrorCode::extensionExited));
  EXPECT_THAT(error->message(), HasSubstr("org.exits-at-once exited with status 7, before it had logged in"));
}

TEST_F(ExtensionHostTest, ProcessThatIsKilledBeforeItsLoginFailsTheBeginWithTheSignal) {
  const std::optional<SXError> error = failureOf(installedRecord("dies-at-once"));
  EXPECT_TRUE(isCode(error, HostErrorCode::extensionKilled));
  EXPECT_THAT(error->message(), HasSubstr("killed by signal 9"));
}

TEST_F(ExtensionHostTest, LoginThatTakesTooLongFailsAllBeginsAndEndsTheProcess) {
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
  time_.advance(5s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ExtensionHostTest, NonsenseInsteadOfALoginFailsTheBegin) {
  Later<Begun> begun = beginLater(installedRecord("sends-nonsense"));
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  time_.advance(1s);
  const std::optional<SXError> error = begun.wait().error;
  EXPECT_TRUE(isCode(error, HostErrorCode::connectionClosed));
  EXPECT_THAT(error->message(), HasSubstr("The login of the extension org.sends-nonsense failed"));
}

TEST_F(ExtensionHostTest, SocketThatIsClosedInsteadOfALoginFailsTheBegin) {
  Later<Begun> begun = beginLater(installedRecord("closes-at-once"));
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  time_.advance(1s);
  EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::connectionClosed));
}

TEST_F(ExtensionHostTest, ThirdFailureInTenSecondsMeansTenSecondsOfRest) {
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

TEST_F(ExtensionHostTest, CrashesCountAsFailuresAndOneCrashCountsOnce) {
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

TEST_F(ExtensionHostTest, FailuresThatLieFurtherApartAreForgotten) {
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

TEST_F(ExtensionHostTest, ProcessThatLeavesWhileItHasNothingToDoDoesNotCountAsFailed) {
  const Record extension = installedRecord("answers");
  for (int i = 0; i < 4; ++i) {
    const RequestIdentifier request = beginWell(extension);
    const pid_t process = processOf(extension, request);
    const Watched watched(process);
    extension->cancelExtensionRequest(request);
    ASSERT_EQ(::kill(process, SIGUSR1), 0);
    EXPECT_TRUE(watched.waitForExit());
    waitUntilReaped(process);
  }
}

TEST_F(ExtensionHostTest, OtherExtensionsGoOnWhileOneRests) {
  const Record failing = installedRecord("exits-at-once");
  for (int i = 0; i < 3; ++i) static_cast<void>(failureOf(failing));
  std::filesystem::remove_all(directory_ / "extensions");
  makeHost(true);
  const Record other = installedRecord("answers");
  EXPECT_TRUE(isCode(failureOf(failing), HostErrorCode::startingTooOften));
  EXPECT_EQ(textFor(other, beginWell(other), "x"), "x");
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
