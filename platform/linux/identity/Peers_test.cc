#include "platform/linux/identity/Peers.h"

#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sched.h>

#include <cerrno>
#include <filesystem>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestUser.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/TestPeers.h"

namespace storix::linuxhost {
namespace {

class PeersTest : public ::testing::Test {
 protected:
  std::shared_ptr<Peer> admitted(int socket) {
    Result<std::shared_ptr<Peer>> peer = peers_.admit(socket);
    if (peer) return peer.value();
    ADD_FAILURE() << peer.error().message();
    return nullptr;
  }
  std::shared_ptr<Peer> admittedSelf() {
    const UniqueFd client = listener_.connectToIt();
    return admitted(listener_.accept().get());
  }
  bool isConfinedAfter(const std::function<bool()> &prepare, unsigned long namespaces = 0) {
    const TestPeerProcess process(listener_, prepare, namespaces);
    const std::shared_ptr<Peer> peer = admitted(process.connection());
    return peer && peer->isConfined();
  }

  TestDirectory test_;
  std::shared_ptr<ApplicationManifests> manifests_ =
      std::make_shared<ApplicationManifests>(std::vector{test_ / "applications"});
  PeerTable peers_{manifests_};
  TestListener listener_;
};

TEST_F(PeersTest, PeerIsTheProcessThatConnected) {
  const TestPeerProcess process(listener_);
  const std::shared_ptr<Peer> peer = admitted(process.connection());
  EXPECT_EQ(peer->processIdentifier(), process.process());
  EXPECT_TRUE(peer->isAlive());
  EXPECT_FALSE(peer->isConfined());
}

TEST_F(PeersTest, TokenLeadsBackToItsPeerAloneAndOnlyWhileItIsHeld) {
  std::shared_ptr<Peer> first = admittedSelf();
  const std::shared_ptr<Peer> second = admittedSelf();
  EXPECT_NE(first->auditToken(), second->auditToken());
  EXPECT_EQ(peers_.find(first->auditToken()), first);
  EXPECT_EQ(peers_.find(second->auditToken()), second);
  EXPECT_EQ(peers_.find(AuditToken()), nullptr);
  AuditToken forged = first->auditToken();
  forged.words[2] ^= 1;
  EXPECT_EQ(peers_.find(forged), nullptr);
  forged = first->auditToken();
  forged.words[7] = 1;
  EXPECT_EQ(peers_.find(forged), nullptr);

  const AuditToken token = first->auditToken();
  first.reset();
  EXPECT_EQ(peers_.find(token), nullptr);
  EXPECT_EQ(peers_.find(second->auditToken()), second);
}

TEST_F(PeersTest, PeerMayOutliveTheTable) {
  auto table = std::make_unique<PeerTable>(manifests_);
  const UniqueFd client = listener_.connectToIt();
  std::shared_ptr<Peer> peer = table->admit(listener_.accept().get()).value();
  table.reset();
  EXPECT_TRUE(peer->isAlive());
}

TEST_F(PeersTest, AnotherUserIsRefused) {
  PeerTable othersTable(manifests_, ::geteuid() + 1);
  const UniqueFd client = listener_.connectToIt();
  const Result<std::shared_ptr<Peer>> refused = othersTable.admit(listener_.accept().get());
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code(), EACCES);
}

TEST_F(PeersTest, ProcessThatIsGoneIsRefused) {
  TestPeerProcess process(listener_);
  process.end();
  EXPECT_FALSE(peers_.admit(process.connection()));
}

TEST_F(PeersTest, ProcessThatHasEndedAndIsNotBuriedIsRefused) {
  const TestPeerProcess process(listener_);
  ASSERT_EQ(::kill(process.process(), SIGKILL), 0);
  siginfo_t ended{};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(process.process()), &ended, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(peers_.admit(process.connection()));
}

TEST_F(PeersTest, WhatIsNoConnectedSocketIsRefused) {
  EXPECT_FALSE(peers_.admit(-1));
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const UniqueFd readEnd(ends[0]);
  const UniqueFd writeEnd(ends[1]);
  EXPECT_FALSE(peers_.admit(readEnd.get()));
  const UniqueFd unconnected(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  EXPECT_FALSE(peers_.admit(unconnected.get()));
}

TEST_F(PeersTest, EndOfTheProcessIsSeen) {
  TestPeerProcess process(listener_);
  const std::shared_ptr<Peer> peer = admitted(process.connection());
  EXPECT_TRUE(peer->isAlive());
  process.end();
  EXPECT_FALSE(peer->isAlive());
  EXPECT_EQ(peers_.find(peer->auditToken()), peer);
}

TEST_F(PeersTest, IdentityIsOfTheProgramAndSettledWhenTheConnectionIsAccepted) {
  const std::string program = std::filesystem::read_symlink("/proc/self/exe");
  const std::string manifest = test_.makeFile(
      "applications/org.sample.Test.kvs",
      R"({"Executable": ")" + program + R"(", "Entitlements": {"com.tessel.storix.acl-read": true, "text": "true"}})");
  const std::shared_ptr<Peer> peer = admittedSelf();
  std::filesystem::remove(manifest);
  EXPECT_EQ(peer->bundleIdentifier(), "org.sample.Test");
  EXPECT_EQ(peer->entitlement("com.tessel.storix.acl-read"), Value(true));
  EXPECT_EQ(peer->entitlement("text"), Value("true"));
  EXPECT_EQ(peer->entitlement("com.tessel.storix.acl-write"), std::nullopt);
  EXPECT_NE(admittedSelf()->bundleIdentifier(), "org.sample.Test");
}

TEST_F(PeersTest, NoNewPrivilegesConfine) { EXPECT_TRUE(isConfinedAfter(giveUpNewPrivileges)); }

TEST_F(PeersTest, NamespacesOfItsOwnConfine) {
  EXPECT_FALSE(isConfinedAfter(nullptr));
  EXPECT_TRUE(isConfinedAfter(nullptr, CLONE_NEWUSER));
  EXPECT_TRUE(isConfinedAfter(nullptr, CLONE_NEWUSER | CLONE_NEWNS));
}

TEST_F(PeersTest, ProcessThatCannotBeLookedAtIsNobodyAndConfined) {
  EXPECT_TRUE(holdsWithoutRoot([this] {
    PeerTable peers(manifests_);
    const TestPeerProcess process(listener_, [] { return ::prctl(PR_SET_DUMPABLE, 0, 0, 0, 0) == 0; });
    const Result<std::shared_ptr<Peer>> peer = peers.admit(process.connection());
    return peer && peer.value()->isConfined() && !peer.value()->bundleIdentifier();
  }));
}

TEST_F(PeersTest, SystemCallFilterConfines) {
  EXPECT_TRUE(isConfinedAfter([] {
    sock_filter allow = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW);
    const sock_fprog program{1, &allow};
    // Without root's rights the filter needs what confines already.
    if (::geteuid() != 0 && !giveUpNewPrivileges()) return false;
    return ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0) == 0;
  }));
}

}  // namespace
}  // namespace storix::linuxhost
