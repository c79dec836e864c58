#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/prctl.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>

#include "platform/linux/extensions/ExtensionConfinement.h"
#include "platform/linux/extensions/ExtensionHostTest.h"

namespace storix::linuxhost {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

constexpr const char *absent = "No such file or directory";
constexpr const char *readOnly = "Read-only file system";

/// Real bubblewrap around real processes, in a home directory of the test's own.
class ConfinedExtensionTest : public ExtensionHostTest {
 protected:
  ConfinedExtensionTest() {
    directory_.makeDirectory("home/Library/Storix");
    directory_.makeDirectory("run");
    confine(ConfinementPolicy::preferred);
  }

  void confine(ConfinementPolicy policy, const std::string &program = ExtensionConfinement::bubblewrap) {
    ConfinementPlaces places;
    places.homeDirectory = directory_ / "home";
    places.extensions = {{directory_ / "extensions"}, directory_ / "groups"};
    places.hidden = {directory_ / "run", directory_ / "home/Library/Storix"};
    places.unwritable = {directory_ / "extensions"};
    makeHost(true, std::make_unique<ExtensionConfinement>(std::move(places), policy, program));
  }

  /// What comes of it when the extension tries that on the path.
  static std::string tried(const Record &extension, const RequestIdentifier &request, const std::string &verb,
                           const std::string &path) {
    std::string what = verb + path;
    std::replace(what.begin(), what.end(), '/', '=');
    return textFor(extension, request, what);
  }

  /// Those lines of the log that say so, apart from what is told of every start.
  [[nodiscard]] std::vector<std::string> linesWith(const std::string &text) {
    std::vector<std::string> lines = platform_->log().texts();
    std::erase_if(lines, [&text](const std::string &line) { return line.find(text) == std::string::npos; });
    return lines;
  }
  [[nodiscard]] std::vector<std::string> refusals() { return linesWith("[ERROR] Not granting "); }

  static std::vector<pid_t> childrenOf(pid_t process) {
    const std::string number = std::to_string(process);
    std::ifstream file("/proc/" + number + "/task/" + number + "/children");
    std::vector<pid_t> children;
    for (pid_t child = 0; file >> child;) children.push_back(child);
    return children;
  }
  /// The extension itself, which runs below the first process of its sandbox.
  pid_t confinedProcess() {
    const std::vector<pid_t> first = childrenOf(startedProcess());
    const std::vector<pid_t> second = first.empty() ? first : childrenOf(first[0]);
    EXPECT_EQ(second.size(), 1U);
    return second.empty() ? 0 : second[0];
  }
};

TEST_F(ConfinedExtensionTest, SocketOutputAndDirectoryAreAsWithoutConfinement) {
  const Record extension = installedRecord(
      "answers", R"(, "KTGroupContainers": ["g"], "KTExtension": {"KTExtensionStorixDocumentGroup": "g"})");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(textFor(extension, request, "descriptors"), "0 /dev/null\n1 pipe\n2 pipe\n3 socket\n");
  EXPECT_EQ(textFor(extension, request, "directory"), directory_ / "extensions/answers.appdex");
  EXPECT_EQ(textFor(extension, request, "environment"),
            "HOME=/home/u\nPATH=/bin\nPWD=" + (directory_ / "extensions/answers.appdex") +
                "\nSTORIX_BUNDLE_PATH=" + (directory_ / "extensions/answers.appdex") +
                "\nSTORIX_EXTENSION_FD=3\nSTORIX_GROUP_CONTAINER=" + (directory_ / "groups/g") +
                "\nSTORIX_RUNTIME_DIR=/run/x\n");
  EXPECT_EQ(textFor(extension, request, "print"), "printed");
  EXPECT_TRUE(ask(extension, request, "exit").failure);
  EXPECT_THAT(platform_->log().texts(), Contains("[NOTICE] Extension org.answers: out one"));
  EXPECT_THAT(linesWith("unconfined"), IsEmpty());
}

TEST_F(ConfinedExtensionTest, NothingElseOfItsUserIsThere) {
  directory_.makeFile("home/secret", "s");
  directory_.makeFile("secret", "s");
  const Record extension = installedRecord("answers", R"(, "KTGroupContainers": ["g"])");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(tried(extension, request, "read", directory_ / "home/secret"), absent);
  EXPECT_EQ(tried(extension, request, "read", directory_ / "secret"), absent);
  EXPECT_EQ(tried(extension, request, "list", directory_.path()), "extensions\ngroups\nhome\n");
  EXPECT_EQ(tried(extension, request, "list", directory_ / "home"), "");
  EXPECT_EQ(tried(extension, request, "list", directory_ / "extensions"), "answers.appdex\n");
  for (const char *path : {"/root", "/home", "/run", "/var", "/sys", "/boot", "/opt", "/srv", "/etc/passwd",
                           "/etc/shadow", "/etc/resolv.conf"}) {
    EXPECT_EQ(tried(extension, request, "read", path), absent) << path;
  }
  EXPECT_EQ(tried(extension, request, "write", "/file"), readOnly);
  EXPECT_EQ(tried(extension, request, "write", "/usr/file"), readOnly);
  EXPECT_EQ(tried(extension, request, "write", "/tmp/file"), "done");
  EXPECT_FALSE(std::filesystem::exists("/tmp/file"));
}

TEST_F(ConfinedExtensionTest, BundleIsReadAndNotWritten) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  const std::string bundle = directory_ / "extensions/answers.appdex";
  EXPECT_EQ(tried(extension, request, "read", bundle + "/Info.kvs"), "done");
  EXPECT_EQ(tried(extension, request, "write", bundle + "/Info.kvs"), readOnly);
  EXPECT_EQ(tried(extension, request, "write", bundle + "/new"), readOnly);
}

TEST_F(ConfinedExtensionTest, OwnGroupContainersAreWrittenAndOthersAreNotThere) {
  directory_.makeFile("groups/other/document", "d");
  const Record extension = installedRecord("answers", R"(, "KTGroupContainers": ["g", "h"])");
  // Removed since the bundle was found.
  std::filesystem::remove(directory_ / "groups/h");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(tried(extension, request, "write", directory_ / "groups/g/new"), "done");
  EXPECT_EQ(tried(extension, request, "write", directory_ / "groups/h/new"), "done");
  EXPECT_TRUE(std::filesystem::exists(directory_ / "groups/g/new"));
  EXPECT_TRUE(std::filesystem::exists(directory_ / "groups/h/new"));
  EXPECT_EQ(tried(extension, request, "list", directory_ / "groups"), "g\nh\n");
  EXPECT_EQ(tried(extension, request, "read", directory_ / "groups/other/document"), absent);
}

TEST_F(ConfinedExtensionTest, SocketsOfTheDaemonAreNotThere) {
  const UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{AF_UNIX, {}};
  const std::string path = directory_ / "run/socket";
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(socket.get(), 1), 0);
  const Record extension = installedRecord("answers", R"(, "KTSandbox": {"network": true})");
  EXPECT_EQ(tried(extension, beginWell(extension), "connect", path), absent);
}

TEST_F(ConfinedExtensionTest, NetworkIsThereForWhoAsksForIt) {
  const UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  socklen_t length = sizeof address;
  ASSERT_EQ(::getsockname(socket.get(), reinterpret_cast<sockaddr *>(&address), &length), 0);
  ASSERT_EQ(::listen(socket.get(), 4), 0);
  const std::string port = "/" + std::to_string(ntohs(address.sin_port));
  {
    const Record without = installedRecord("answers");
    EXPECT_EQ(tried(without, beginWell(without), "dial", port), "Connection refused");
  }
  std::filesystem::remove_all(directory_ / "extensions");
  confine(ConfinementPolicy::preferred);
  const Record with = installedRecord("answers", R"(, "KTSandbox": {"network": true})");
  const RequestIdentifier request = beginWell(with);
  EXPECT_EQ(tried(with, request, "dial", port), "done");
  EXPECT_EQ(tried(with, request, "read", "/etc/resolv.conf"),
            std::filesystem::exists("/etc/resolv.conf") ? "done" : absent);
  EXPECT_EQ(tried(with, request, "read", "/etc/passwd"), absent);
}

TEST_F(ConfinedExtensionTest, PrivilegesAndNamespacesAreGivenUp) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(textFor(extension, request, "privileges"),
            "CapAmb:\t0000000000000000\nCapBnd:\t0000000000000000\nCapEff:\t0000000000000000\n"
            "CapInh:\t0000000000000000\nCapPrm:\t0000000000000000\nNoNewPrivs:\t1\n");
  const std::string theirs = textFor(extension, request, "namespaces");
  for (const char *kind : {"user", "mnt", "pid", "ipc", "uts", "net", "cgroup"}) {
    const std::string own = std::filesystem::read_symlink(std::string("/proc/self/ns/") + kind);
    EXPECT_THAT(theirs, HasSubstr(std::string(kind) + ":["));
    EXPECT_THAT(theirs, Not(HasSubstr(own)));
  }
}

TEST_F(ConfinedExtensionTest, GrantedPlacesAreThereAndNoOthers) {
  directory_.makeFile("home/music/a", "");
  directory_.makeFile("home/music/new/b", "");
  directory_.makeFile("home/other", "");
  const std::string file = directory_.makeFile("shared/file", "");
  directory_.makeFile("shared/other", "");
  const Record extension = installedRecord(
      "answers", R"(, "KTSandbox": {"readOnly": ["~/music", ")" + file + R"("], "readWrite": ["~/music/new"]})");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(tried(extension, request, "read", directory_ / "home/music/a"), "done");
  EXPECT_EQ(tried(extension, request, "write", directory_ / "home/music/a"), readOnly);
  EXPECT_EQ(tried(extension, request, "write", directory_ / "home/music/new/c"), "done");
  EXPECT_EQ(tried(extension, request, "list", directory_ / "home"), "music\n");
  EXPECT_EQ(tried(extension, request, "read", file), "done");
  EXPECT_EQ(tried(extension, request, "write", file), readOnly);
  EXPECT_EQ(tried(extension, request, "list", directory_ / "shared"), "file\n");
  EXPECT_THAT(refusals(), IsEmpty());
}

TEST_F(ConfinedExtensionTest, PlacesThatNobodyMayHaveAreRefusedWithALine) {
  directory_.makeFile("run/token-key", "");
  const std::string d = directory_.path();
  directory_.makeLink("link", "run");
  const Record extension = installedRecord(
      "answers", R"(, "KTSandbox": {"readOnly": ["/", "~/", "~/Library", "~/Library/Storix/x", ")" + d + "/run\", \"" +
                     d + "/run/token-key\", \"" + d + "/link/token-key\", \"" + d + "/groups/other\", \"" + d +
                     R"(/absent"], "readWrite": [")" + d + "/extensions\"]}");
  const RequestIdentifier request = beginWell(extension);
  const auto line = [](const std::string &wish, const std::string &reason) {
    return "[ERROR] Not granting " + wish + " to the extension org.answers: " + reason;
  };
  const std::string noRun = "No extension may see " + d + "/run.";
  const std::string noLibrary = "No extension may see " + d + "/home/Library/Storix.";
  EXPECT_THAT(
      refusals(),
      ElementsAre(line("/", noRun), line("~/", noLibrary), line("~/Library", noLibrary),
                  line("~/Library/Storix/x", noLibrary), line(d + "/run", noRun), line(d + "/run/token-key", noRun),
                  line(d + "/link/token-key", "It leads through a symbolic link. Name the place itself."),
                  line(d + "/groups/other", "An extension sees its own group containers alone."),
                  line(d + "/absent", "opening it: No such file or directory"),
                  line(d + "/extensions", "No extension may write " + d + "/extensions.")));
  EXPECT_EQ(tried(extension, request, "list", d), "extensions\nhome\n");
  EXPECT_EQ(tried(extension, request, "list", d + "/home"), "");
}

TEST_F(ConfinedExtensionTest, BundlesMayBeReadByWhoAsksForThem) {
  directory_.makeFile("extensions/other.txt", "");
  const Record extension =
      installedRecord("answers", R"(, "KTSandbox": {"readOnly": [")" + (directory_ / "extensions") + R"("]})");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(tried(extension, request, "read", directory_ / "extensions/other.txt"), "done");
  EXPECT_THAT(refusals(), IsEmpty());
}

TEST_F(ConfinedExtensionTest, LinkThatAnExtensionHasMadeWidensNothing) {
  directory_.makeDirectory("home/a");
  const std::string sandbox = R"(, "KTSandbox": {"readWrite": ["~/a"], "readOnly": ["~/a/b"]})";
  const Record extension = installedRecord("answers", sandbox);
  RequestIdentifier request = beginWell(extension);
  EXPECT_THAT(refusals(), ElementsAre(HasSubstr("Not granting ~/a/b ")));
  EXPECT_EQ(tried(extension, request, "link", directory_ / "home/a/b"), "done");
  EXPECT_TRUE(ask(extension, request, "exit").failure);
  request = beginWell(extension);
  EXPECT_THAT(refusals(), Contains(HasSubstr("It leads through a symbolic link.")));
  EXPECT_EQ(tried(extension, request, "read", directory_ / "home/a/b/shadow"), absent);
}

TEST_F(ConfinedExtensionTest, EndOfTheProcessIsToldAsWithoutConfinement) {
  const Record extension = installedRecord("answers");
  EXPECT_THAT(ask(extension, beginWell(extension), "exit").failure->message(), HasSubstr("exited with status 3."));
  EXPECT_THAT(ask(extension, beginWell(extension), "crash").failure->message(),
              HasSubstr("was killed by signal 9 (Killed)."));
}

TEST_F(ConfinedExtensionTest, ProcessThatEndsBeforeItsLoginFailsTheBegin) {
  EXPECT_TRUE(isCode(failureOf(installedRecord("exits-at-once")), HostErrorCode::extensionExited));
  std::filesystem::remove_all(directory_ / "extensions");
  confine(ConfinementPolicy::preferred);
  EXPECT_TRUE(isCode(failureOf(installedRecord("dies-at-once")), HostErrorCode::extensionKilled));
}

TEST_F(ConfinedExtensionTest, SocketThatIsClosedInsteadOfALoginIsSeenAtOnce) {
  Later<Begun> begun = beginLater(installedRecord("closes-at-once"));
  ASSERT_TRUE(time_.waitForTaskIn(1s));
  time_.advance(1s);
  EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::connectionClosed));
}

TEST_F(ConfinedExtensionTest, LoginThatTakesTooLongFailsTheBeginAndEndsTheProcess) {
  Later<Begun> begun = beginLater(installedRecord("never-logs-in"));
  // Bubblewrap that is killed while it makes the sandbox can leave the rest of it behind.
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  std::vector<pid_t> program;
  while (program.empty() && std::chrono::steady_clock::now() < deadline) {
    for (const pid_t inside : childrenOf(startedProcess())) program = childrenOf(inside);
    std::this_thread::yield();
  }
  ASSERT_EQ(program.size(), 1U);
  const Watched process(program[0]);
  time_.advance(10s);
  EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::loginTimedOut));
  ASSERT_TRUE(time_.waitForTaskIn(5s));
  time_.advance(5s);
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ConfinedExtensionTest, ProcessThatOutlivesItsConnectionIsEndedByTheSignals) {
  const Record extension = installedRecord("stays");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(confinedProcess());
  expectEndByTheFirstSignal(extension, request, process);
}

TEST_F(ConfinedExtensionTest, TerminationSignalReachesTheProgramItself) {
  const Record extension = installedRecord("cleans-up");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(startedProcess());
  expectEndByTheFirstSignal(extension, request, process);
  // Its output is read to the end after it was reaped.
  const auto deadline = std::chrono::steady_clock::now() + 60s;
  while (linesWith("cleaned up").empty() && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
  EXPECT_THAT(linesWith("cleaned up"), ElementsAre("[NOTICE] Extension org.cleans-up: cleaned up"));
}

TEST_F(ConfinedExtensionTest, ProcessThatIgnoresTheTerminationSignalIsKilled) {
  const Record extension = installedRecord("ignores-termination");
  const RequestIdentifier request = beginWell(extension);
  const Watched process(confinedProcess());
  expectEndByTheSecondSignal(extension, request, process);
}

TEST_F(ConfinedExtensionTest, WhatItHasStartedEndsWithIt) {
  const Record extension = installedRecord("answers");
  const RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(textFor(extension, request, "leave-a-child"), "left");
  const std::vector<pid_t> children = childrenOf(confinedProcess());
  ASSERT_EQ(children.size(), 1U);
  const Watched child(children[0]);
  EXPECT_TRUE(ask(extension, request, "exit").failure);
  EXPECT_TRUE(child.waitForExit());
}

TEST_F(ConfinedExtensionTest, EndOfTheHostEndsTheProcess) {
  const Record extension = installedRecord("ignores-termination");
  static_cast<void>(beginWell(extension));
  const Watched process(confinedProcess());
  host_.reset();
  EXPECT_FALSE(hasChildren());
  EXPECT_TRUE(process.waitForExit());
}

TEST_F(ConfinedExtensionTest, EndOfTheHostWhileASandboxIsMadeLeavesNothingBehind) {
  // Whatever is left behind comes to this process, so that it can be seen.
  ASSERT_EQ(::prctl(PR_SET_CHILD_SUBREAPER, 1), 0);
  install("never-logs-in");
  // The end comes at different moments after bubblewrap has made its first process, as it happens.
  for (int i = 0; i < 10; ++i) {
    platform_->log().take();
    Later<Begun> begun = beginLater(record());
    const pid_t process = startedProcess();
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    while (childrenOf(process).empty() && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    host_.reset();
    EXPECT_TRUE(isCode(begun.wait().error, HostErrorCode::hostEnding));
    pid_t reaped = 0;
    while ((reaped = ::waitpid(-1, nullptr, WNOHANG)) >= 0 && std::chrono::steady_clock::now() < deadline) {
      if (reaped == 0) std::this_thread::yield();
    }
    ASSERT_LT(reaped, 0) << "a process is left";
    confine(ConfinementPolicy::preferred);
  }
  ::prctl(PR_SET_CHILD_SUBREAPER, 0);
}

TEST_F(ConfinedExtensionTest, ProgramThatCannotBeRunFailsTheBeginWithItsReason) {
  const std::string bundle = install("answers");
  std::filesystem::remove(bundle + "/answers");
  const Record extension = record();
  std::optional<SXError> error = failureOf(extension);
  EXPECT_EQ(error->code(), ENOENT);
  EXPECT_EQ(error->message(), "The program " + bundle +
                                  "/answers of the extension org.answers could not be run: No such file or directory");
  directory_.makeFile("extensions/answers.appdex/answers", "text");
  EXPECT_EQ(failureOf(extension)->code(), EACCES);
}

TEST_F(ConfinedExtensionTest, ProgramOutsideOfItsBundleFailsTheBegin) {
  const std::string bundle = install("answers");
  std::filesystem::rename(bundle + "/answers", directory_ / "elsewhere");
  directory_.makeLink("extensions/answers.appdex/answers", directory_ / "elsewhere");
  const std::optional<SXError> error = failureOf(record());
  EXPECT_TRUE(isCode(error, HostErrorCode::noExecutable));
  EXPECT_EQ(error->message(), "The program " + bundle + "/answers is a link to " + (directory_ / "elsewhere") +
                                  ", which a confined extension does not see. Put the program itself into the bundle.");
}

// --- Where bubblewrap is not there, or does not work

TEST_F(ConfinedExtensionTest, WithoutBubblewrapExtensionsRunUnconfinedAndOneLineSaysSo) {
  directory_.makeFile("home/secret", "s");
  confine(ConfinementPolicy::preferred, "/nowhere/bwrap");
  const Record extension = installedRecord("answers");
  RequestIdentifier request = beginWell(extension);
  EXPECT_EQ(tried(extension, request, "read", directory_ / "home/secret"), "done");
  EXPECT_TRUE(ask(extension, request, "exit").failure);
  request = beginWell(extension);
  EXPECT_THAT(
      linesWith("unconfined"),
      ElementsAre("[NOTICE] Extensions run unconfined, with all that their user may do, since /nowhere/bwrap is "
                  "not there. Install bubblewrap (0.8.0 with --bind-fd, or 0.10 or later) and permit user "
                  "namespaces to confine them."));
}

TEST_F(ConfinedExtensionTest, BubblewrapThatDoesNotWorkIsToldWithItsWords) {
  const std::string broken =
      directory_.makeFile("broken", "#!/bin/sh\necho 'no permissions to create namespaces' >&2\nexit 1\n");
  std::filesystem::permissions(broken, std::filesystem::perms::owner_all);
  confine(ConfinementPolicy::preferred, broken);
  const Record extension = installedRecord("answers");
  static_cast<void>(beginWell(extension));
  EXPECT_THAT(
      linesWith("unconfined"),
      ElementsAre(HasSubstr("since " + broken + " does not work here (no permissions to create namespaces). Install")));
}

TEST_F(ConfinedExtensionTest, RequiredConfinementThatDoesNotWorkStartsNothing) {
  confine(ConfinementPolicy::required, "/nowhere/bwrap");
  const Record extension = installedRecord("answers");
  const std::string sentence =
      "Extensions are not started, since STORIX_CONFINEMENT is “required” and /nowhere/bwrap is not there. Install "
      "bubblewrap (0.8.0 with --bind-fd, or 0.10 or later) and permit user namespaces to confine them.";
  for (int i = 0; i < 2; ++i) {
    const std::optional<SXError> error = failureOf(extension);
    EXPECT_TRUE(isCode(error, HostErrorCode::cannotConfine));
    EXPECT_EQ(error->message(), sentence);
  }
  EXPECT_THAT(linesWith(sentence), ElementsAre("[ERROR] " + sentence));
  EXPECT_THAT(linesWith("Started process"), IsEmpty());
}

TEST_F(ConfinedExtensionTest, RequiredConfinementThatWorksConfines) {
  confine(ConfinementPolicy::required);
  const Record extension = installedRecord("answers");
  EXPECT_THAT(textFor(extension, beginWell(extension), "privileges"), HasSubstr("NoNewPrivs:\t1"));
}

TEST_F(ConfinedExtensionTest, ConfinementThatIsOffIsToldOnce) {
  confine(ConfinementPolicy::off);
  const Record extension = installedRecord("answers");
  EXPECT_THAT(textFor(extension, beginWell(extension), "privileges"), HasSubstr("NoNewPrivs:\t0"));
  EXPECT_THAT(linesWith("unconfined"),
              ElementsAre("[NOTICE] Extensions run unconfined, with all that their user may do, "
                          "since STORIX_CONFINEMENT is “off”. Unset it to confine them."));
}

}  // namespace
}  // namespace storix::linuxhost
