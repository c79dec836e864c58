#include "platform/linux/LinuxPlatform.h"

#include <gmock/gmock.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <csignal>
#include <cstring>
#include <mutex>
#include <thread>

#include "platform/ProcessScope.h"
#include "platform/linux/TestDirectory.h"
#include "wire/SdBus.h"

namespace storix::linuxhost {
namespace {

using testing::HasSubstr;

constexpr const char *notificationsInterface = "com.tessel.Platform.Notifications";
constexpr const char *platformObject = "/com/tessel/Platform";

class LinuxPlatformTest : public testing::Test {
 protected:
  [[nodiscard]] HostEnvironment environment() const {
    const Result<HostEnvironment> environment = HostEnvironment::fromVariables(
        {{"HOME", directory_ / "home"}, {"STORIX_RUNTIME_DIR", directory_ / "run"}, {"STORIX_LOG", "fault"}});
    EXPECT_TRUE(environment.ok());
    return environment.value();
  }

  std::unique_ptr<LinuxPlatform> make(ActivatedSockets activated = {}) const {
    auto platform = LinuxPlatform::create(environment(), std::move(activated));
    EXPECT_TRUE(platform.ok()) << (platform ? "" : platform.error().message());
    return platform ? std::move(platform.value()) : nullptr;
  }

  [[nodiscard]] std::string socketPath(std::string_view name) const {
    return directory_ / ("run/" + std::string(name));
  }

  [[nodiscard]] bool isSocket(std::string_view name) const {
    struct stat status {};
    return ::stat(socketPath(name).c_str(), &status) == 0 && S_ISSOCK(status.st_mode);
  }

  [[nodiscard]] wire::OwnedBus connectTo(std::string_view name) const {
    sd_bus *bus = nullptr;
    EXPECT_GE(sd_bus_new(&bus), 0);
    wire::OwnedBus owned(bus);
    EXPECT_GE(sd_bus_set_address(bus, ("unix:path=" + socketPath(name)).c_str()), 0);
    EXPECT_GE(sd_bus_start(bus), 0);
    return owned;
  }

  [[nodiscard]] bool post(const char *name) const {
    const wire::OwnedBus bus = connectTo(platformSocketName);
    return sd_bus_call_method(bus.get(), nullptr, platformObject, notificationsInterface, "Post", nullptr, nullptr, "s",
                              name) >= 0;
  }

  /// A listening socket outside of the runtime directory, as the service manager would make it.
  UniqueFd listeningSocket(const std::string &path) const {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
    EXPECT_EQ(::listen(socket.get(), 4), 0);
    return socket;
  }

  TestDirectory directory_;
};

TEST_F(LinuxPlatformTest, SocketsStandAsLongAsThePlatform) {
  auto platform = make();
  EXPECT_TRUE(isSocket(serviceSocketName));
  EXPECT_TRUE(isSocket(platformSocketName));
  platform.reset();
  EXPECT_FALSE(isSocket(serviceSocketName));
  EXPECT_FALSE(isSocket(platformSocketName));
}

TEST_F(LinuxPlatformTest, SocketsOfADeadDaemonAreReplaced) {
  make();
  listeningSocket(socketPath(serviceSocketName)).reset();
  ASSERT_TRUE(isSocket(serviceSocketName));
  const auto platform = make();
  EXPECT_GE(sd_bus_call_method(connectTo(platformSocketName).get(), nullptr, platformObject,
                               "org.freedesktop.DBus.Peer", "Ping", nullptr, nullptr, ""),
            0);
}

TEST_F(LinuxPlatformTest, SecondPlatformOfTheSameDirectoryIsRefused) {
  const auto first = make();
  const auto second = LinuxPlatform::create(environment());
  ASSERT_FALSE(second.ok());
  EXPECT_THAT(second.error().message(), HasSubstr("in use by another storixd"));
  EXPECT_TRUE(isSocket(serviceSocketName));
}

TEST_F(LinuxPlatformTest, UnusableRuntimeDirectoryIsRefused) {
  directory_.makeFile("run", "");
  const auto platform = LinuxPlatform::create(environment());
  ASSERT_FALSE(platform.ok());
  EXPECT_THAT(platform.error().message(), HasSubstr("is not a directory"));
}

TEST_F(LinuxPlatformTest, SocketsThatAreHandedOverAreUsedAndStay) {
  directory_.makeDirectory("run");
  ASSERT_EQ(::chmod((directory_ / "run").c_str(), 0700), 0);
  ActivatedSockets sockets;
  sockets.emplace(platformSocketName, listeningSocket(socketPath(platformSocketName)));
  auto platform = make(std::move(sockets));
  EXPECT_TRUE(post("org.sample.any"));
  platform.reset();
  EXPECT_TRUE(isSocket(platformSocketName));
  EXPECT_FALSE(isSocket(serviceSocketName));
}

TEST_F(LinuxPlatformTest, SocketThatNothingServesIsRefused) {
  ActivatedSockets sockets;
  sockets.emplace("org.sample.Other", listeningSocket(directory_ / "other"));
  const auto platform = LinuxPlatform::create(environment(), std::move(sockets));
  ASSERT_FALSE(platform.ok());
  EXPECT_THAT(platform.error().message(), HasSubstr("org.sample.Other"));
}

TEST_F(LinuxPlatformTest, OnlyTheOneServiceHasAListener) {
  const auto platform = make();
  EXPECT_NE(platform->createServiceListener(serviceSocketName), nullptr);
  EXPECT_EQ(platform->createServiceListener(platformSocketName), nullptr);
  EXPECT_EQ(platform->createServiceListener("org.sample.Other"), nullptr);
}

TEST_F(LinuxPlatformTest, NotificationThatIsPostedIsDeliveredOnTheMainThread) {
  const auto platform = make();
  std::thread::id thread;
  platform->addSystemNotificationObserver("org.sample.unlock", [&thread] {
    thread = std::this_thread::get_id();
    ::kill(::getpid(), SIGTERM);
  });
  EXPECT_TRUE(post("org.sample.unlock"));
  platform->runEventLoop();
  EXPECT_EQ(thread, std::this_thread::get_id());
  EXPECT_FALSE(isSocket(platformSocketName));
}

TEST_F(LinuxPlatformTest, LockStateIsThatOfTheRuntimeDirectory) {
  const auto platform = make();
  EXPECT_EQ(platform->deviceLockState(), 3);
  directory_.makeFile("run/vaultkeepd.kvs", R"({"lockState": 1, "unlockedSinceBoot": false})");
  EXPECT_EQ(platform->deviceLockState(), 1);
  EXPECT_FALSE(platform->deviceUnlockedSinceBoot());
}

TEST_F(LinuxPlatformTest, NobodyIsBehindAnAuditTokenOfNoConnection) {
  const auto platform = make();
  EXPECT_EQ(platform->bundleIdentifierForAuditToken(AuditToken()), std::nullopt);
  EXPECT_EQ(platform->bundleIdentifierForAuditToken(AuditToken{{1, 2, 3, 4, 5, 6, 7, 8}}), std::nullopt);
  EXPECT_NE(
      platform->checkSandboxAccess(AuditToken(), "file-write-data", SandboxFilter::pathNoReport, directory_ / "x"), 0);
}

TEST_F(LinuxPlatformTest, WhatRunsIsFinishedAndNothingStartsAfterShuttingDown) {
  const auto platform = make();
  std::mutex mutex;
  std::condition_variable changed;
  bool started = false;
  bool ending = false;
  std::atomic<bool> finished = false;
  std::atomic<bool> ranLate = false;
  platform->globalQueue()->async([&mutex, &changed, &started, &ending, &finished] {
    std::unique_lock lock(mutex);
    started = true;
    changed.notify_all();
    changed.wait(lock, [&ending] { return ending; });
    finished = true;
  });
  platform->runAfterDelay(3'600'000'000'000, platform->globalQueue(), [&ranLate] { ranLate = true; });
  {
    std::unique_lock lock(mutex);
    changed.wait(lock, [&started] { return started; });
    ending = true;
    changed.notify_all();
  }
  platform->shutDown();
  EXPECT_TRUE(finished);
  platform->globalQueue()->async([&ranLate] { ranLate = true; });
  platform->runAfterDelay(0, platform->globalQueue(), [&ranLate] { ranLate = true; });
  EXPECT_EQ(platform->beginMatchingExtensions({}, [&ranLate](auto, auto) { ranLate = true; }), nullptr);
  EXPECT_EQ(platform->bundleRecordForIdentifier("org.sample.docs"), nullptr);
  EXPECT_EQ(platform->createServiceListener(serviceSocketName), nullptr);
  platform->shutDown();
  EXPECT_FALSE(ranLate);
}

}  // namespace
}  // namespace storix::linuxhost
