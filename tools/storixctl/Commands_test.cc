#include "tools/storixctl/Commands.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tools/storixctl/CommandsTest.h"

namespace storix::ctl {
namespace {

using ::testing::HasSubstr;
using ::testing::IsEmpty;

TEST_F(CommandsTest, WakePrintsNothing) {
  scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
  EXPECT_EQ(run({"wake"}), done);
  EXPECT_THAT(printed(), IsEmpty());
  EXPECT_THAT(complaint(), IsEmpty());
  EXPECT_EQ(run({"wake", "--json"}), done);
  EXPECT_EQ(printed(), "{\n  \"done\": true\n}\n");
}

TEST_F(CommandsTest, ProvidersAreOneLineEach) {
  scripted()->onProviders = [](const SXDaemon::ProvidersReply &reply) {
    Dictionary records;
    records.emplace("org.sample.broken", Dictionary{});
    records.emplace("org.sample.docs", Dictionary{{"documentStorageURL", *URL::fileURLWithPath("/a b\033[2J", true)}});
    reply(std::nullopt, records);
  };
  EXPECT_EQ(run({"providers"}), done);
  EXPECT_EQ(printed(), "org.sample.broken\t\norg.sample.docs\t/a b?[2J\n");
  surroundings_.outputIsTerminal = true;
  EXPECT_EQ(run({"providers"}), done);
  EXPECT_EQ(printed(), "PROVIDER           DOCUMENTS\norg.sample.broken\norg.sample.docs    /a b?[2J\n");
  EXPECT_EQ(run({"providers", "--json"}), done);
  EXPECT_THAT(printed(), HasSubstr("\"documentStorageURL\": \"file:///a%20b%1B%5B2J/\""));
}

TEST_F(CommandsTest, ExtendTakesPathsAndPrintsTokens) {
  std::vector<std::string> asked;
  scripted()->onExtendSandbox = [&](std::vector<std::string> arguments, const SXDaemon::SandboxReply &reply) {
    asked = std::move(arguments);
    reply(std::nullopt, Data{"token"}, *URL::fileURLWithPath("/storage/.a b"), std::nullopt);
  };
  EXPECT_EQ(run({"extend", "a b", "p", "c"}), done);
  EXPECT_THAT(asked, ::testing::ElementsAre("file:///storage/a%20b", "p", "c"));
  EXPECT_EQ(printed(),
            "URL              file:///storage/a%20b\n"
            "token            dG9rZW4=\n"
            "companion URL    file:///storage/.a%20b\n");
  EXPECT_EQ(run({"extend", "--json", "file:///storage/a%20b", "p", "c"}), done);
  EXPECT_THAT(printed(), HasSubstr("\"token\": \"dG9rZW4=\""));
  EXPECT_THAT(printed(), ::testing::Not(HasSubstr("companionToken")));
}

TEST_F(CommandsTest, ItemVerbsAskForTheirOperation) {
  std::vector<std::string> operations;
  scripted()->onItemOperation = [&](const std::string &operation, const auto &, const SXDaemon::ErrorReply &reply) {
    operations.push_back(operation);
    reply(operation == "stop" ? std::optional(SXPluginOperationFailedError(std::nullopt)) : std::nullopt);
  };
  for (const char *verb : {"placeholder", "start", "stop"}) {
    EXPECT_EQ(run({verb, "/storage/a", "p", "c"}), done) << verb;
    EXPECT_THAT(complaint(), IsEmpty());
  }
  EXPECT_THAT(operations, ::testing::ElementsAre("placeholder", "start", "stop"));
}

TEST_F(CommandsTest, AFailedRequestIsStatusOneAndSaysWhy) {
  scripted()->onItemOperation = [](const auto &, const auto &, const SXDaemon::ErrorReply &reply) {
    reply(SXPluginOperationFailedError(SXError("org.sample", 7, {{"description", "no such\033 document"}})));
  };
  EXPECT_EQ(run({"start", "/storage/a", "p", "c"}), requestFailed);
  EXPECT_THAT(printed(), IsEmpty());
  EXPECT_THAT(complaint(), ::testing::StartsWith("storixctl: start: "));
  EXPECT_THAT(complaint(), HasSubstr("no such? document"));
  EXPECT_EQ(run({"start", "/storage/a", "p", "c", "--json"}), requestFailed);
  EXPECT_THAT(printed(), HasSubstr("\"domain\": \"com.tessel.storix\""));
  EXPECT_THAT(printed(), HasSubstr("\"domain\": \"org.sample\""));
}

TEST_F(CommandsTest, NoAnswerInTimeIsStatusThree) {
  EXPECT_EQ(run({"resolve", "storix:p/i"}, std::chrono::milliseconds(20)), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("did not answer in time"));
}

TEST_F(CommandsTest, NoDaemonIsStatusThree) {
  surroundings_.clientOptions.runtimeDirectory = daemon_->directory() + "/nowhere";
  EXPECT_EQ(run({"wake", "--json"}), daemonNotReachable);
  EXPECT_THAT(complaint(), HasSubstr("not running"));
  EXPECT_THAT(complaint(), HasSubstr("Start storixd"));
  EXPECT_THAT(printed(), HasSubstr("\"domain\": \"com.tessel.storix.client\""));
}

TEST_F(CommandsTest, BookmarksAreSharedAndResolved) {
  scripted()->onExtendBookmark = [](const std::vector<std::string> &arguments, const SXDaemon::BookmarkReply &reply) {
    reply("storix:p/" + arguments.at(1), std::nullopt);
  };
  scripted()->onBookmarkableString = [](const std::string &url, const SXDaemon::BookmarkReply &reply) {
    if (url == "file:///storage/a") return reply("storix:p/a", std::nullopt);
    reply(std::nullopt, std::nullopt);
  };
  scripted()->onDocumentURL = [](const std::string &, const SXDaemon::DocumentReply &reply) {
    reply(URL::fileURLWithPath("/storage/a"), Data{"token"}, std::nullopt, std::nullopt, std::nullopt);
  };
  EXPECT_EQ(run({"share", "a", "c"}), done);
  EXPECT_EQ(printed(), "storix:p/c\n");
  EXPECT_EQ(run({"bookmark", "--json", "a"}), done);
  EXPECT_EQ(printed(), "{\n  \"bookmarkableString\": \"storix:p/a\"\n}\n");
  EXPECT_EQ(run({"bookmark", "/elsewhere"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("file:///elsewhere"));
  EXPECT_EQ(run({"resolve", "storix:p/a"}), done);
  EXPECT_EQ(printed(), "URL              file:///storage/a\ntoken            dG9rZW4=\n");
}

TEST_F(CommandsTest, NotifyPostsTheName) {
  std::string name;
  daemon_->onPost = [&](const wire::MethodValues &values, const wire::BusConnection::Reply &reply) {
    name = std::get<std::string>(values.at(0));
    reply.send({});
  };
  EXPECT_EQ(run({"notify", "com.tessel.mobile.vaultkeepd.first_unlock"}), done);
  EXPECT_EQ(name, "com.tessel.mobile.vaultkeepd.first_unlock");
}

TEST_F(CommandsTest, AResultThatCannotBeWrittenIsAFailure) {
  scripted()->onProviders = [](const SXDaemon::ProvidersReply &reply) { reply(std::nullopt, Dictionary{}); };
  out_.setstate(std::ios::badbit);
  EXPECT_EQ(run({"providers"}), requestFailed);
  EXPECT_THAT(complaint(), HasSubstr("could not be written"));
}

}  // namespace
}  // namespace storix::ctl
