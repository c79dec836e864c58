#include "platform/linux/identity/Tokens.h"

#include <gmock/gmock.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::MatchesRegex;

TokenSealer sealerIn(const TestDirectory &directory) {
  Result<TokenSealer> sealer = TokenSealer::open(directory.path());
  if (!sealer) ADD_FAILURE() << sealer.error().message();
  return sealer.value();
}

TokenPayload sample() { return {SandboxExtensionClass::readWrite, "/groups/group.a/Storix Storage/é %"}; }

TEST(Tokens, WhatWasSealedIsUnsealed) {
  const TestDirectory directory;
  const TokenSealer sealer = sealerIn(directory);
  EXPECT_EQ(sealer.unseal(sealer.seal(sample())), sample());
  const TokenPayload longest{SandboxExtensionClass::readWrite, "/" + std::string(4095, 'a')};
  EXPECT_EQ(sealer.unseal(sealer.seal(longest)), longest);
}

TEST(Tokens, TextHasTheDocumentedForm) {
  const TestDirectory directory;
  EXPECT_THAT(sealerIn(directory).seal(sample()), MatchesRegex("storix1[.][A-Za-z0-9_-]+[.][A-Za-z0-9_-]{43}"));
}

TEST(Tokens, TwoTokensForOnePathDiffer) {
  const TestDirectory directory;
  const TokenSealer sealer = sealerIn(directory);
  EXPECT_NE(sealer.seal(sample()), sealer.seal(sample()));
}

TEST(Tokens, EveryChangedByteIsSeen) {
  const TestDirectory directory;
  const TokenSealer sealer = sealerIn(directory);
  const std::string token = sealer.seal(sample());
  for (std::size_t i = 0; i < token.size(); ++i) {
    for (const char other : {'A', 'B', '.', '=', '\0', '/'}) {
      if (token[i] == other) continue;
      std::string forged = token;
      forged[i] = other;
      EXPECT_EQ(sealer.unseal(forged), std::nullopt) << i;
    }
  }
}

TEST(Tokens, BytesThatADecoderTakesForLettersAreRefused) {
  const TestDirectory directory;
  const TokenSealer sealer = sealerIn(directory);
  std::string token = sealer.seal(sample());
  // There are such bytes for "_" alone, so there must be one after the last dot.
  while (token.rfind('_') == std::string::npos || token.rfind('_') < token.rfind('.')) token = sealer.seal(sample());
  for (std::size_t i = 0; i < token.size(); ++i) {
    for (int other = 128; other < 256; ++other) {
      std::string forged = token;
      forged[i] = static_cast<char>(other);
      EXPECT_EQ(sealer.unseal(forged), std::nullopt) << i << " " << other;
    }
  }
}

TEST(Tokens, CutOrExtendedTokenIsRefused) {
  const TestDirectory directory;
  const TokenSealer sealer = sealerIn(directory);
  const std::string token = sealer.seal(sample());
  for (std::size_t length = 0; length < token.size(); ++length) {
    EXPECT_EQ(sealer.unseal(token.substr(0, length)), std::nullopt) << length;
  }
  for (const std::string &more :
       {std::string("A"), std::string("="), std::string("\n"), std::string(1, '\0'), "." + token}) {
    EXPECT_EQ(sealer.unseal(token + more), std::nullopt);
    EXPECT_EQ(sealer.unseal(more + token), std::nullopt);
  }
  EXPECT_EQ(sealer.unseal(token + std::string(1000000, 'A')), std::nullopt);
  EXPECT_EQ(sealer.unseal("storix1."), std::nullopt);
  EXPECT_EQ(sealer.unseal("storix1.."), std::nullopt);
  EXPECT_EQ(sealer.unseal("storix1"), std::nullopt);
}

TEST(Tokens, TokenOfAnotherKeyIsRefused) {
  const TestDirectory first;
  const TestDirectory second;
  EXPECT_EQ(sealerIn(second).unseal(sealerIn(first).seal(sample())), std::nullopt);
}

TEST(Tokens, KeyOutlivesTheDaemonAndIsPrivate) {
  const TestDirectory directory;
  const std::string token = sealerIn(directory).seal(sample());
  EXPECT_EQ(sealerIn(directory).unseal(token), sample());
  EXPECT_THAT(directory.names(), ElementsAre("token-key"));
  struct stat status {};
  ASSERT_EQ(::stat((directory / "token-key").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
  EXPECT_EQ(status.st_size, 32);
}

TEST(Tokens, KeyThatWasNotWrittenHereIsReplaced) {
  const TestDirectory directory;
  const std::string path = directory / "token-key";
  const auto replaced = [&](const char *what) {
    struct stat status {};
    const TokenSealer sealer = sealerIn(directory);
    ASSERT_EQ(::lstat(path.c_str(), &status), 0) << what;
    EXPECT_TRUE(S_ISREG(status.st_mode)) << what;
    EXPECT_EQ(status.st_mode & 07777, 0600U) << what;
    EXPECT_EQ(status.st_size, 32) << what;
    EXPECT_EQ(status.st_nlink, 1U) << what;
    EXPECT_NE(directory.contentOf("token-key"), std::string(32, 'k')) << what;
    EXPECT_EQ(sealerIn(directory).unseal(sealer.seal(sample())), sample()) << what;
  };
  const auto plant = [&](std::size_t size, mode_t mode) {
    std::filesystem::remove(path);
    directory.makeFile("token-key", std::string(size, 'k'));
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
  };
  plant(31, 0600);
  replaced("too short");
  plant(33, 0600);
  replaced("too long");
  plant(0, 0600);
  replaced("empty");
  plant(32, 0640);
  replaced("open to others");
  plant(32, 0600);
  std::filesystem::create_hard_link(path, directory / "second name");
  replaced("known by another name");
  plant(32, 0600);
  std::filesystem::rename(path, directory / "elsewhere");
  directory.makeLink("token-key", "elsewhere");
  replaced("a link");
  EXPECT_EQ(directory.contentOf("elsewhere"), std::string(32, 'k'));
  std::filesystem::remove(path);
  ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
  replaced("a FIFO");
  directory.makeFile(".token-key.new", "left by a crash");
  plant(1, 0600);
  replaced("beside what a crash left");
  plant(32, 0600);
  EXPECT_EQ(sealerIn(directory).unseal(sealerIn(directory).seal(sample())), sample());
  EXPECT_EQ(directory.contentOf("token-key"), std::string(32, 'k')) << "a good key stays";
}

TEST(Tokens, ReplacedKeyIsLoggedAndANewOneIsNot) {
  TestLog log;
  const TestDirectory directory;
  sealerIn(directory);
  sealerIn(directory);
  EXPECT_THAT(log.take(), ElementsAre());
  directory.makeFile("token-key", "short");
  sealerIn(directory);
  EXPECT_THAT(log.take(), ElementsAre("[NOTICE] Replacing the token key in " + directory.path() +
                                      ", which was not written by this daemon."));
}

TEST(Tokens, WithoutAKeyThereIsAnErrorThatNamesTheDirectory) {
  const TestDirectory directory;
  directory.makeDirectory("token-key");
  const Result<TokenSealer> noFile = TokenSealer::open(directory.path());
  ASSERT_FALSE(noFile);
  EXPECT_EQ(noFile.error().code(), EISDIR);
  EXPECT_THAT(noFile.error().message(), ::testing::HasSubstr(directory.path()));
  EXPECT_THAT(directory.names(), ElementsAre("token-key"));
  EXPECT_EQ(TokenSealer::open(directory / "absent").error().code(), ENOENT);
}

}  // namespace
}  // namespace storix::linuxhost
