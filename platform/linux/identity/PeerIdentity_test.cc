#include "platform/linux/identity/PeerIdentity.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

/// A process's directory as /proc would show it, of files of the test's own.
class PeerIdentityTest : public ::testing::Test {
 protected:
  PeerIdentityTest() {
    test_.makeDirectory("root");
    test_.makeDirectory("manifests");
    test_.makeDirectory("process");
    test_.makeLink("process/root", test_ / "root");
    test_.makeLink("process/exe", test_.makeFile("program", ""));
    test_.makeFile("process/cgroup", "0::/user.slice/app-org.sample.Unit-1.scope\n");
  }
  [[nodiscard]] PeerIdentity identity() {
    const UniqueFd directory(::open((test_ / "process").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    return readIdentity(directory.get(), manifests_);
  }
  [[nodiscard]] std::string identifier() { return identity().bundleIdentifier.value_or("none"); }
  void makeManifest(const std::string &name, const std::string &entitlement) const {
    test_.makeFile("manifests/" + name + ".kvs", R"({"Executable": ")" + (test_ / "program") +
                                                     R"(", "Entitlements": {")" + entitlement + R"(": true}})");
  }

  TestDirectory test_;
  ApplicationManifests manifests_{{test_ / "manifests"}};
};

TEST_F(PeerIdentityTest, SandboxIsAskedFirstThenTheManifestsThenTheUnit) {
  EXPECT_EQ(identifier(), "org.sample.Unit");
  makeManifest("org.sample.Manifest", "m");
  EXPECT_EQ(identifier(), "org.sample.Manifest");
  EXPECT_EQ(identity().entitlements, Dictionary({{"m", true}}));
  test_.makeFile("root/.flatpak-info", "[Application]\nname=org.sample.Sandboxed\n[Policy p]\ns=1\n");
  EXPECT_EQ(identifier(), "org.sample.Sandboxed");
  EXPECT_EQ(identity().entitlements, Dictionary({{"p.s", 1}}));
}

TEST_F(PeerIdentityTest, SandboxWithoutANameIsNotGivenAnother) {
  makeManifest("org.sample.Manifest", "m");
  test_.makeFile("root/.flatpak-info", "[Policy p]\ns=1\n");
  EXPECT_EQ(identifier(), "none");
  EXPECT_EQ(identity().entitlements, Dictionary({{"p.s", 1}}));
}

TEST_F(PeerIdentityTest, SandboxThatCannotBeReadMakesNobody) {
  makeManifest("org.sample.Manifest", "m");
  const auto isNobody = [this](const char *what) {
    const PeerIdentity found = identity();
    EXPECT_EQ(found.bundleIdentifier, std::nullopt) << what;
    EXPECT_TRUE(found.entitlements.empty()) << what;
    std::filesystem::remove_all(test_ / "root/.flatpak-info");
  };
  test_.makeFile("root/.flatpak-info", "[Application]\nname=a\nname=b\n");
  isNobody("malformed");
  test_.makeFile("root/.flatpak-info", "[Application]\nname=a\n#" + std::string(2 * 1024 * 1024, 'x'));
  isNobody("too long");
  test_.makeDirectory("root/.flatpak-info");
  isNobody("a directory");
  ASSERT_EQ(::mkfifo((test_ / "root/.flatpak-info").c_str(), 0600), 0);
  isNobody("a FIFO");
  test_.makeLink("root/.flatpak-info", test_.makeFile("info", "[Application]\nname=a\n"));
  isNobody("a link");
  EXPECT_EQ(identifier(), "org.sample.Manifest") << "an absent file means no sandbox";
  std::filesystem::remove(test_ / "process/root");
  isNobody("no root");
}

TEST_F(PeerIdentityTest, UnitsApplicationHasTheEntitlementsOfItsManifest) {
  test_.makeFile("manifests/org.sample.Unit.kvs", R"({"Entitlements": {"u": 1}})");
  test_.makeFile("manifests/org.sample.Other.kvs", R"({"Entitlements": {"o": 1}})");
  EXPECT_EQ(identifier(), "org.sample.Unit");
  EXPECT_EQ(identity().entitlements, Dictionary({{"u", 1}}));
}

TEST_F(PeerIdentityTest, WhoHasNothingIsNobody) {
  std::filesystem::remove(test_ / "process/exe");
  std::filesystem::remove(test_ / "process/cgroup");
  EXPECT_EQ(identifier(), "none");
  test_.makeFile("process/cgroup", "0::/session-1.scope\n");
  EXPECT_EQ(identifier(), "none");
  EXPECT_TRUE(identity().entitlements.empty());
}

}  // namespace
}  // namespace storix::linuxhost
