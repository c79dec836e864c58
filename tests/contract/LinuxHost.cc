#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <utility>

#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/files/KeyedValueFile.h"
#include "tests/contract/HostUnderTest.h"

namespace storix::contract {
namespace {

using linuxhost::HostEnvironment;
using linuxhost::LinuxPlatform;

/// The Linux host with all its places in a directory of the test's own.
class LinuxHost : public HostUnderTest {
 public:
  LinuxHost() {
    root_.makeDirectory("files");
    root_.makeDirectory("extensions");
    HostEnvironment environment;
    environment.homeDirectory = root_.makeDirectory("home");
    environment.runtimeDirectory = root_ / "run";
    environment.extensionPlaces = {{root_ / "extensions"}, root_ / "groups"};
    environment.applicationDirectories = {root_ / "applications"};
    Result<std::unique_ptr<LinuxPlatform>> platform = LinuxPlatform::create(std::move(environment));
    // Nothing can be tested without it.
    if (!platform) endProcessForProgrammingError("The host cannot be made: " + platform.error().message());
    platform_ = std::move(platform.value());
  }

  PlatformServices &platform() override { return *platform_; }
  void shutDown() override { platform_->shutDown(); }

  [[nodiscard]] std::string directory() const override { return root_ / "files"; }
  void makeDirectory(const std::string &path) override { std::filesystem::create_directories(path); }
  void writeCorruptFile(const std::string &path) override { std::ofstream(path) << "{ broken"; }
  void makeSymbolicLink(const std::string &path, const std::string &target) override {
    std::filesystem::create_symlink(target, path);
  }
  void removeFile(const std::string &path) override { std::filesystem::remove(path); }

  void installBundle(const BundleDescription &bundle) override {
    Dictionary info = bundle.info;
    info.emplace("KTBundleVersion", bundle.version);
    info.emplace("KTBundleExecutable", "provider");
    info.emplace("KTExtensionPointIdentifier", bundle.extensionPoint);
    info.emplace("KTGroupContainers", List(bundle.groups.begin(), bundle.groups.end()));
    if (bundle.identifier) info.emplace("KTBundleIdentifier", *bundle.identifier);
    std::filesystem::create_directories(pathOfBundle(bundle.name));
    EXPECT_FALSE(linuxhost::writeKeyedValueFile(info, pathOfBundle(bundle.name) + "/Info.kvs"));
  }
  void removeBundle(const std::string &name) override { std::filesystem::remove_all(pathOfBundle(name)); }

  void setLockState(int state, bool unlockedSinceBoot) override {
    EXPECT_FALSE(linuxhost::writeKeyedValueFile({{"lockState", state}, {"unlockedSinceBoot", unlockedSinceBoot}},
                                                root_ / "run/vaultkeepd.kvs"));
  }

  void postNotification(const std::string &name) override { platform_->notifications().post(name); }
  // The loop takes the signal, which is blocked on every thread of the host's.
  void endEventLoop() override { ::kill(::getpid(), SIGTERM); }

 private:
  [[nodiscard]] std::string pathOfBundle(const std::string &name) const {
    return root_ / ("extensions/" + name + ".appdex");
  }

  linuxhost::TestDirectory root_;
  std::unique_ptr<LinuxPlatform> platform_;
};

}  // namespace

std::unique_ptr<HostUnderTest> makeLinuxHost() { return std::make_unique<LinuxHost>(); }

}  // namespace storix::contract
