#include "platform/linux/identity/Sandbox.h"

#include <gmock/gmock.h>
#include <sodium.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"
#include "platform/linux/TestUser.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/TestPeers.h"

namespace storix::linuxhost {
namespace {

using Kind = SandboxFailure::Kind;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr std::string_view writing = "file-write-data";

class SandboxTest : public ::testing::Test {
 protected:
  SandboxTest() {
    test_.makeDirectory("run");
    groups_ = test_.makeDirectory("groups");
    storage_ = test_.makeDirectory("groups/group.a/Storix Storage");
    sandbox_ = makeSandbox();
  }

  [[nodiscard]] std::unique_ptr<Sandbox> makeSandbox() const {
    Result<std::unique_ptr<Sandbox>> sandbox = Sandbox::create(peers_, test_ / "run", groups_);
    if (!sandbox) ADD_FAILURE() << sandbox.error().message();
    return std::move(sandbox.value());
  }
  [[nodiscard]] std::shared_ptr<Peer> admitted(int socket) const {
    Result<std::shared_ptr<Peer>> peer = peers_->admit(socket);
    if (peer) return peer.value();
    ADD_FAILURE() << peer.error().message();
    return nullptr;
  }
  [[nodiscard]] std::shared_ptr<Peer> admittedSelf() const {
    const UniqueFd client = listener_.connectToIt();
    return admitted(listener_.accept().get());
  }
  [[nodiscard]] bool mayWrite(const std::shared_ptr<Peer> &peer, const std::string &path) const {
    return sandbox_->checkAccess(peer->auditToken(), writing, SandboxFilter::pathNoReport, path) == 0;
  }

  [[nodiscard]] std::optional<std::string> tokenFor(const std::string &path) const {
    return sandbox_->issueExtension(SandboxExtensionClass::readWrite, path, 0);
  }
  /// The kind and text of the failure, or "opened".
  [[nodiscard]] std::pair<std::optional<Kind>, std::string> consumed(const std::string &token) const {
    const auto result = sandbox_->consume(token);
    if (const SandboxFailure *failure = std::get_if<SandboxFailure>(&result)) return {failure->kind, failure->text};
    return {std::nullopt, "opened"};
  }
  [[nodiscard]] std::optional<Kind> failureOf(const std::string &token) const { return consumed(token).first; }

  TestDirectory test_;
  std::string groups_;
  std::string storage_;
  TestListener listener_;
  std::shared_ptr<PeerTable> peers_ =
      std::make_shared<PeerTable>(std::make_shared<ApplicationManifests>(std::vector<std::string>()));
  std::unique_ptr<Sandbox> sandbox_;
};

UniqueFd opened(const std::string &path, int flags) { return UniqueFd(::open(path.c_str(), flags | O_CLOEXEC, 0600)); }

// --- What a peer may write

TEST_F(SandboxTest, UnconfinedPeerMayWriteWhatItsUserMay) {
  const std::shared_ptr<Peer> peer = admittedSelf();
  EXPECT_TRUE(mayWrite(peer, test_.makeFile("a", "")));
  EXPECT_TRUE(mayWrite(peer, storage_));
  EXPECT_FALSE(mayWrite(peer, test_ / "absent"));
  EXPECT_FALSE(mayWrite(peer, ""));
  EXPECT_FALSE(mayWrite(peer, (test_ / "a") + std::string(1, '\0') + "b"));
}

TEST_F(SandboxTest, UnconfinedPeerMayNotWriteWhatItsUserMayNot) {
  const std::string readOnly = test_.makeFile("read-only", "");
  ASSERT_EQ(::chmod(readOnly.c_str(), 0444), 0);
  const std::string others = test_.makeFile("others", "");
  ASSERT_EQ(::chmod(others.c_str(), 0666), 0);
  ASSERT_EQ(::chmod(test_.path().c_str(), 0755), 0);
  EXPECT_TRUE(holdsWithoutRoot([&] {
    // The peer is of the test's user, as is the daemon that is asked.
    const auto peers = std::make_shared<PeerTable>(std::make_shared<ApplicationManifests>(std::vector<std::string>()));
    const TestDirectory own;
    own.makeDirectory("run");
    const Result<std::unique_ptr<Sandbox>> sandbox = Sandbox::create(peers, own / "run", groups_);
    const UniqueFd client = listener_.connectToIt();
    const Result<std::shared_ptr<Peer>> peer = peers->admit(listener_.accept().get());
    if (!sandbox || !peer || peer.value()->isConfined()) return false;
    const auto check = [&](const std::string &path) {
      return sandbox.value()->checkAccess(peer.value()->auditToken(), writing, SandboxFilter::path, path);
    };
    return check(others) == 0 && check(readOnly) != 0;
  }));
}

TEST_F(SandboxTest, NobodyAndOtherOperationsAreRefused) {
  const std::string path = test_.makeFile("a", "");
  EXPECT_NE(sandbox_->checkAccess(AuditToken(), writing, SandboxFilter::pathNoReport, path), 0);
  EXPECT_NE(sandbox_->checkAccess(admittedSelf()->auditToken(), "file-read-data", SandboxFilter::path, path), 0);
}

TEST_F(SandboxTest, PeerThatIsGoneMayWriteNothing) {
  const std::string path = test_.makeFile("a", "");
  TestPeerProcess process(listener_);
  const std::shared_ptr<Peer> peer = admitted(process.connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(peer);
  EXPECT_EQ(proofs->proveWriteAccess(opened(path, O_RDWR)), std::nullopt);
  EXPECT_TRUE(mayWrite(peer, path));
  process.end();
  EXPECT_FALSE(mayWrite(peer, path));
}

TEST_F(SandboxTest, ConfinedPeerMayWriteWhatItHasProvedUntilThatConnectionCloses) {
  const std::string path = test_.makeFile("a", "");
  const std::string other = test_.makeFile("b", "");
  const TestPeerProcess process(listener_, giveUpNewPrivileges);
  const std::shared_ptr<Peer> client = admitted(process.connection());
  const std::shared_ptr<Peer> onPlatformSocket = admitted(process.secondConnection());
  EXPECT_FALSE(mayWrite(client, path));

  std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(onPlatformSocket);
  std::unique_ptr<WriteProofs> moreProofs = sandbox_->proofsOf(onPlatformSocket);
  EXPECT_EQ(proofs->proveWriteAccess(opened(path, O_WRONLY)), std::nullopt);
  EXPECT_TRUE(mayWrite(client, path));
  EXPECT_FALSE(mayWrite(client, other));
  EXPECT_EQ(moreProofs->proveWriteAccess(opened(path, O_RDWR | O_APPEND)), std::nullopt);
  EXPECT_EQ(moreProofs->proveWriteAccess(opened(other, O_RDWR)), std::nullopt);
  EXPECT_TRUE(mayWrite(client, other));
  proofs.reset();
  EXPECT_TRUE(mayWrite(client, path)) << "proved by the other connection";
  moreProofs.reset();
  EXPECT_FALSE(mayWrite(client, path));
  EXPECT_FALSE(mayWrite(client, other));
}

TEST_F(SandboxTest, ProofOfOneProcessDoesNotCountForAnother) {
  const std::string path = test_.makeFile("a", "");
  const TestPeerProcess first(listener_, giveUpNewPrivileges);
  const TestPeerProcess second(listener_, giveUpNewPrivileges);
  const std::shared_ptr<Peer> prover = admitted(first.connection());
  const std::shared_ptr<Peer> other = admitted(second.connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(prover);
  EXPECT_EQ(proofs->proveWriteAccess(opened(path, O_RDWR)), std::nullopt);
  EXPECT_TRUE(mayWrite(prover, path));
  EXPECT_FALSE(mayWrite(other, path));
}

TEST_F(SandboxTest, ProofIsOfTheFileAndNotOfItsName) {
  const std::string path = test_.makeFile("a", "");
  const TestPeerProcess process(listener_, giveUpNewPrivileges);
  const std::shared_ptr<Peer> peer = admitted(process.connection());
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(peer);
  EXPECT_EQ(proofs->proveWriteAccess(opened(path, O_RDWR)), std::nullopt);
  EXPECT_TRUE(mayWrite(peer, test_.makeLink("link", path)));
  std::filesystem::rename(path, test_ / "renamed");
  EXPECT_TRUE(mayWrite(peer, test_ / "renamed"));
  EXPECT_FALSE(mayWrite(peer, path));
  test_.makeFile("a", "");
  EXPECT_FALSE(mayWrite(peer, path));
  // The number of the file's inode is not given to another one while the proof counts.
  std::filesystem::remove(test_ / "renamed");
  for (int i = 0; i < 100; ++i) EXPECT_FALSE(mayWrite(peer, test_.makeFile("new" + std::to_string(i), "")));
}

TEST_F(SandboxTest, DescriptorThatProvesNothingIsRefused) {
  const std::string path = test_.makeFile("a", "");
  const std::shared_ptr<Peer> peer = admittedSelf();
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(peer);
  const auto refusal = [&proofs](UniqueFd fd) {
    const std::optional<SandboxFailure> failure = proofs->proveWriteAccess(std::move(fd));
    EXPECT_TRUE(!failure || failure->kind == Kind::noProof);
    return failure ? failure->text : "accepted";
  };
  EXPECT_THAT(refusal(UniqueFd()), HasSubstr("not open."));
  EXPECT_THAT(refusal(opened(path, O_RDONLY)), HasSubstr("not open for writing"));
  EXPECT_THAT(refusal(opened(path, O_PATH)), HasSubstr("not open for writing"));
  EXPECT_THAT(refusal(opened(path, O_PATH | O_RDWR)), HasSubstr("not open for writing"));
  EXPECT_THAT(refusal(opened(test_.path(), O_RDONLY | O_DIRECTORY)), HasSubstr("not open for writing"));
  EXPECT_THAT(refusal(opened("/dev/null", O_RDWR)), HasSubstr("not a regular file"));
  EXPECT_THAT(refusal(UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0))), HasSubstr("not a regular file"));
  EXPECT_THAT(refusal(UniqueFd(::memfd_create("x", MFD_CLOEXEC))), HasSubstr("no name"));
  UniqueFd deleted = opened(path, O_RDWR);
  std::filesystem::remove(path);
  EXPECT_THAT(refusal(std::move(deleted)), HasSubstr("no name"));
}

TEST_F(SandboxTest, ProofsAreLimitedPerConnectionAndAltogether) {
  rlimit limit{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
  limit.rlim_cur = limit.rlim_max;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
  const std::shared_ptr<Peer> peer = admittedSelf();
  int made = 0;
  const auto proveNew = [&](WriteProofs &proofs) {
    return proofs.proveWriteAccess(opened(test_ / std::to_string(made++), O_RDWR | O_CREAT));
  };
  std::vector<std::unique_ptr<WriteProofs>> connections;
  for (std::size_t connection = 0; connection < Sandbox::proofsAltogether / Sandbox::proofsPerConnection;
       ++connection) {
    connections.push_back(sandbox_->proofsOf(peer));
    for (std::size_t i = 0; i < Sandbox::proofsPerConnection; ++i)
      EXPECT_EQ(proveNew(*connections.back()), std::nullopt);
    EXPECT_EQ(connections.back()->proveWriteAccess(opened(test_ / std::to_string(made - 1), O_RDWR)), std::nullopt)
        << "the same file again";
    EXPECT_EQ(proveNew(*connections.back())->kind, Kind::limitExceeded);
  }
  connections.push_back(sandbox_->proofsOf(peer));
  EXPECT_EQ(proveNew(*connections.back())->kind, Kind::limitExceeded);
  connections.erase(connections.begin());
  EXPECT_EQ(proveNew(*connections.back()), std::nullopt);
}

TEST_F(SandboxTest, ProofsMayOutliveTheSandbox) {
  const std::unique_ptr<WriteProofs> proofs = sandbox_->proofsOf(admittedSelf());
  sandbox_.reset();
  EXPECT_EQ(proofs->proveWriteAccess(opened(test_.makeFile("a", ""), O_RDWR)), std::nullopt);
}

// --- Tokens

TEST_F(SandboxTest, TokenOpensItsDocumentForReadingAndWriting) {
  const std::string path = test_.makeFile("groups/group.a/Storix Storage/a b%é", "content");
  const std::optional<std::string> token = tokenFor(path);
  ASSERT_TRUE(token);
  const auto result = sandbox_->consume(*token);
  const UniqueFd *fd = std::get_if<UniqueFd>(&result);
  ASSERT_TRUE(fd);
  std::array<char, 16> buffer{};
  EXPECT_EQ(::read(fd->get(), buffer.data(), buffer.size()), 7);
  EXPECT_EQ(::pwrite(fd->get(), "C", 1, 0), 1);
  EXPECT_EQ(test_.contentOf("groups/group.a/Storix Storage/a b%é"), "Content");
  EXPECT_EQ(::fcntl(fd->get(), F_GETFD), FD_CLOEXEC);
  EXPECT_EQ(::fcntl(fd->get(), F_GETFL) & (O_ACCMODE | O_NONBLOCK), O_RDWR);
}

TEST_F(SandboxTest, TokenIsOfThePathSoASavedDocumentIsTheSame) {
  const std::string path = storage_ + "/a";
  const std::optional<std::string> token = tokenFor(path);
  ASSERT_TRUE(token) << "what is not provided yet gets a token too";
  EXPECT_EQ(failureOf(*token), Kind::unavailable);
  EXPECT_FALSE(std::filesystem::exists(path)) << "a missing document is not made";
  test_.makeFile("groups/group.a/Storix Storage/new", "");
  std::filesystem::rename(storage_ + "/new", path);
  EXPECT_EQ(failureOf(*token), std::nullopt);
}

TEST_F(SandboxTest, TokenOutlivesTheDaemonButNotItsKey) {
  const std::optional<std::string> token = tokenFor(test_.makeFile("groups/group.a/a", ""));
  ASSERT_TRUE(token);
  sandbox_ = makeSandbox();
  EXPECT_EQ(failureOf(*token), std::nullopt);
  std::filesystem::remove(test_ / "run/token-key");
  sandbox_ = makeSandbox();
  EXPECT_EQ(failureOf(*token), Kind::invalidToken);
  EXPECT_EQ(failureOf(""), Kind::invalidToken);
  EXPECT_EQ(failureOf(std::string("\0\xFF", 2)), Kind::invalidToken);
}

TEST_F(SandboxTest, ForgedTokenIsRefusedBeforeAnythingThatItSaysIsLookedAt) {
  // All of a token's form, and naming what a true one would open or make.
  const std::string payload = "w" + std::string(16, 'r') + storage_ + "/.companion";
  const auto encoded = [](const std::string &bytes) {
    std::string text(sodium_base64_encoded_len(bytes.size(), sodium_base64_VARIANT_URLSAFE_NO_PADDING), '\0');
    sodium_bin2base64(text.data(), text.size(), reinterpret_cast<const unsigned char *>(bytes.data()), bytes.size(),
                      sodium_base64_VARIANT_URLSAFE_NO_PADDING);
    text.pop_back();
    return text;
  };
  TestLog log;
  for (const std::string &mac : {std::string(32, '\0'), std::string(32, '\xFF'), std::string(), std::string(31, 'm')}) {
    const auto [kind, text] = consumed("storix1." + encoded(payload) + "." + encoded(mac));
    EXPECT_EQ(kind, Kind::invalidToken);
    EXPECT_EQ(text, "The token was not made here, or before the system was last started. Ask for a new one.");
  }
  EXPECT_FALSE(std::filesystem::exists(storage_ + "/.companion"));
  EXPECT_THAT(log.take(), ElementsAre());
}

TEST_F(SandboxTest, OnlyWhatLiesInAGroupContainerGetsAToken) {
  const std::string outside = test_.makeFile("outside", "");
  test_.makeFile("groups2/group.a/a", "");
  test_.makeFile("groups/loose", "");
  test_.makeLink("groups/group.a/out", outside);
  test_.makeLink("groups/group.a/directory", test_.path());
  test_.makeLink("in", groups_);
  for (const std::string &path :
       {outside, groups_ + "/loose", groups_ + "/absent", groups_, groups_ + "/", test_ / "groups2/group.a/a",
        groups_ + "/group.a/../../outside", groups_ + "/group.a/absent/../../../outside", groups_ + "/group.a/out",
        groups_ + "/group.a/directory/outside", groups_ + "/group.a/directory/absent", std::string("/etc/passwd"),
        std::string("groups/group.a/a"), std::string(), groups_ + "/group.a/a" + std::string(1, '\0')}) {
    EXPECT_EQ(tokenFor(path), std::nullopt) << path;
  }
  EXPECT_TRUE(tokenFor(test_ / "in/group.a/a")) << "reached by a link, and yet inside";
  EXPECT_TRUE(tokenFor(groups_ + "/group.a/absent/deeper"));
}

TEST_F(SandboxTest, ReasonForNoTokenIsLogged) {
  TestLog log;
  EXPECT_EQ(tokenFor("/etc/passwd"), std::nullopt);
  EXPECT_EQ(tokenFor(storage_), std::nullopt);
  EXPECT_EQ(tokenFor("\n[ERROR] x"), std::nullopt);
  EXPECT_THAT(log.take(), ElementsAre("[INFO] No token for /etc/passwd: it is in no group container",
                                      "[INFO] No token for " + storage_ + ": it is not a regular file",
                                      StartsWith("[INFO] No token for \\n[ERROR] x: it cannot be looked at: ")));
}

TEST_F(SandboxTest, WithoutContainersThereIsNoToken) {
  std::filesystem::remove_all(groups_);
  EXPECT_EQ(tokenFor(groups_ + "/group.a/a"), std::nullopt);
}

TEST_F(SandboxTest, OnlyARegularFileGetsATokenAndIsOpened) {
  EXPECT_EQ(tokenFor(storage_), std::nullopt);
  EXPECT_EQ(tokenFor(storage_ + "/."), std::nullopt);
  ASSERT_EQ(::mkfifo((storage_ + "/fifo").c_str(), 0600), 0);
  EXPECT_EQ(tokenFor(storage_ + "/fifo"), std::nullopt);

  const std::string path = storage_ + "/a";
  const std::optional<std::string> token = tokenFor(path);
  ASSERT_TRUE(token);
  std::filesystem::create_directory(path);
  EXPECT_EQ(failureOf(*token), Kind::notAFile);
  std::filesystem::remove(path);
  ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
  EXPECT_EQ(failureOf(*token), Kind::notAFile);
  std::filesystem::remove(path);
  const TestListener socket;
  sockaddr_un address{AF_UNIX, {}};
  const std::string shortPath = test_ / "s";
  shortPath.copy(address.sun_path, sizeof address.sun_path - 1);
  const UniqueFd bound(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  ASSERT_EQ(::bind(bound.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  std::filesystem::rename(shortPath, path);
  EXPECT_EQ(failureOf(*token), Kind::notAFile);
}

TEST_F(SandboxTest, DocumentReplacedByALinkIsNotOpened) {
  test_.makeFile("groups/group.a/sub/a", "");
  test_.makeFile("elsewhere/a", "");
  const std::optional<std::string> token = tokenFor(groups_ + "/group.a/sub/a");
  ASSERT_TRUE(token);
  EXPECT_EQ(failureOf(*token), std::nullopt);
  std::filesystem::remove(groups_ + "/group.a/sub/a");
  test_.makeLink("groups/group.a/sub/a", test_ / "elsewhere/a");
  EXPECT_EQ(failureOf(*token), Kind::notAFile);
  std::filesystem::remove_all(groups_ + "/group.a/sub");
  test_.makeLink("groups/group.a/sub", test_ / "elsewhere");
  EXPECT_EQ(failureOf(*token), Kind::notAFile);
  const std::optional<std::string> companion = tokenFor(groups_ + "/group.a/.c");
  ASSERT_TRUE(companion);
  test_.makeLink("groups/group.a/.c", test_ / "made");
  EXPECT_EQ(failureOf(*companion), Kind::notAFile);
  EXPECT_FALSE(std::filesystem::exists(test_ / "made"));
}

TEST_F(SandboxTest, MissingCompanionIsMadeWhereItsDirectoryExists) {
  const std::optional<std::string> companion = tokenFor(storage_ + "/.a");
  const std::optional<std::string> tooDeep = tokenFor(storage_ + "/absent/.a");
  ASSERT_TRUE(companion && tooDeep);
  EXPECT_EQ(failureOf(*companion), std::nullopt);
  struct stat status {};
  ASSERT_EQ(::stat((storage_ + "/.a").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFREG | 0600U);
  EXPECT_EQ(failureOf(*tooDeep), Kind::unavailable);
  EXPECT_FALSE(std::filesystem::exists(storage_ + "/absent"));
  const std::optional<std::string> hiddenDirectory = tokenFor(storage_ + "/.hidden/a");
  ASSERT_TRUE(hiddenDirectory);
  std::filesystem::create_directory(storage_ + "/.hidden");
  EXPECT_EQ(failureOf(*hiddenDirectory), Kind::unavailable) << "the name itself must begin with a dot";
}

TEST_F(SandboxTest, RefusalOfTheSystemIsToldWithItsReason) {
  const std::optional<std::string> token = tokenFor(test_.makeFile("groups/group.a/sub/a", ""));
  ASSERT_TRUE(token);
  std::filesystem::remove_all(groups_ + "/group.a/sub");
  EXPECT_THAT(consumed(*token).second, HasSubstr("No such file or directory"));
  test_.makeFile("groups/group.a/sub", "");
  EXPECT_EQ(failureOf(*token), Kind::unavailable);
  EXPECT_THAT(consumed(*token).second, HasSubstr("Not a directory"));
}

TEST_F(SandboxTest, WithoutARuntimeDirectoryThereIsAnError) {
  EXPECT_FALSE(Sandbox::create(peers_, test_ / "absent", groups_));
}

}  // namespace
}  // namespace storix::linuxhost
