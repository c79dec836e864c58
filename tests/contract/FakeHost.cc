#include "platform/fake/FakePlatform.h"
#include "tests/contract/HostUnderTest.h"

namespace storix::contract {
namespace {

class FakeHost : public HostUnderTest {
 public:
  FakeHost() { platform_->files().makeDirectory(directory()); }

  PlatformServices &platform() override { return *platform_; }
  void shutDown() override { platform_->shutDown(); }

  [[nodiscard]] std::string directory() const override { return "/tests"; }
  void makeDirectory(const std::string &path) override { platform_->files().makeDirectory(path); }
  void writeCorruptFile(const std::string &path) override { platform_->files().writeCorruptFile(path, "{ broken"); }
  void makeSymbolicLink(const std::string &path, const std::string &target) override {
    platform_->files().makeSymbolicLink(path, target);
  }
  void removeFile(const std::string &path) override { platform_->files().remove(path); }

  void installBundle(const BundleDescription &bundle) override {
    fake::FakeExtension extension;
    extension.identifier = bundle.identifier;
    extension.version = bundle.version;
    extension.extensionPoint = bundle.extensionPoint;
    extension.bundle = fake::FakeBundle{bundle.info, {}};
    for (const std::string &group : bundle.groups) {
      extension.bundle->groupContainers.emplace(group, *URL::fileURLWithPath("/groups/" + group, true));
      platform_->files().makeDirectory("/groups/" + group);
    }
    platform_->extensions().install(std::move(extension));
    platform_->extensions().deliver();
  }
  void removeBundle(const std::string &name) override {
    platform_->extensions().remove(name);
    platform_->extensions().deliver();
  }

  void setLockState(int state, bool unlockedSinceBoot) override {
    platform_->setDeviceLockState(state);
    platform_->setDeviceUnlockedSinceBoot(unlockedSinceBoot);
  }

  void postNotification(const std::string &name) override { platform_->postNotification(name); }
  void endEventLoop() override { platform_->endEventLoop(); }

 private:
  std::unique_ptr<fake::FakePlatform> platform_ =
      fake::FakePlatform::create({.queues = fake::FakeExecutor::Kind::threads, .homeDirectory = "/home/u"});
};

}  // namespace

std::unique_ptr<HostUnderTest> makeFakeHost() { return std::make_unique<FakeHost>(); }

}  // namespace storix::contract
