// Peers in real sandboxes: who they are, and what they may write.

#include <gmock/gmock.h>
#include <spawn.h>

#include <cerrno>
#include <filesystem>
#include <utility>
#include <variant>
#include <vector>

#include "platform/linux/TestDescriptors.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/Sandbox.h"
#include "platform/linux/identity/TestPeers.h"

namespace storix::linuxhost {
namespace {

using ::testing::HasSubstr;
using Words = std::vector<std::string>;

/// The test's peer program, started with other words before its own.
class StartedPeer {
 public:
  StartedPeer(const TestListener &listener, Words words) {
    std::array<int, 2> ends{};
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()), 0);
    control_.reset(ends[0]);
    const UniqueFd theirs(ends[1]);
    std::vector<char *> arguments;
    for (std::string &word : words) arguments.push_back(word.data());
    arguments.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, theirs.get(), 3);
    EXPECT_EQ(::posix_spawn(&process_, words[0].c_str(), &actions, nullptr, arguments.data(), environ), 0);
    posix_spawn_file_actions_destroy(&actions);
    connection_ = listener.accept();
    secondConnection_ = listener.accept();
    EXPECT_TRUE(connection_ && secondConnection_) << "the peer could not be started; what it said is above";
  }
  ~StartedPeer() { end(); }
  StartedPeer(const StartedPeer &) = delete;
  StartedPeer &operator=(const StartedPeer &) = delete;

  /// What the peer has opened, or its errno.
  [[nodiscard]] std::variant<UniqueFd, int> open(const std::string &path, int flags) const {
    const std::string text = std::to_string(flags) + " " + path;
    if (::send(control_.get(), text.data(), text.size(), MSG_NOSIGNAL) < 0) return errno;
    ReceivedByte error = receiveByte(control_.get());
    if (!error.isThere) return EIO;
    if (error.value != 0) return int{error.value};
    return std::move(error.descriptor);
  }

  void end() {
    control_.reset();
    if (process_ > 0) ::waitpid(process_, nullptr, 0);
    process_ = 0;
  }

  [[nodiscard]] int connection() const { return connection_.get(); }
  [[nodiscard]] int secondConnection() const { return secondConnection_.get(); }

 private:
  UniqueFd control_;
  pid_t process_ = 0;
  UniqueFd connection_;
  UniqueFd secondConnection_;
};

class SandboxedPeersTest : public ::testing::Test {
 protected:
  SandboxedPeersTest() {
    test_.makeDirectory("run");
    test_.makeDirectory("groups");
    file_ = test_.makeFile("documents/a", "");
    other_ = test_.makeFile("elsewhere/b", "");
    std::filesystem::copy_file(STORIX_TEST_PEER, test_ / "peer");
    Result<std::unique_ptr<Sandbox>> sandbox = Sandbox::create(peers_, test_ / "run", test_ / "groups");
    EXPECT_TRUE(sandbox);
    sandbox_ = std::move(sandbox.value());
  }

  [[nodiscard]] std::unique_ptr<StartedPeer> startPlain(const Words &more = {}) const {
    Words words = {test_ / "peer", listener_.name()};
    words.insert(words.end(), more.begin(), more.end());
    return std::make_unique<StartedPeer>(listener_, std::move(words));
  }
  /// In a sandbox that has the system's libraries, the program, and what the words bind.
  [[nodiscard]] std::unique_ptr<StartedPeer> startInSandbox(const Words &binds) const {
    Words words = {
        "/usr/bin/bwrap", "--unshare-user", "--unshare-pid", "--unshare-ipc", "--die-with-parent", "--cap-drop", "ALL",
        "--ro-bind",      "/usr",           "/usr"};
    for (const char *name : {"/lib", "/lib64"}) {
      const bool isLink = std::filesystem::is_symlink(name);
      words.insert(words.end(), {isLink ? "--symlink" : "--ro-bind-try",
                                 isLink ? std::filesystem::read_symlink(name).string() : std::string(name), name});
    }
    words.insert(words.end(), {"--proc", "/proc", "--dev", "/dev", "--ro-bind", test_ / "peer", "/peer"});
    words.insert(words.end(), binds.begin(), binds.end());
    words.insert(words.end(), {"--", "/peer", listener_.name()});
    return std::make_unique<StartedPeer>(listener_, std::move(words));
  }

  [[nodiscard]] std::shared_ptr<Peer> admitted(int connection) const {
    Result<std::shared_ptr<Peer>> peer = peers_->admit(connection);
    if (peer) return peer.value();
    ADD_FAILURE() << peer.error().message();
    return nullptr;
  }
  [[nodiscard]] std::string identifierOf(const std::unique_ptr<StartedPeer> &started) const {
    return admitted(started->connection())->bundleIdentifier().value_or("nobody");
  }
  [[nodiscard]] Words flatpakInfo(const std::string &text) const {
    return {"--ro-bind", test_.makeFile("info", text), "/.flatpak-info"};
  }

  [[nodiscard]] bool mayWrite(const std::shared_ptr<Peer> &peer, const std::string &path) const {
    return sandbox_->checkAccess(peer->auditToken(), "file-write-data", SandboxFilter::pathNoReport, path) == 0;
  }
  /// Has the peer open the file and offer the descriptor as a proof: "proved", or why not.
  [[nodiscard]] static std::string offered(const StartedPeer &peer, WriteProofs &proofs, const std::string &path,
                                           int flags) {
    std::variant<UniqueFd, int> opened = peer.open(path, flags);
    if (const int *error = std::get_if<int>(&opened)) return std::strerror(*error);
    const std::optional<SandboxFailure> refused = proofs.proveWriteAccess(std::move(std::get<UniqueFd>(opened)));
    return refused ? refused->text : "proved";
  }

  TestDirectory test_;
  std::string file_;
  std::string other_;
  TestListener listener_;
  std::shared_ptr<PeerTable> peers_ =
      std::make_shared<PeerTable>(std::make_shared<ApplicationManifests>(std::vector{test_ / "applications"}));
  std::unique_ptr<Sandbox> sandbox_;
};

// --- Who they are

TEST_F(SandboxedPeersTest, SandboxSaysWhoItsApplicationIs) {
  const auto started = startInSandbox(
      flatpakInfo("[Application]\nname=org.sample.Sandboxed\n[Policy com.tessel.storix]\nacl-read=true\nlevel=2\n"));
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  EXPECT_EQ(peer->bundleIdentifier(), "org.sample.Sandboxed");
  EXPECT_EQ(peer->entitlement("com.tessel.storix.acl-read"), Value(true));
  EXPECT_EQ(peer->entitlement("com.tessel.storix.level"), Value(2));
  EXPECT_EQ(peer->entitlement("com.tessel.storix.acl-write"), std::nullopt);
  EXPECT_TRUE(peer->isConfined());
}

TEST_F(SandboxedPeersTest, ManifestsGiveNothingToWhomTheSandboxNames) {
  for (const char *name : {"org.sample.Program", "org.sample.Sandboxed"}) {
    test_.makeFile("applications/" + std::string(name) + ".kvs",
                   R"({"Executable": ")" + (test_ / "peer") + R"(", "Entitlements": {"e": true}})");
  }
  const auto started = startInSandbox(flatpakInfo("[Application]\nname=org.sample.Sandboxed\n"));
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  EXPECT_EQ(peer->bundleIdentifier(), "org.sample.Sandboxed");
  EXPECT_EQ(peer->entitlement("e"), std::nullopt);
}

TEST_F(SandboxedPeersTest, ManifestCountsInASandboxThatSaysNothing) {
  test_.makeFile("applications/org.sample.Manifest.kvs",
                 R"({"Executable": ")" + (test_ / "peer") + R"(", "Entitlements": {"e": true}})");
  const auto started = startInSandbox({});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  EXPECT_EQ(peer->bundleIdentifier(), "org.sample.Manifest");
  EXPECT_EQ(peer->entitlement("e"), Value(true));
  EXPECT_TRUE(peer->isConfined());
  EXPECT_EQ(identifierOf(startPlain()), "org.sample.Manifest");
}

TEST_F(SandboxedPeersTest, SandboxThatCannotBeUnderstoodMakesNobody) {
  test_.makeFile("applications/org.sample.Manifest.kvs", R"({"Executable": ")" + (test_ / "peer") + R"("})");
  EXPECT_EQ(identifierOf(startInSandbox(flatpakInfo("[Application]\nname=a\nname=b\n"))), "nobody");
  EXPECT_EQ(identifierOf(startInSandbox({"--dir", "/.flatpak-info"})), "nobody");
  EXPECT_EQ(identifierOf(startInSandbox({"--symlink", "/usr/x", "/.flatpak-info"})), "nobody");
}

// --- What they may write

TEST_F(SandboxedPeersTest, PlainProcessMayWriteWhatItsUserMay) {
  const auto started = startPlain();
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  EXPECT_FALSE(peer->isConfined());
  EXPECT_TRUE(mayWrite(peer, file_));
  EXPECT_FALSE(mayWrite(peer, test_ / "absent"));
}

TEST_F(SandboxedPeersTest, SandboxThatHasTheFileLetsItBeProved) {
  const auto started = startInSandbox({"--bind", test_ / "documents", "/given"});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admitted(started->secondConnection()));
  EXPECT_FALSE(mayWrite(peer, file_)) << "nothing is proved yet";
  EXPECT_EQ(offered(*started, *proofs, "/given/a", O_RDWR), "proved");
  EXPECT_TRUE(mayWrite(peer, file_)) << "whatever it is called in the sandbox";
  EXPECT_FALSE(mayWrite(peer, other_));
}

TEST_F(SandboxedPeersTest, SandboxWithoutTheFileCannotProveIt) {
  const auto started = startInSandbox({"--tmpfs", test_ / "documents"});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admitted(started->secondConnection()));
  EXPECT_EQ(offered(*started, *proofs, file_, O_RDWR), "No such file or directory");
  EXPECT_FALSE(mayWrite(peer, file_));
  // A file of its own, under the very name.
  EXPECT_EQ(offered(*started, *proofs, file_, O_RDWR | O_CREAT), "proved");
  EXPECT_FALSE(mayWrite(peer, file_));
}

TEST_F(SandboxedPeersTest, ReadOnlyBindProvesNothing) {
  const auto started = startInSandbox({"--ro-bind", file_, file_});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admitted(started->secondConnection()));
  EXPECT_EQ(offered(*started, *proofs, file_, O_RDWR), "Read-only file system");
  EXPECT_THAT(offered(*started, *proofs, file_, O_RDONLY), HasSubstr("not open for writing"));
  EXPECT_THAT(offered(*started, *proofs, file_, O_PATH | O_RDWR), HasSubstr("not open for writing"));
  EXPECT_FALSE(mayWrite(peer, file_));
}

TEST_F(SandboxedPeersTest, LandlockDomainMayWriteWhatItProvesAndNoMore) {
  const auto started = startPlain({test_ / "documents"});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admitted(started->secondConnection()));
  EXPECT_TRUE(peer->isConfined());
  EXPECT_FALSE(mayWrite(peer, file_));
  EXPECT_EQ(offered(*started, *proofs, file_, O_RDWR), "proved");
  EXPECT_TRUE(mayWrite(peer, file_));
  EXPECT_EQ(offered(*started, *proofs, other_, O_RDWR), "Permission denied");
  EXPECT_THAT(offered(*started, *proofs, other_, O_PATH), HasSubstr("not open for writing"));
  EXPECT_FALSE(mayWrite(peer, other_));
}

TEST_F(SandboxedPeersTest, ProofGoesWithItsProcess) {
  const auto started = startInSandbox({"--bind", file_, file_});
  const std::shared_ptr<Peer> peer = admitted(started->connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admitted(started->secondConnection()));
  EXPECT_EQ(offered(*started, *proofs, file_, O_WRONLY), "proved");
  EXPECT_TRUE(mayWrite(peer, file_));
  started->end();
  EXPECT_FALSE(mayWrite(peer, file_));
}

}  // namespace
}  // namespace storix::linuxhost
