#include "storix/ProviderExtension.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <stdexcept>
#include <stop_token>
#include <thread>

#include "providers/_KTStorixVendor.h"
#include "sdk/src/BusLoop.h"

namespace storix {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;

/// Does as the test says.
class ScriptedExtension : public ProviderExtension {
 public:
  using ProviderExtension::cancellation;
  using ProviderExtension::providedItemsURL;
  using ProviderExtension::ProviderExtension;
  using ProviderExtension::relativePath;

  std::function<void(const URL &, Completion)> onStart = [](const URL &, const Completion &completion) {
    completion(std::nullopt);
  };
  void startProviding(const URL &url, Completion completion) override { onStart(url, std::move(completion)); }

  std::atomic<int> changes = 0;
  void itemChanged(const URL & /*url*/, Completion completion) override {
    ++changes;
    completion(std::nullopt);
  }

  std::optional<std::string> identifier;
  void itemIdentifier(const URL &url, IdentifierCompletion completion) override {
    if (identifier) return completion(*identifier);
    ProviderExtension::itemIdentifier(url, std::move(completion));
  }
};

/// Waits until the daemon has gone.
void waitForCancellation(const std::stop_token &cancellation) {
  std::mutex mutex;
  std::condition_variable_any never;
  std::unique_lock lock(mutex);
  never.wait(lock, cancellation, [] { return false; });
}

class ProviderExtensionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string name = (fs::temp_directory_path() / "storix-sdk-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    directory_ = name;
    fs::create_directory(directory_ + "/group");
    extension_ = std::make_shared<ScriptedExtension>(ProviderEnvironment{"/bundle.appdex", directory_ + "/group"});
  }
  void TearDown() override { fs::remove_all(directory_); }

  URL item(const std::string &path) const {
    return *URL::fileURLWithPath(directory_ + "/group/Storix Storage/" + path);
  }

  std::string directory_;
  std::shared_ptr<ScriptedExtension> extension_;
};

// --- The defaults

TEST_F(ProviderExtensionTest, TheProvidedItemsDirectoryLiesInTheGroupContainer) {
  EXPECT_EQ(extension_->providedItemsURL(), URL::fileURLWithPath(directory_ + "/group/Storix Storage", true));
  const ScriptedExtension groupless(ProviderEnvironment{"/bundle.appdex", std::nullopt});
  EXPECT_EQ(groupless.providedItemsURL(), std::nullopt);
}

TEST_F(ProviderExtensionTest, InitialSetupMakesTheDirectoryAndMayBeRepeated) {
  for (int i = 0; i < 2; ++i) {
    std::optional<SXError> error = SXNotPermittedError();
    extension_->performInitialSetup([&](std::optional<SXError> given) { error = std::move(given); });
    EXPECT_EQ(error, std::nullopt);
  }
  EXPECT_TRUE(fs::is_directory(directory_ + "/group/Storix Storage"));
}

TEST_F(ProviderExtensionTest, InitialSetupFailsWithoutAGroup) {
  ScriptedExtension groupless(ProviderEnvironment{"/bundle.appdex", std::nullopt});
  std::optional<SXError> error;
  groupless.performInitialSetup([&](std::optional<SXError> given) { error = std::move(given); });
  ASSERT_TRUE(error.has_value());
  EXPECT_THAT(error->message(), HasSubstr("/bundle.appdex"));
}

TEST_F(ProviderExtensionTest, IdentifiersAreRelativePaths) {
  std::optional<Result<std::string>> identifier;
  extension_->itemIdentifier(item("a b/100%"),
                             [&](Result<std::string> given) { identifier.emplace(std::move(given)); });
  EXPECT_EQ(identifier->value(), "a b/100%");
  extension_->itemIdentifier(*URL::fileURLWithPath("/elsewhere"),
                             [&](Result<std::string> given) { identifier.emplace(std::move(given)); });
  EXPECT_FALSE(identifier->ok());

  std::optional<Result<URL>> url;
  extension_->itemURL("a b/100%", [&](Result<URL> given) { url.emplace(std::move(given)); });
  EXPECT_EQ(url->value(), item("a b/100%"));
  for (const char *bad : {"", "/a", "../a", "a/..", "a//b", "./a", "a/"}) {
    extension_->itemURL(bad, [&](Result<URL> given) { url.emplace(std::move(given)); });
    EXPECT_FALSE(url->ok()) << bad;
  }
}

TEST_F(ProviderExtensionTest, RelativePathsStayInside) {
  fs::create_directory(directory_ + "/group/Storix Storage");
  fs::create_symlink(directory_, directory_ + "/link");
  EXPECT_EQ(extension_->relativePath(item("a/b")), "a/b");
  EXPECT_EQ(extension_->relativePath(item("a/../b")), "b");
  EXPECT_EQ(extension_->relativePath(*URL::fileURLWithPath(directory_ + "/link/group/Storix Storage/a/b")), "a/b");
  EXPECT_EQ(extension_->relativePath(item("../secret")), std::nullopt);
  EXPECT_EQ(extension_->relativePath(item("a/../../secret")), std::nullopt);
  EXPECT_EQ(extension_->relativePath(item("")), std::nullopt);
  EXPECT_EQ(extension_->relativePath(*URL::fileURLWithPath(directory_ + "/group/Storix Storage 2/a")), std::nullopt);
}

TEST_F(ProviderExtensionTest, RelativePathsAreFoundWhileTheirFilesComeAndGo) {
  const std::string storage = directory_ + "/group/Storix Storage";
  fs::create_directory(storage);
  fs::create_symlink(directory_, directory_ + "/link");
  const std::string linked = directory_ + "/link/group/Storix Storage/a";
  std::atomic<bool> over = false;
  std::thread changing([&storage, &over] {
    while (!over) {
      std::ofstream(storage + "/a") << "x";
      fs::remove(storage + "/a");
    }
  });
  for (int i = 0; i < 2'000; ++i) {
    if (extension_->relativePath(item("a")) != "a") ADD_FAILURE() << "as it stands";
    if (extension_->relativePath(*URL::fileURLWithPath(linked)) != "a") ADD_FAILURE() << "through a link";
  }
  over = true;
  changing.join();
}

TEST_F(ProviderExtensionTest, RelativePathsFollowNoLinkOut) {
  const std::string storage = directory_ + "/group/Storix Storage";
  fs::create_directories(storage + "/inside");
  fs::create_symlink(directory_, storage + "/out");
  fs::create_symlink("inside", storage + "/in");
  fs::create_symlink("loop", storage + "/loop");
  EXPECT_EQ(extension_->relativePath(item("out/secret")), std::nullopt);
  EXPECT_EQ(extension_->relativePath(item("out")), std::nullopt);
  EXPECT_EQ(extension_->relativePath(item("in/a")), "in/a") << "an item keeps the name by which it is asked for";
  EXPECT_EQ(extension_->relativePath(item("loop/a")), std::nullopt);
}

// --- Serving the daemon

/// The daemon's end of an extension's connection, and the extension served on a thread.
class ServedExtensionTest : public ProviderExtensionTest {
 protected:
  using Descriptors = sdk::BusLoop::Descriptors;

  void SetUp() override {
    ProviderExtensionTest::SetUp();
    std::array<int, 2> ends{};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
    served_ = std::async(std::launch::async, [extension = extension_, socket = ends[1]] {
      return serveProviderExtension(extension, socket);
    });
    wire::BusConnection::Options options;
    options.side = wire::BusConnection::Side::server;
    options.peer = "the extension";
    auto added = loop_.add(UniqueFd(ends[0]), std::move(options));
    ASSERT_TRUE(added.ok());
    connection_ = added.value();
    vendor_ = std::make_unique<_KTStorixVendorProxy>(
        connection_->remoteObject(LinkInterface(_KTStorixVendorProtocol().description()),
                                  [](const SXError &error) { ADD_FAILURE() << "not delivered: " << error.message(); }));
    loopThread_ = std::thread([this] { loop_.run(); });
  }

  void TearDown() override {
    connection_->close();
    if (served_.valid()) {
      EXPECT_EQ(served_.get(), 0);
    }
    loop_.stop();
    loopThread_.join();
    ProviderExtensionTest::TearDown();
  }

  std::pair<std::optional<SXError>, std::optional<std::string>> identifier(const URL &url) {
    std::promise<std::pair<std::optional<SXError>, std::optional<std::string>>> answer;
    vendor_->_identifierForItemAtURL(url, [&](std::optional<SXError> error, std::optional<std::string> identifier) {
      answer.set_value({std::move(error), std::move(identifier)});
    });
    return answer.get_future().get();
  }

  std::optional<SXError> start(const URL &url) {
    std::promise<std::optional<SXError>> answer;
    vendor_->_startProvidingItemAtURL(url, [&](std::optional<SXError> error) { answer.set_value(std::move(error)); });
    return answer.get_future().get();
  }

  std::future<int> served_;
  sdk::BusLoop loop_;
  std::shared_ptr<wire::BusConnection> connection_;
  std::unique_ptr<_KTStorixVendorProxy> vendor_;
  std::thread loopThread_;
};

TEST_F(ServedExtensionTest, EveryOperationReachesTheExtension) {
  std::promise<std::optional<SXError>> setUp;
  vendor_->_performInitialSetupWithCompletion(
      [&](auto, auto, std::optional<SXError> error) { setUp.set_value(std::move(error)); });
  EXPECT_EQ(setUp.get_future().get(), std::nullopt);
  EXPECT_TRUE(fs::is_directory(directory_ + "/group/Storix Storage"));

  std::string started;
  extension_->onStart = [&](const URL &url, const ProviderExtension::Completion &completion) {
    started = url.path();
    completion(std::nullopt);
  };
  EXPECT_EQ(start(item("a b")), std::nullopt);
  EXPECT_EQ(started, item("a b").path());

  std::promise<std::optional<SXError>> placeholder;
  vendor_->_providePlaceholderAtURL(
      item("a"), [&](auto, std::optional<SXError> error) { placeholder.set_value(std::move(error)); });
  EXPECT_EQ(placeholder.get_future().get()->code(), ENOTSUP);

  std::promise<std::optional<SXError>> changed;
  vendor_->_itemChangedAtURL(item("a"), [&](std::optional<SXError> error) { changed.set_value(std::move(error)); });
  EXPECT_EQ(changed.get_future().get(), std::nullopt);

  std::promise<std::optional<SXError>> stopped;
  vendor_->_stopProvidingItemAtURL(item("a"),
                                   [&](std::optional<SXError> error) { stopped.set_value(std::move(error)); });
  EXPECT_EQ(stopped.get_future().get(), std::nullopt);

  EXPECT_EQ(identifier(item("a b")).second, "a b");

  std::promise<std::optional<URL>> url;
  vendor_->_URLForItemIdentifier("a b",
                                 [&](const auto &, std::optional<URL> given) { url.set_value(std::move(given)); });
  EXPECT_EQ(url.get_future().get(), item("a b"));
}

TEST_F(ServedExtensionTest, AMissingArgumentIsAnError) {
  std::promise<std::optional<SXError>> started;
  vendor_->_startProvidingItemAtURL(std::nullopt,
                                    [&](std::optional<SXError> error) { started.set_value(std::move(error)); });
  EXPECT_EQ(started.get_future().get()->code(), EINVAL);
  std::promise<std::optional<SXError>> resolved;
  vendor_->_URLForItemIdentifier(
      std::nullopt, [&](std::optional<SXError> error, const auto &) { resolved.set_value(std::move(error)); });
  EXPECT_EQ(resolved.get_future().get()->code(), EINVAL);
}

TEST_F(ServedExtensionTest, AnExtensionsErrorArrives) {
  const SXError error("org.sample", 7, {{"description", "no such document"}});
  extension_->onStart = [&](const URL &, const ProviderExtension::Completion &completion) { completion(error); };
  EXPECT_EQ(start(item("a")), error);
}

TEST_F(ServedExtensionTest, OnlyTheFirstAnswerCounts) {
  extension_->onStart = [](const URL &, const ProviderExtension::Completion &completion) {
    completion(std::nullopt);
    completion(SXNotPermittedError());
  };
  EXPECT_EQ(start(item("a")), std::nullopt);
}

TEST_F(ServedExtensionTest, ACompletionThatIsDroppedIsAnsweredByAnError) {
  extension_->onStart = [](const URL &, const ProviderExtension::Completion &) {};
  EXPECT_EQ(start(item("a"))->code(), ECANCELED);
}

TEST_F(ServedExtensionTest, AnExceptionIsAnsweredByAnError) {
  extension_->onStart = [](const URL &, const ProviderExtension::Completion &) { throw std::runtime_error("full"); };
  const auto error = start(item("a"));
  ASSERT_TRUE(error.has_value());
  EXPECT_THAT(error->message(), HasSubstr("full"));
}

TEST_F(ServedExtensionTest, ASlowDocumentDoesNotHoldUpTheOthers) {
  std::promise<void> release;
  std::promise<void> holding;
  extension_->onStart = [&, go = release.get_future().share()](const URL &url,
                                                               const ProviderExtension::Completion &completion) {
    if (url.lastPathComponent() == "slow") {
      holding.set_value();
      go.wait();
    }
    completion(std::nullopt);
  };
  std::promise<std::optional<SXError>> slow;
  vendor_->_startProvidingItemAtURL(item("slow"),
                                    [&](std::optional<SXError> error) { slow.set_value(std::move(error)); });
  holding.get_future().wait();
  EXPECT_EQ(start(item("quick")), std::nullopt);
  release.set_value();
  EXPECT_EQ(slow.get_future().get(), std::nullopt);
}

TEST_F(ServedExtensionTest, AnEmptyIdentifierBecomesAnError) {
  extension_->identifier = "";
  const auto [error, given] = identifier(item("a"));
  ASSERT_TRUE(error.has_value());
  EXPECT_THAT(error->message(), HasSubstr("the provider gave an empty identifier"));
  EXPECT_EQ(given, std::nullopt);
}

TEST_F(ServedExtensionTest, AnyNumberOfSlowDocumentsHoldsUpNoIdentifier) {
  extension_->onStart = [this](const URL &, const ProviderExtension::Completion &) {
    waitForCancellation(extension_->cancellation());
  };
  for (int i = 0; i < 300; ++i) vendor_->_startProvidingItemAtURL(item(std::to_string(i)), {});
  EXPECT_EQ(identifier(item("a")).second, "a");
}

TEST_F(ServedExtensionTest, ACompletionMayBeCalledLaterFromAnyThread) {
  std::promise<ProviderExtension::Completion> taken;
  extension_->onStart = [&taken](const URL &, ProviderExtension::Completion completion) {
    taken.set_value(std::move(completion));
  };
  std::thread later([&taken] { taken.get_future().get()(std::nullopt); });
  EXPECT_EQ(start(item("a")), std::nullopt);
  later.join();
}

TEST_F(ServedExtensionTest, TheEndOfTheConnectionWaitsForCallsUnderWay) {
  std::promise<void> release;
  std::promise<void> holding;
  std::atomic<bool> finished = false;
  extension_->onStart = [&, go = release.get_future().share()](const URL &,
                                                               const ProviderExtension::Completion &completion) {
    holding.set_value();
    go.wait();
    completion(std::nullopt);
    finished = true;
  };
  vendor_->_startProvidingItemAtURL(item("a"), {});
  holding.get_future().wait();
  connection_->close();
  release.set_value();
  EXPECT_EQ(served_.get(), 0);
  EXPECT_TRUE(finished);
}

TEST_F(ServedExtensionTest, CallsUnderWayLearnThatTheDaemonHasGone) {
  std::promise<void> holding;
  extension_->onStart = [&](const URL &, const ProviderExtension::Completion &) {
    EXPECT_FALSE(extension_->cancellation().stop_requested());
    holding.set_value();
    waitForCancellation(extension_->cancellation());
  };
  vendor_->_startProvidingItemAtURL(item("a"), {});
  holding.get_future().wait();
  connection_->close();
  EXPECT_EQ(served_.get(), 0);
  EXPECT_TRUE(extension_->cancellation().stop_requested());
}

TEST_F(ServedExtensionTest, WorkThatAnswersLaterIsToldWhenTheDaemonHasGone) {
  std::promise<void> begun;
  std::promise<void> told;
  std::optional<std::stop_callback<std::function<void()>>> registered;
  ProviderExtension::Completion kept;
  extension_->onStart = [&](const URL &, const ProviderExtension::Completion &completion) {
    kept = completion;
    registered.emplace(extension_->cancellation(), [&told] { told.set_value(); });
    begun.set_value();
  };
  vendor_->_startProvidingItemAtURL(item("a"), {});
  begun.get_future().wait();
  connection_->close();
  EXPECT_EQ(served_.get(), 0);
  EXPECT_EQ(told.get_future().wait_for(std::chrono::seconds(60)), std::future_status::ready);
  kept(std::nullopt);
}

TEST_F(ServedExtensionTest, OfTheCallsThatHaveNotBegunOnlyChangesAreCarriedOutWithoutTheDaemon) {
  std::atomic<int> begun = 0;
  extension_->onStart = [&](const URL &, const ProviderExtension::Completion &) {
    ++begun;
    waitForCancellation(extension_->cancellation());
  };
  for (int i = 0; i < 20; ++i) vendor_->_startProvidingItemAtURL(item(std::to_string(i)), {});
  vendor_->_itemChangedAtURL(item("a"), {});
  identifier(item("a"));  // All that was sent before it has been read.
  EXPECT_EQ(extension_->changes, 0);
  connection_->close();
  EXPECT_EQ(served_.get(), 0);
  EXPECT_LE(begun, 8);
  EXPECT_EQ(extension_->changes, 1);
}

TEST(ServeProviderExtension, APeerThatEndsBeforeTheLoginIsAFailure) {
  std::array<int, 2> ends{};
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
  UniqueFd(ends[0]).reset();
  const auto extension = std::make_shared<ScriptedExtension>(ProviderEnvironment{"/bundle.appdex", std::nullopt});
  EXPECT_EQ(serveProviderExtension(extension, ends[1]), 1);
}

TEST(RunProviderExtension, WithoutTheDaemonItSaysSoAndEnds) {
  const auto extension = std::make_shared<ScriptedExtension>(ProviderEnvironment{"/bundle.appdex", std::nullopt});
  ::unsetenv("STORIX_EXTENSION_FD");
  EXPECT_EQ(runProviderExtension(extension), 1);
  for (const char *bad : {"", "x", "-1", "3x", "99999999999", "987"}) {
    ::setenv("STORIX_EXTENSION_FD", bad, 1);
    EXPECT_EQ(runProviderExtension(extension), 1) << bad;
  }
  const UniqueFd file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  ::setenv("STORIX_EXTENSION_FD", std::to_string(file.get()).c_str(), 1);
  EXPECT_EQ(runProviderExtension(extension), 1) << "not a socket";
  ::unsetenv("STORIX_EXTENSION_FD");
}

TEST(ProviderEnvironment, ComesFromTheEnvironmentVariables) {
  ::setenv("STORIX_BUNDLE_PATH", "/x.appdex", 1);
  ::setenv("STORIX_GROUP_CONTAINER", "/g", 1);
  EXPECT_EQ(ProviderEnvironment::ofThisProcess().bundlePath, "/x.appdex");
  EXPECT_EQ(ProviderEnvironment::ofThisProcess().groupContainer, "/g");
  ::unsetenv("STORIX_GROUP_CONTAINER");
  EXPECT_EQ(ProviderEnvironment::ofThisProcess().groupContainer, std::nullopt);
  ::unsetenv("STORIX_BUNDLE_PATH");
}

}  // namespace
}  // namespace storix
