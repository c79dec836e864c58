// Attacks on the platform's own services: other people's claims, tokens that are none, descriptors that
// prove nothing, notifications that somebody has no right to post.

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

class HostilePlatform : public HostileTest {
 protected:
  static Message begin(const char *method, const std::string &url) {
    return Message::platform("FileCoordination", method, "sas", Body().string(url).number(0));
  }
  static Message end(const char *method, std::uint64_t claim) {
    return Message::platform("FileCoordination", method, "t", Body().longNumber(claim));
  }
  /// The claim in the answer to a begin: behind the absent error an array of one number.
  static std::uint64_t claimIn(const RawAnswer &answer) {
    std::uint64_t claim = 0;
    EXPECT_GE(answer.body.size(), sizeof claim);
    answer.body.copy(reinterpret_cast<char *>(&claim), sizeof claim, answer.body.size() - sizeof claim);
    return claim;
  }
  std::uint64_t claimOf(RawClient &client, const char *method, const std::string &url) {
    EXPECT_TRUE(client.send(begin(method, url)));
    const std::optional<RawAnswer> answer = client.read();
    EXPECT_TRUE(answer && answer->errorName.empty());
    return answer ? claimIn(*answer) : 0;
  }
  static Message consume(std::string_view token) {
    return Message::platform("Sandbox", "Consume", "ay",
                             Body().number(static_cast<std::uint32_t>(token.size())).raw(token));
  }
  std::string tokenOf(const std::string &item) {
    const Result<GrantedDocument> granted = bystander->extendSandbox(itemURL(docs, item), docs, "org.sample.editor");
    EXPECT_TRUE(granted && granted.value().token);
    return granted && granted.value().token ? granted.value().token->bytes : "";
  }
  static std::string prove(const RawClient &sender, RawClient &client, int descriptor, std::uint32_t index = 0) {
    static std::uint32_t serial = 100;
    Message message = Message::platform("Sandbox", "ProveWriteAccess", "h", Body().number(index)).numbered(++serial);
    message.fields.push_back({9, {'u', "1"}});
    if (!sender.sendWithDescriptors(message.bytes(), descriptor, 1)) return "closed";
    const std::optional<RawAnswer> answer = client.readAnswerTo(serial);
    return answer ? answer->errorName : "closed";
  }
  [[nodiscard]] std::string outsideURL(const std::string &name) const {
    return URL::fileURLWithPath((session.directory() / name).string())->absoluteString();
  }
};

TEST_F(HostilePlatform, ClaimsOfOthersAreNotEnded) {
  startWithBystander();
  {
    RawClient owner = platformClient();
    RawClient thief = platformClient();
    const std::uint64_t claim = claimOf(owner, "BeginWrite", outsideURL("file"));
    for (std::uint64_t tried : {claim, claim + 1, std::uint64_t{0}, ~std::uint64_t{0}}) {
      EXPECT_EQ(noSuchClaim, thief.call(end("EndWrite", tried))) << tried;
    }
    EXPECT_EQ("", owner.call(end("EndWrite", claim)));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, ClaimIsNotEndedTwiceNorAsTheOtherKind) {
  startWithBystander();
  {
    RawClient client = platformClient();
    const std::uint64_t claim = claimOf(client, "BeginRead", outsideURL("file"));
    EXPECT_EQ(noSuchClaim, client.call(end("EndWrite", claim)));
    EXPECT_EQ("", client.call(end("EndRead", claim)));
    EXPECT_EQ(noSuchClaim, client.call(end("EndRead", claim)));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, ClaimsOfAConnectionAreLimitedAndEndWithIt) {
  startWithBystander();
  {
    RawClient hoarder = platformClient();
    for (int i = 0; i < 4096; ++i) {
      ASSERT_EQ("", hoarder.call(begin("BeginWrite", outsideURL("file-" + std::to_string(i)))));
    }
    EXPECT_EQ("com.tessel.Platform.Error.Busy", hoarder.call(begin("BeginRead", outsideURL("one-more"))));
    RawClient other = platformClient();
    EXPECT_EQ("", other.call(begin("BeginRead", outsideURL("one-more"))));
  }
  {
    RawClient other = platformClient();
    EXPECT_EQ("", other.call(begin("BeginWrite", outsideURL("file-0"))));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, URLsThatAreNoneAreNotClaimed) {
  startWithBystander();
  {
    RawClient client = platformClient();
    for (const char *url : {"", "x", "file:///a%00", "file:///a%2f", "file://host/a", "http:///a", "file:///a?b"}) {
      EXPECT_EQ(invalidArgs, client.call(begin("BeginRead", url))) << url;
      EXPECT_EQ(invalidArgs, client.call(begin("BeginWrite", url))) << url;
    }
  }
  expectHealthy();
}

TEST_F(HostilePlatform, TokensThatWereNotIssuedOpenNothing) {
  startWithBystander();
  const std::string token = tokenOf("report");
  {
    RawClient client = platformClient();
    std::string flipped = token;
    flipped[token.size() / 2] = flipped[token.size() / 2] == 'A' ? 'B' : 'A';
    const std::size_t dot = token.rfind('.');
    for (const std::string &forged :
         {std::string(), std::string("storix1."), token.substr(0, token.size() - 1), token + "A", flipped,
          token.substr(0, dot) + "." + std::string(token.size() - dot - 1, 'A'), token + std::string(900000, 'A'),
          std::string(1, '\0') + token, token.substr(0, dot) + token.substr(dot) + token.substr(dot)}) {
      EXPECT_EQ(invalidToken, client.call(consume(forged))) << forged.substr(0, 200);
    }
    EXPECT_EQ("", client.call(consume(token)));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, TokenOfAnotherSessionOpensNothing) {
  startWithBystander();
  std::string foreign;
  {
    Session other;
    other.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": true})");
    other.installProvider(docs);
    const std::unique_ptr<Process> otherDaemon = other.startDaemon();
    ClientOptions options;
    options.runtimeDirectory = other.runtimeDirectory().string();
    options.timeout = deadline;
    Client client(options);
    const auto granted = client.extendSandbox(*URL::fileURLWithPath((other.storage(docs) / "x").string()), docs, "c");
    ASSERT_TRUE(granted && granted.value().token);
    foreign = granted.value().token->bytes;
  }
  {
    RawClient client = platformClient();
    EXPECT_EQ(invalidToken, client.call(consume(foreign)));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, TokenOfAFileThatBecameALinkOrADirectoryOpensNothing) {
  startWithBystander();
  const std::string token = tokenOf("report");
  const fs::path file = session.storage(docs) / "report";
  {
    RawClient client = platformClient();
    fs::remove(file);
    fs::create_symlink("/etc/passwd", file);
    EXPECT_EQ(notAFile, client.call(consume(token)));
    fs::remove(file);
    fs::create_directory(file);
    EXPECT_EQ(notAFile, client.call(consume(token)));
    fs::remove(file);
    ASSERT_EQ(0, ::mkfifo(file.c_str(), 0600));
    EXPECT_EQ(notAFile, client.call(consume(token)));
    fs::remove(file);
  }
  expectHealthy();
}

TEST_F(HostilePlatform, StorageThatBecameALinkGivesNothingOutside) {
  startWithBystander();
  const std::string token = tokenOf("report");
  const fs::path storage = session.storage(docs);
  const fs::path aside = storage.parent_path() / "aside";
  session.write(session.directory() / "report", "a file of the user's");
  fs::rename(storage, aside);
  fs::create_directory_symlink(session.directory(), storage);
  {
    RawClient client = platformClient();
    EXPECT_NE("", client.call(consume(token)));
  }
  fs::remove(storage);
  fs::rename(aside, storage);
  expectHealthy();
}

TEST_F(HostilePlatform, DocumentOutsideEveryContainerGetsNoToken) {
  startWithBystander();
  const auto granted = bystander->extendSandbox(*URL::fileURLWithPath("/etc/passwd"), docs, "org.sample.editor");
  EXPECT_TRUE(!granted || !granted.value().token);
  expectHealthy();
}

TEST_F(HostilePlatform, DescriptorsThatProveNothingAreRefused) {
  startWithBystander();
  {
    RawClient client = platformClient();
    std::array<int, 2> pipe{-1, -1};
    ASSERT_EQ(0, ::pipe2(pipe.data(), O_CLOEXEC));
    const UniqueFd reading(pipe[0]);
    const UniqueFd writing(pipe[1]);
    const UniqueFd directory(::open("/tmp", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const UniqueFd device(::open("/dev/null", O_RDWR | O_CLOEXEC));
    const fs::path file = session.storage(docs) / "report";
    const UniqueFd readOnly(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
    const UniqueFd pathOnly(::open(file.c_str(), O_PATH | O_CLOEXEC));
    const UniqueFd writable(::open(file.c_str(), O_RDWR | O_CLOEXEC));
    for (const UniqueFd *fd : {&writing, &directory, &device, &readOnly, &pathOnly}) {
      EXPECT_EQ(noProof, prove(client, client, fd->get())) << fd->get();
    }
    EXPECT_EQ(noProof, prove(client, client, client.fd()));
    EXPECT_EQ("", prove(client, client, writable.get()));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, DescriptorThatWasNotSentIsNoArgument) {
  startWithBystander();
  {
    RawClient client = platformClient();
    const std::string error = client.call(Message::platform("Sandbox", "ProveWriteAccess", "h", Body().number(0)));
    EXPECT_TRUE(error == invalidArgs || error == "closed") << error;
  }
  {
    RawClient client = platformClient();
    const UniqueFd device(::open("/dev/null", O_RDWR | O_CLOEXEC));
    const std::string error = prove(client, client, device.get(), 7);
    EXPECT_TRUE(error == invalidArgs || error == "closed") << error;
  }
  expectHealthy();
}

TEST_F(HostilePlatform, ProofsOfAConnectionAreLimitedAndEndWithIt) {
  startWithBystander();
  {
    RawClient client = platformClient();
    for (int i = 0; i < 256; ++i) {
      const fs::path file = session.directory() / ("proof-" + std::to_string(i));
      session.write(file, "");
      const UniqueFd fd(::open(file.c_str(), O_RDWR | O_CLOEXEC));
      ASSERT_EQ("", prove(client, client, fd.get())) << i;
    }
    session.write(session.directory() / "one-more", "");
    const UniqueFd fd(::open((session.directory() / "one-more").c_str(), O_RDWR | O_CLOEXEC));
    EXPECT_EQ(limitsExceeded, prove(client, client, fd.get()));
  }
  expectHealthy();
}

TEST_F(HostilePlatform, ConfinedProcessPostsNoNotification) {
  startWithBystander();
  const Finished finished =
      run({"bwrap", "--ro-bind", "/", "/", "--dev", "/dev", "--proc", "/proc", "--die-with-parent", "busctl",
           "--address=unix:path=" + session.platformSocket().string(), "call", "com.tessel.Platform",
           "/com/tessel/Platform", "com.tessel.Platform.Notifications", "Post", "s", "com.tessel.lockstate"},
          session.environment);
  EXPECT_NE(0, finished.status);
  EXPECT_TRUE(daemon->waitForLine(std::string("a confined process posts no notifications (") + accessDenied + ")"));
  expectHealthy();
}

TEST_F(HostilePlatform, StoppedProcessWithAClaimKeepsNobodyElseWaiting) {
  startWithBystander();
  {
    // The other end of this connection neither reads nor writes, as that of a stopped process.
    RawClient stopped = platformClient();
    ASSERT_EQ("", stopped.call(begin("BeginWrite", outsideURL("mine"))));
    RawClient other = platformClient();
    ASSERT_TRUE(other.send(begin("BeginRead", outsideURL("mine")).numbered(2)));
    for (std::uint32_t serial = 3; serial < 100; ++serial) {
      EXPECT_EQ("", other.call(begin("BeginRead", outsideURL("not-mine")).numbered(serial)));
    }
  }
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
