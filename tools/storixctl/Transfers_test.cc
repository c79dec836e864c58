#include "tools/storixctl/Transfers.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <array>
#include <csignal>
#include <future>
#include <mutex>
#include <thread>

#include "tools/storixctl/CommandsTest.h"
#include "tools/storixctl/Json.h"
#include "tools/storixctl/TemporaryDirectory.h"
#include "tools/storixctl/Terminal.h"
#include "wire/PlatformInterfaces.h"

namespace storix::ctl {
namespace {

namespace fs = std::filesystem;
using Reply = wire::BusConnection::Reply;
using ::testing::ElementsAre;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;
using ::testing::UnorderedElementsAre;
using wire::MethodValues;

/// Claims are given at once unless the test says otherwise, and noted; tokens are paths.
class TransfersTest : public CommandsTest {
 protected:
  TransfersTest() {
    (void)::signal(SIGPIPE, SIG_IGN);
    surroundings_.currentDirectory = directory_.path().string();
    daemon_->onBeginRead = beginning("read");
    daemon_->onBeginWrite = beginning("write");
    daemon_->onEndRead = ending("end of read");
    daemon_->onEndWrite = ending("end of write");
    daemon_->onConsume = [](const MethodValues &values, const Reply &reply) {
      UniqueFd file(::open(std::get<Data>(values.at(0)).bytes.c_str(), O_RDWR | O_CLOEXEC));
      if (!file) return reply.fail(wire::platformError::unavailable, "it is not there");
      MethodValues answer;
      answer.emplace_back(std::move(file));
      reply.send(std::move(answer));
    };
    scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
    scripted()->onDocumentURL = [this](const std::string &, const SXDaemon::DocumentReply &reply) {
      reply(URL::fileURLWithPath(path("a")), Data{path("a")}, std::nullopt, std::nullopt, std::nullopt);
    };
  }

  [[nodiscard]] std::string path(const std::string &name) const { return (directory_ / name).string(); }
  [[nodiscard]] std::string urlOf(const std::string &name) const {
    return URL::fileURLWithPath(path(name))->absoluteString();
  }

  static void give(const Reply &reply) {
    MethodValues values;
    values.emplace_back(std::optional<SXError>());
    values.emplace_back(std::optional<std::uint64_t>(7));
    reply.send(std::move(values));
  }
  static void refuse(const Reply &reply, SXError error) {
    MethodValues values;
    values.emplace_back(std::optional<SXError>(std::move(error)));
    values.emplace_back(std::optional<std::uint64_t>());
    reply.send(std::move(values));
  }

  void note(const std::string &event) {
    const std::lock_guard lock(mutex_);
    events_.push_back(event);
  }
  [[nodiscard]] std::vector<std::string> events() {
    const std::lock_guard lock(mutex_);
    return events_;
  }

  /// Runs a verb whose content goes to a file, and gives that; or comes from one that holds `input`.
  std::string contentOf(const std::vector<std::string> &arguments, ExitStatus expected = done) {
    const UniqueFd out(::open(path("printed").c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    surroundings_.contentOutput = out.get();
    EXPECT_EQ(run(arguments), expected) << complaint();
    fs::remove(directory_ / "printed");
    std::string content(4096, '\0');
    content.resize(static_cast<std::size_t>(::pread(out.get(), content.data(), content.size(), 0)));
    return content;
  }
  ExitStatus writeFrom(const std::string &input, const std::vector<std::string> &arguments,
                       std::chrono::milliseconds timeout = std::chrono::seconds(60)) {
    directory_.write("input", input);
    const UniqueFd in(::open(path("input").c_str(), O_RDONLY | O_CLOEXEC));
    fs::remove(directory_ / "input");
    surroundings_.contentInput = in.get();
    return run(arguments, timeout);
  }

  wire::BusConnection::MethodHandler beginning(const std::string &kind) {
    return [this, kind](const MethodValues &values, const Reply &reply) {
      note(kind + " " + std::get<std::string>(values.at(0)));
      give(reply);
    };
  }
  wire::BusConnection::MethodHandler ending(const std::string &kind) {
    return [this, kind](const MethodValues &, const Reply &reply) {
      note(kind + " of " + directory_.read("a"));
      reply.send({});
    };
  }

  TemporaryDirectory directory_;

 private:
  std::mutex mutex_;
  std::vector<std::string> events_;
};

TEST_F(TransfersTest, OpenPrintsTheContentOrWritesItToAFile) {
  const std::string content("hello\0world\n", 12);
  directory_.write("a", content);
  const std::string token = base64(Data{path("a")});
  EXPECT_EQ(contentOf({"open", token}), content);
  EXPECT_EQ(run({"open", token, "--json", "-o", path("copy")}), done);
  EXPECT_THAT(printed(), HasSubstr("\"size\": 12"));
  EXPECT_EQ(directory_.read("copy"), content);
  EXPECT_EQ(run({"open", token, "-o", "/nowhere/copy"}), requestFailed);
  EXPECT_EQ(run({"open", "no token"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("base64"));
  EXPECT_THAT(events(), IsEmpty());
}

TEST_F(TransfersTest, OpenSaysWhyATokenIsRefused) {
  daemon_->onConsume = [](const auto &, const Reply &reply) {
    reply.fail(wire::platformError::invalidToken, "it was changed");
  };
  EXPECT_EQ(run({"open", "dG9rZW4="}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("it was changed"));
}

TEST_F(TransfersTest, ReadClaimsTheDocumentAndPrintsIt) {
  daemon_->onBeginRead = [this](const MethodValues &values, const Reply &reply) {
    note("read " + std::get<std::string>(values.at(0)));
    directory_.write("a", "provided");
    give(reply);
  };
  EXPECT_EQ(contentOf({"read", "a"}), "provided");
  EXPECT_EQ(contentOf({"read", urlOf("a")}), "provided");
  EXPECT_THAT(events(), testing::Contains("read " + urlOf("a")).Times(2));
  EXPECT_THAT(complaint(), IsEmpty());
}

TEST_F(TransfersTest, CatResolvesClaimsAndOpensWithTheToken) {
  daemon_->onBeginRead = [this](const MethodValues &values, const Reply &reply) {
    note("read " + std::get<std::string>(values.at(0)));
    directory_.write("token's", "provided");
    give(reply);
  };
  scripted()->onDocumentURL = [this](const std::string &string, const SXDaemon::DocumentReply &reply) {
    note("resolve " + string);
    reply(URL::fileURLWithPath("/beyond/our/sandbox"), Data{path("token's")}, std::nullopt, std::nullopt, std::nullopt);
  };
  EXPECT_EQ(contentOf({"cat", "storix:p/a"}), "provided");
  const auto seen = events();
  ASSERT_GE(seen.size(), 2U);
  EXPECT_EQ(seen[0], "resolve storix:p/a");
  EXPECT_EQ(seen[1], "read file:///beyond/our/sandbox");
}

TEST_F(TransfersTest, AnOutputFileIsReplacedAtTheEndAlone) {
  directory_.write("a", "new");
  directory_.write("copy", "old");
  EXPECT_EQ(run({"read", "a", "--output", path("copy"), "--json"}), done);
  EXPECT_EQ(printed(), "{\n  \"output\": \"" + path("copy") + "\",\n  \"size\": 3\n}\n");
  EXPECT_EQ(directory_.read("copy"), "new");
  EXPECT_EQ(run({"read", "missing", "--output", path("copy")}), requestFailed);
  EXPECT_EQ(directory_.read("copy"), "new");
  EXPECT_THAT(directory_.names(), UnorderedElementsAre("a", "copy"));
}

TEST_F(TransfersTest, AnOutputThatIsAPipeOrADeviceIsWrittenInto) {
  directory_.write("a", "new");
  EXPECT_EQ(run({"read", "a", "-o", "/dev/null"}), done);
  ASSERT_EQ(::mkfifo(path("pipe").c_str(), 0600), 0);
  EXPECT_EQ(run({"read", "a", "-o", path("pipe")}), requestFailed) << "nobody reads it";
  const UniqueFd reader(::open(path("pipe").c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  EXPECT_EQ(run({"read", "a", "-o", path("pipe")}), done);
  std::array<char, 8> bytes{};
  EXPECT_EQ(::read(reader.get(), bytes.data(), bytes.size()), 3);
}

TEST_F(TransfersTest, WhatIsNoDocumentIsNotRead) {
  fs::create_directory(directory_ / "d");
  ASSERT_EQ(::mkfifo(path("pipe").c_str(), 0600), 0);
  EXPECT_EQ(run({"read", "d"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("Is a directory"));
  EXPECT_EQ(run({"read", "pipe"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("not a regular file"));
  EXPECT_EQ(run({"read", "storix:p/a"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("\"cat\" prints what it names"));
}

TEST_F(TransfersTest, TheProvidersErrorIsPrinted) {
  daemon_->onBeginRead = [](const auto &, const Reply &reply) {
    refuse(reply, SXPluginOperationFailedError(SXError("org.sample", 7, {{"description", "no network"}})));
  };
  EXPECT_EQ(run({"read", "a"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("no network"));
  EXPECT_EQ(run({"cat", "storix:p/a", "--json", "-o", path("copy")}), requestFailed);
  EXPECT_THAT(printed(), HasSubstr("\"domain\": \"org.sample\""));
  EXPECT_THAT(directory_.names(), IsEmpty());
}

TEST_F(TransfersTest, ADeadlineThatPassesSaysWhatToDo) {
  const auto never = [](const auto &, const Reply &) {};
  daemon_->onBeginRead = never;
  daemon_->onBeginWrite = never;
  directory_.write("a", "old");
  EXPECT_EQ(run({"read", "a"}, std::chrono::milliseconds(20)), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("Its provider has not put it in place"));
  EXPECT_EQ(writeFrom("new", {"write", "a"}, std::chrono::milliseconds(20)), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("Nothing was written"));
  EXPECT_EQ(directory_.read("a"), "old");
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
}

TEST_F(TransfersTest, ABookmarkThatIsNotResolvedSaysWhatToDo) {
  scripted()->onDocumentURL = [](const std::string &bookmark, const SXDaemon::DocumentReply &reply) {
    if (bookmark.ends_with("/unanswered")) return;
    reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, SXNotPermittedError());
  };
  EXPECT_EQ(run({"cat", "storix:org.sample.docs/unanswered"}, std::chrono::milliseconds(20)), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("\"storixctl providers\" must list “org.sample.docs”"));
  for (const char *verb : {"cat", "write", "resolve"}) {
    EXPECT_EQ(writeFrom("x", {verb, "storix:org.sample.docs/a/b"}), requestFailed);
    EXPECT_THAT(complaint(), HasSubstr("\"storixctl extend DOCUMENT org.sample.docs CONSUMER\""));
  }
  EXPECT_THAT(events(), IsEmpty());
}

TEST_F(TransfersTest, WriteReplacesTheDocumentUnderAClaim) {
  directory_.write("a", "old");
  fs::permissions(directory_ / "a", fs::perms(0640));
  EXPECT_EQ(writeFrom("new", {"write", "a", "--json"}), done) << complaint();
  EXPECT_EQ(printed(), "{\n  \"URL\": \"" + urlOf("a") + "\",\n  \"size\": 3\n}\n");
  EXPECT_EQ(directory_.read("a"), "new");
  EXPECT_EQ(fs::status(directory_ / "a").permissions(), fs::perms(0640));
  EXPECT_THAT(events(), ElementsAre("write " + urlOf("a"), "end of write of new"));
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
}

TEST_F(TransfersTest, WriteTakesABookmarkableStringAndAFile) {
  directory_.write("a", "old");
  directory_.write("source", "from a file");
  EXPECT_EQ(run({"write", "storix:p/a", "--input", path("source")}), done) << complaint();
  EXPECT_EQ(directory_.read("a"), "from a file");
  EXPECT_EQ(run({"write", "a", "--input", path("nowhere")}), requestFailed);
  EXPECT_EQ(run({"write", "a", "-i", path("")}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("Is a directory"));
  EXPECT_EQ(directory_.read("a"), "from a file");
}

TEST_F(TransfersTest, ADocumentBeyondTheSandboxIsWrittenThroughItsToken) {
  scripted()->onDocumentURL = [this](const auto &, const SXDaemon::DocumentReply &reply) {
    reply(URL::fileURLWithPath("/beyond/our/sandbox"), Data{path("a")}, std::nullopt, std::nullopt, std::nullopt);
  };
  daemon_->onBeginRead = [this](const MethodValues &values, const Reply &reply) {
    note("read " + std::get<std::string>(values.at(0)));
    if (!fs::exists(directory_ / "a")) directory_.write("a", "much older content");
    give(reply);
  };
  EXPECT_EQ(writeFrom("new", {"write", "storix:p/a", "--json"}), done) << complaint();
  EXPECT_EQ(directory_.read("a"), "new");
  EXPECT_THAT(printed(), HasSubstr("\"size\": 3"));
  EXPECT_THAT(events(), testing::IsSupersetOf({"read file:///beyond/our/sandbox", "write file:///beyond/our/sandbox",
                                               "end of write of new"}));
  EXPECT_EQ(writeFrom("", {"write", "storix:p/a"}), done) << complaint();
  EXPECT_EQ(directory_.read("a"), "");
  EXPECT_EQ(writeFrom("longer than before", {"write", "storix:p/a"}), done) << complaint();
  EXPECT_EQ(directory_.read("a"), "longer than before");
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
}

TEST_F(TransfersTest, BeyondTheSandboxTooInputThatFailsCostsNothing) {
  scripted()->onDocumentURL = [this](const auto &, const SXDaemon::DocumentReply &reply) {
    reply(URL::fileURLWithPath("/beyond/our/sandbox"), Data{path("a")}, std::nullopt, std::nullopt, std::nullopt);
  };
  directory_.write("a", "old");
  const UniqueFd notReadable(::open(path("a").c_str(), O_WRONLY | O_CLOEXEC));
  surroundings_.contentInput = notReadable.get();
  EXPECT_EQ(run({"write", "storix:p/a"}), requestFailed);
  EXPECT_EQ(directory_.read("a"), "old");
  EXPECT_THAT(events(), IsEmpty());
  scripted()->onDocumentURL = [](const auto &, const SXDaemon::DocumentReply &reply) {
    reply(URL::fileURLWithPath("/beyond/our/sandbox"), std::nullopt, std::nullopt, std::nullopt, std::nullopt);
  };
  EXPECT_EQ(writeFrom("new", {"write", "storix:p/a"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("opening the directory /beyond/our"));
}

TEST_F(TransfersTest, InputThatFailsCostsNothing) {
  directory_.write("a", "old");
  const UniqueFd notReadable(::open(path("a").c_str(), O_WRONLY | O_CLOEXEC));
  surroundings_.contentInput = notReadable.get();
  EXPECT_EQ(run({"write", "a"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("reading standard input"));
  EXPECT_EQ(directory_.read("a"), "old");
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
  EXPECT_THAT(events(), IsEmpty()) << "nobody had to wait for it";
}

TEST_F(TransfersTest, WhereNothingCanBeWrittenIsSaidBeforeInputIsTaken) {
  surroundings_.contentInput = -1;
  fs::create_directory(directory_ / "d");
  EXPECT_EQ(run({"write", "d"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("Is a directory"));
  EXPECT_EQ(run({"write", "missing/a"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("opening the directory"));
  EXPECT_THAT(events(), IsEmpty());
}

TEST_F(TransfersTest, ADaemonThatGoesBeforeTheProviderIsToldIsSaid) {
  directory_.write("a", "old");
  std::promise<void> ending;
  daemon_->onEndWrite = [&ending](const auto &, const Reply &) { ending.set_value(); };
  std::jthread closing([this, asked = ending.get_future()] {
    EXPECT_EQ(asked.wait_for(std::chrono::seconds(60)), std::future_status::ready);
    daemon_->closeConnections();
  });
  EXPECT_EQ(writeFrom("new", {"write", "a"}), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("may not have heard of it"));
  EXPECT_EQ(directory_.read("a"), "new");
}

TEST_F(TransfersTest, AnInterruptionEndsAReadThatWaits) {
  daemon_->onBeginRead = [this](const auto &, const Reply &) { waiting_.interrupt(); };
  EXPECT_EQ(run({"read", "a", "-o", path("copy")}), 128 + SIGINT);
  EXPECT_THAT(complaint(), IsEmpty());
  EXPECT_THAT(directory_.names(), IsEmpty());
}

TEST_F(TransfersTest, AnInterruptionEndsAWriteThatWaitsAndKeepsTheOldContent) {
  directory_.write("a", "old");
  daemon_->onBeginWrite = [this](const auto &, const Reply &) { waiting_.interrupt(); };
  EXPECT_EQ(writeFrom("new", {"write", "a"}), 128 + SIGINT);
  EXPECT_EQ(directory_.read("a"), "old");
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
}

TEST_F(TransfersTest, AReaderThatHasGoneIsNothingToSpeakOf) {
  directory_.write("a", std::string(100'000, 'x'));
  std::array<int, 2> ends{-1, -1};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  ::close(ends[0]);
  const UniqueFd closed(ends[1]);
  surroundings_.contentOutput = closed.get();
  EXPECT_EQ(run({"read", "a"}), readerGone);
  EXPECT_THAT(complaint(), IsEmpty());
}

TEST_F(TransfersTest, WaitingForTheProviderIsShownOnATerminal) {
  Terminal terminal;
  surroundings_.terminal = terminal.descriptor();
  std::promise<Reply> reading;
  daemon_->onBeginRead = [&reading](const auto &, const Reply &reply) { reading.set_value(reply); };
  directory_.write(".a", R"({"size": 2000000})");
  std::jthread provider([&] {
    terminal.waitFor("a: waiting, 2.0 MB, 0:0");
    directory_.write(".a.new", R"({"size": 2000000, "received": 500000})");
    fs::rename(directory_ / ".a.new", directory_ / ".a");
    terminal.waitFor("a: downloading, 500.0 kB of 2.0 MB (25 %), ");
    directory_.write("a", "here");
    give(reading.get_future().get());
  });
  EXPECT_EQ(contentOf({"read", "a"}), "here");
  provider.join();
  EXPECT_THAT(terminal.shown(), StartsWith("\r\033[Ka: waiting"));
  EXPECT_THAT(terminal.shown(), EndsWith("\r\033[K"));
}

TEST_F(TransfersTest, NothingIsShownOfWhatIsQuick) {
  Terminal terminal;
  waiting_.standStill();
  surroundings_.terminal = terminal.descriptor();
  directory_.write("a", "here");
  EXPECT_EQ(contentOf({"read", "a"}), "here");
  EXPECT_EQ(writeFrom("new", {"write", "a"}), done);
  EXPECT_THAT(terminal.shown(), IsEmpty());
}

TEST_F(TransfersTest, WhoWaitsForAnAnswerSeesIt) {
  Terminal terminal;
  surroundings_.terminal = terminal.descriptor();
  scripted()->onDocumentURL = [&](const auto &, const SXDaemon::DocumentReply &reply) {
    terminal.waitFor("b: waiting, 0:0");
    reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, SXNotPermittedError());
  };
  EXPECT_EQ(run({"cat", "storix:p/a/b"}), requestFailed);
  EXPECT_THAT(terminal.shown(), EndsWith("\r\033[K"));
}

/// A pipe whose writing takes time, as the progress of copying sees it.
TEST_F(TransfersTest, CopyingIsShownUnlessTheContentGoesToTheTerminal) {
  directory_.write("a", std::string(5'000'000, 'x'));
  std::array<int, 2> ends{-1, -1};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const UniqueFd in(ends[0]);
  UniqueFd out(ends[1]);
  surroundings_.contentOutput = out.get();
  std::size_t arrived = 0;
  std::jthread reader([&] {
    std::array<char, 4096> buffer{};
    for (ssize_t count = 0; (count = ::read(in.get(), buffer.data(), buffer.size())) > 0;) {
      arrived += static_cast<std::size_t>(count);
    }
  });
  Terminal terminal;
  surroundings_.terminal = terminal.descriptor();
  waiting_.setStep(std::chrono::seconds(1));
  EXPECT_EQ(run({"read", "a"}), done);
  out.reset();
  reader.join();
  EXPECT_EQ(arrived, 5'000'000U);
  EXPECT_THAT(terminal.shown(), HasSubstr("a: copying, "));
  EXPECT_THAT(terminal.shown(), HasSubstr(" of 5.0 MB ("));
  EXPECT_THAT(terminal.shown(), EndsWith("\r\033[K"));

  Terminal both;
  surroundings_.terminal = both.descriptor();
  surroundings_.contentOutput = both.descriptor();
  directory_.write("a", "short");
  EXPECT_EQ(run({"read", "a"}), done);
  EXPECT_THAT(both.shown(), EndsWith("short"));
  EXPECT_THAT(both.shown(), Not(HasSubstr("copying")));
}

}  // namespace
}  // namespace storix::ctl
