#include "storix/Client.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>

#include "sdk/src/TestDaemon.h"
#include "wire/PlatformInterfaces.h"

namespace storix {
namespace {

using sdk::TestDaemon;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

URL fileURL(const std::string &path) { return *URL::fileURLWithPath(path); }

class ClientTest : public ::testing::Test {
 protected:
  ClientOptions options(std::chrono::milliseconds timeout = std::chrono::seconds(60)) {
    return {daemon_.directory(), timeout};
  }
  std::shared_ptr<sdk::ScriptedDaemon> scripted() { return daemon_.daemon; }

  TestDaemon daemon_;
  const URL document_ = fileURL("/storage/a b/100% \xC3\xA9.txt");
};

TEST_F(ClientTest, WakeUpIsAnswered) {
  scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
  Client client(options());
  EXPECT_EQ(client.wakeUp(), std::nullopt);
  EXPECT_EQ(client.wakeUp(), std::nullopt);
}

TEST_F(ClientTest, ExtendSandboxGivesTheTokens) {
  std::vector<std::string> asked;
  scripted()->onExtendSandbox = [&](std::vector<std::string> arguments, const SXDaemon::SandboxReply &reply) {
    asked = std::move(arguments);
    reply(std::nullopt, Data{std::string("to\0ken", 6)}, fileURL("/storage/a b/.100%"), std::nullopt);
  };
  Client client(options());
  const auto granted = client.extendSandbox(document_, "org.sample.docs", "org.sample.reader");
  ASSERT_TRUE(granted.ok());
  EXPECT_THAT(asked, ElementsAre("file:///storage/a%20b/100%25%20%C3%A9.txt", "org.sample.docs", "org.sample.reader"));
  EXPECT_EQ(granted.value().url, document_);
  EXPECT_EQ(granted.value().token, Data{std::string("to\0ken", 6)});
  EXPECT_EQ(granted.value().companionURL, fileURL("/storage/a b/.100%"));
  EXPECT_EQ(granted.value().companionToken, std::nullopt);
}

TEST_F(ClientTest, TheDaemonsErrorsComeUnchanged) {
  const SXError refused = SXNotFoundError("org.sample.docs");
  scripted()->onExtendSandbox = [&](const auto &, const SXDaemon::SandboxReply &reply) {
    reply(refused, std::nullopt, std::nullopt, std::nullopt);
  };
  scripted()->onItemOperation = [&](const auto &, const auto &, const SXDaemon::ErrorReply &reply) { reply(refused); };
  scripted()->onProviders = [&](const SXDaemon::ProvidersReply &reply) { reply(refused, std::nullopt); };
  scripted()->onExtendBookmark = [&](const auto &, const SXDaemon::BookmarkReply &reply) {
    reply(std::nullopt, refused);
  };
  scripted()->onBookmarkableString = [&](const auto &, const SXDaemon::BookmarkReply &reply) {
    reply(std::nullopt, refused);
  };
  scripted()->onDocumentURL = [&](const auto &, const SXDaemon::DocumentReply &reply) {
    reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, refused);
  };
  Client client(options());
  EXPECT_EQ(client.extendSandbox(document_, "p", "c").error(), refused);
  EXPECT_EQ(client.providePlaceholder(document_, "p", "c"), refused);
  EXPECT_EQ(client.startProviding(document_, "p", "c"), refused);
  EXPECT_EQ(client.stopProviding(document_, "p", "c"), refused);
  EXPECT_EQ(client.providers().error(), refused);
  EXPECT_EQ(client.extendBookmark(document_, "c").error(), refused);
  EXPECT_EQ(client.bookmarkableString(document_).error(), refused);
  EXPECT_EQ(client.resolveBookmark("storix:p/i").error(), refused);
}

TEST_F(ClientTest, ItemOperationsNameDocumentProviderAndConsumer) {
  std::vector<std::string> operations;
  scripted()->onItemOperation = [&](const std::string &operation, const std::vector<std::string> &arguments,
                                    const SXDaemon::ErrorReply &reply) {
    operations.push_back(operation + " " + arguments.at(1) + " " + arguments.at(2));
    reply(operation == "stop" ? std::optional(SXPluginOperationFailedError(std::nullopt)) : std::nullopt);
  };
  Client client(options());
  EXPECT_EQ(client.providePlaceholder(document_, "p", "c"), std::nullopt);
  EXPECT_EQ(client.startProviding(document_, "p", "c"), std::nullopt);
  EXPECT_EQ(client.stopProviding(document_, "p", "c"), std::nullopt);
  EXPECT_THAT(operations, ElementsAre("placeholder p c", "start p c", "stop p c"));
}

TEST_F(ClientTest, StopFailsOnlyWithAnUnderlyingError) {
  const SXError failed = SXPluginOperationFailedError(SXError("org.sample", 7));
  std::optional<SXError> answer;
  scripted()->onItemOperation = [&](const auto &, const auto &, const SXDaemon::ErrorReply &reply) { reply(answer); };
  Client client(options());
  answer = failed;
  EXPECT_EQ(client.stopProviding(document_, "p", "c"), failed);
  answer = SXPluginOperationFailedError(std::nullopt);
  EXPECT_EQ(client.stopProviding(document_, "p", "c"), std::nullopt);
  answer = std::nullopt;
  EXPECT_EQ(client.stopProviding(document_, "p", "c"), std::nullopt);
  EXPECT_EQ(client.startProviding(document_, "p", "c"), std::nullopt);
  answer = SXPluginOperationFailedError(std::nullopt);
  EXPECT_EQ(client.startProviding(document_, "p", "c"), answer) << "only a stop request answers so";
}

TEST_F(ClientTest, ProvidersAreListedWithTheirDirectories) {
  scripted()->onProviders = [](const SXDaemon::ProvidersReply &reply) {
    Dictionary records;
    records.emplace("org.sample.docs", Dictionary{{"documentStorageURL", *URL::fileURLWithPath("/a", true)},
                                                  {"providerIdentifier", "org.sample.docs"}});
    records.emplace("org.sample.broken", Dictionary{});
    reply(std::nullopt, records);
  };
  Client client(options());
  const auto providers = client.providers();
  ASSERT_TRUE(providers.ok());
  ASSERT_EQ(providers.value().size(), 2U);
  EXPECT_EQ(providers.value()[0].identifier, "org.sample.broken");
  EXPECT_EQ(providers.value()[0].documentStorageURL, std::nullopt);
  EXPECT_EQ(providers.value()[1].identifier, "org.sample.docs");
  EXPECT_EQ(providers.value()[1].documentStorageURL, URL::fileURLWithPath("/a", true));
}

TEST_F(ClientTest, BookmarksAreMadeAndResolved) {
  scripted()->onBookmarkableString = [&](const std::string &url, const SXDaemon::BookmarkReply &reply) {
    if (url == document_.absoluteString()) return reply("storix:p/i", std::nullopt);
    reply(std::nullopt, std::nullopt);
  };
  scripted()->onDocumentURL = [&](const std::string &string, const SXDaemon::DocumentReply &reply) {
    if (string != "storix:p/i") return reply(std::nullopt, std::nullopt, std::nullopt, std::nullopt, std::nullopt);
    reply(document_, Data{"t"}, fileURL("/storage/.c"), Data{"ct"}, std::nullopt);
  };
  Client client(options());
  EXPECT_EQ(client.bookmarkableString(document_).value(), "storix:p/i");
  const auto nobodys = client.bookmarkableString(fileURL("/elsewhere"));
  ASSERT_TRUE(nobodys.ok());
  EXPECT_EQ(nobodys.value(), std::nullopt);
  const auto resolved = client.resolveBookmark("storix:p/i");
  ASSERT_TRUE(resolved.ok());
  EXPECT_EQ(resolved.value().url, document_);
  EXPECT_EQ(resolved.value().token, Data{"t"});
  EXPECT_EQ(resolved.value().companionToken, Data{"ct"});
  EXPECT_TRUE(isClientError(client.resolveBookmark("storix:p/without").error(), ClientErrorCode::incompleteAnswer));
}

TEST_F(ClientTest, SharingProvesWriteAccessFirst) {
  const std::string path = daemon_.directory() + "/document";
  std::ofstream(path) << "x";
  std::vector<std::string> order;
  daemon_.onProveWriteAccess = [&](const wire::MethodValues &values, const wire::BusConnection::Reply &reply) {
    struct stat shown {};
    struct stat expected {};
    const int descriptor = std::get<UniqueFd>(values.at(0)).get();
    EXPECT_EQ(::fstat(descriptor, &shown), 0);
    EXPECT_EQ(::stat(path.c_str(), &expected), 0);
    EXPECT_EQ(shown.st_ino, expected.st_ino);
    EXPECT_EQ(::fcntl(descriptor, F_GETFL) & O_ACCMODE, O_WRONLY);
    order.emplace_back("proof");
    reply.fail(wire::platformError::noProof, "whatever it was worth");
  };
  scripted()->onExtendBookmark = [&](const std::vector<std::string> &arguments, const SXDaemon::BookmarkReply &reply) {
    order.push_back("request for " + arguments.at(1));
    reply("storix:p/i", std::nullopt);
  };
  Client client(options());
  EXPECT_EQ(client.extendBookmark(fileURL(path), "c").value(), "storix:p/i");
  EXPECT_EQ(client.extendBookmark(fileURL(path + "-missing"), "d").value(), "storix:p/i");
  EXPECT_THAT(order, ElementsAre("proof", "request for c", "request for d"));
}

TEST_F(ClientTest, ATokenOpensADescriptor) {
  const std::string path = daemon_.directory() + "/document";
  std::ofstream(path) << "hello";
  std::string token;
  daemon_.onConsume = [&](const wire::MethodValues &values, const wire::BusConnection::Reply &reply) {
    token = std::get<Data>(values.at(0)).bytes;
    wire::MethodValues answer;
    answer.emplace_back(UniqueFd(::open(path.c_str(), O_RDWR | O_CLOEXEC)));
    reply.send(std::move(answer));
  };
  Client client(options());
  const GrantedDocument granted{document_, Data{"the token"}, std::nullopt, std::nullopt};
  const auto opened = client.openDocument(granted);
  ASSERT_TRUE(opened.ok());
  EXPECT_EQ(token, "the token");
  char buffer[8];
  EXPECT_EQ(::read(opened.value().get(), buffer, sizeof buffer), 5);
  EXPECT_NE(::fcntl(opened.value().get(), F_GETFD) & FD_CLOEXEC, 0);
  EXPECT_TRUE(isClientError(client.openCompanion(granted).error(), ClientErrorCode::incompleteAnswer));
}

TEST_F(ClientTest, ARefusedTokenSaysWhy) {
  daemon_.onConsume = [](const auto &, const wire::BusConnection::Reply &reply) {
    reply.fail(wire::platformError::invalidToken, "the token was changed");
  };
  Client client(options());
  const auto opened = client.open(Data{"x"});
  ASSERT_FALSE(opened.ok());
  EXPECT_TRUE(isClientError(opened.error(), ClientErrorCode::refused));
  EXPECT_EQ(opened.error().stringDetail("name"), std::string(wire::platformError::invalidToken));
  EXPECT_THAT(opened.error().message(), HasSubstr("the token was changed"));
}

TEST_F(ClientTest, NotificationsArePosted) {
  std::string name;
  daemon_.onPost = [&](const wire::MethodValues &values, const wire::BusConnection::Reply &reply) {
    name = std::get<std::string>(values.at(0));
    reply.send({});
  };
  Client client(options());
  EXPECT_EQ(client.postNotification("com.tessel.mobile.vaultkeepd.first_unlock"), std::nullopt);
  EXPECT_EQ(name, "com.tessel.mobile.vaultkeepd.first_unlock");
}

TEST_F(ClientTest, ProvingLeavesTheDescriptorToTheCaller) {
  daemon_.onProveWriteAccess = [](const auto &, const wire::BusConnection::Reply &reply) { reply.send({}); };
  Client client(options());
  const UniqueFd file(::open("/dev/null", O_WRONLY | O_CLOEXEC));
  EXPECT_EQ(client.proveWriteAccess(file.get()), std::nullopt);
  EXPECT_NE(::fcntl(file.get(), F_GETFD), -1);
  EXPECT_EQ(client.proveWriteAccess(-1)->code(), EBADF);
}

TEST_F(ClientTest, ARequestThatStaysUnansweredTimesOut) {
  Client client(options(std::chrono::milliseconds(20)));
  const auto resolved = client.resolveBookmark("storix:gone/i");
  ASSERT_FALSE(resolved.ok());
  EXPECT_TRUE(isClientError(resolved.error(), ClientErrorCode::timedOut));
}

TEST_F(ClientTest, AnAnswerAfterTheDeadlineIsNotHeard) {
  std::mutex mutex;
  std::vector<CompletionHandler<>> late;
  scripted()->onWakeUp = [&](CompletionHandler<> reply) {
    const std::lock_guard lock(mutex);
    late.push_back(std::move(reply));
  };
  scripted()->onProviders = [](const SXDaemon::ProvidersReply &reply) { reply(std::nullopt, Dictionary{}); };
  int heard = 0;
  {
    Client client(options(std::chrono::milliseconds(200)));
    std::promise<void> timedOut;
    client.wakeUp([&](const Client::Outcome &) {
      ++heard;
      timedOut.set_value();
    });
    timedOut.get_future().wait();
    {
      const std::lock_guard lock(mutex);
      for (const auto &reply : late) reply();
    }
    EXPECT_TRUE(client.providers().ok());
  }
  EXPECT_EQ(heard, 1);
}

TEST_F(ClientTest, LosingTheConnectionFailsWhatIsInFlightAndTheNextRequestConnectsAgain) {
  std::promise<void> arrived;
  scripted()->onProviders = [&](const SXDaemon::ProvidersReply &) { arrived.set_value(); };
  scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
  Client client(options());
  std::promise<SXError> failed;
  client.providers([&](const Result<std::vector<ProviderDescription>> &result) { failed.set_value(result.error()); });
  arrived.get_future().wait();
  daemon_.closeConnections();
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::connectionLost)) << error.message();
  EXPECT_EQ(client.wakeUp(), std::nullopt);
}

TEST_F(ClientTest, DestroyingTheClientAnswersWhatIsOpen) {
  std::promise<SXError> failed;
  {
    Client client(options());
    client.wakeUp([&](const Client::Outcome &outcome) { failed.set_value(*outcome); });
  }
  auto answered = failed.get_future();
  ASSERT_EQ(answered.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  EXPECT_TRUE(isClientError(answered.get(), ClientErrorCode::connectionLost));
}

TEST_F(ClientTest, AHandlerMayDestroyTheClient) {
  scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
  auto client = std::make_shared<Client>(options());
  std::promise<void> destroyed;
  Client &used = *client;
  used.wakeUp([&destroyed, client = std::move(client)](const Client::Outcome &) mutable {
    client.reset();
    destroyed.set_value();
  });
  destroyed.get_future().wait();
}

TEST_F(ClientTest, WaitingInAHandlerIsAnErrorAndNotADeadlock) {
  scripted()->onWakeUp = [](const CompletionHandler<> &reply) { reply(); };
  Client client(options());
  std::promise<Client::Outcome> inner;
  client.wakeUp([&](const Client::Outcome &) { inner.set_value(client.wakeUp()); });
  const auto outcome = inner.get_future().get();
  ASSERT_TRUE(outcome.has_value());
  EXPECT_EQ(outcome->domain(), posixErrorDomain);
  EXPECT_EQ(outcome->code(), EDEADLK);
}

TEST_F(ClientTest, RequestsOfSeveralThreadsAreAnsweredSideBySide) {
  scripted()->onBookmarkableString = [](const std::string &url, const SXDaemon::BookmarkReply &reply) {
    reply(url, std::nullopt);
  };
  Client client(options());
  std::vector<std::thread> threads;
  threads.reserve(4);
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&client, i] {
      for (int j = 0; j < 50; ++j) {
        const URL url = fileURL("/" + std::to_string(i) + "/" + std::to_string(j));
        EXPECT_EQ(client.bookmarkableString(url).value(), url.absoluteString());
      }
    });
  }
  for (auto &thread : threads) thread.join();
}

TEST_F(ClientTest, WhatTheWireRefusesIsToldWithItsName) {
  Client client(options());
  const auto resolved = client.resolveBookmark("storix:p/" + std::string(70'000, 'x'));
  ASSERT_FALSE(resolved.ok());
  EXPECT_TRUE(isClientError(resolved.error(), ClientErrorCode::refused)) << resolved.error().message();
  EXPECT_EQ(resolved.error().stringDetail("name"), "org.freedesktop.DBus.Error.LimitsExceeded");
}

TEST(ClientWithoutDaemon, SaysThatNobodyListens) {
  std::string directory = (std::filesystem::temp_directory_path() / "storix-sdk-XXXXXX").string();
  ASSERT_NE(::mkdtemp(directory.data()), nullptr);
  Client client({directory, std::chrono::seconds(60)});
  const auto outcome = client.wakeUp();
  ASSERT_TRUE(outcome.has_value());
  EXPECT_TRUE(isClientError(*outcome, ClientErrorCode::notReachable));
  EXPECT_THAT(outcome->message(), HasSubstr("not running"));
  EXPECT_THAT(outcome->message(), HasSubstr(directory + "/com.tessel.Storix"));
  EXPECT_TRUE(isClientError(client.open(Data{"x"}).error(), ClientErrorCode::notReachable));
  std::filesystem::remove_all(directory);
}

TEST(ClientWithoutDaemon, APathThatIsTooLongForASocketIsToldSo) {
  Client client({"/tmp/" + std::string(200, 'x'), std::chrono::seconds(60)});
  EXPECT_THAT(client.wakeUp()->message(), HasSubstr("too long"));
}

TEST(ClientWithoutDaemon, APeerThatNeverLogsInTimesOut) {
  std::string directory = (std::filesystem::temp_directory_path() / "storix-sdk-XXXXXX").string();
  ASSERT_NE(::mkdtemp(directory.data()), nullptr);
  const UniqueFd silent(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  (directory + "/com.tessel.Storix").copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(silent.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(silent.get(), 1), 0);
  {
    Client client({directory, std::chrono::milliseconds(50)});
    EXPECT_TRUE(isClientError(*client.wakeUp(), ClientErrorCode::timedOut));
  }
  std::filesystem::remove_all(directory);
}

}  // namespace
}  // namespace storix
