#include "FolderProvider.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <thread>
#include <vector>

#include "ProviderCalls.h"
#include "TemporaryFolder.h"

namespace storix::example {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;

class FolderProviderTest : public ProviderCalls {
 protected:
  void SetUp() override {
    for (const char *name : {"source", "docs.appdex", "group", "group/Storix Storage"}) {
      fs::create_directory(folder_.path(name));
    }
    writeInfo(R"({ "KTBundleIdentifier": "org.sample.docs", "FolderProviderSource": "../source" })");
  }

  void writeInfo(const std::string &text) { folder_.write("docs.appdex/Info.kvs", text); }

  FolderProvider &provider() {
    if (!provider_) {
      provider_ =
          std::make_unique<FolderProvider>(ProviderEnvironment{folder_.path("docs.appdex"), folder_.path("group")});
    }
    return *provider_;
  }

  ProviderExtension &extension() override { return provider(); }
  [[nodiscard]] URL item(const std::string &path) const override {
    return *URL::fileURLWithPath(folder_.path("group/Storix Storage/" + path));
  }
  std::string copy(const std::string &path) { return folder_.read("group/Storix Storage/" + path); }
  bool isProvided(const std::string &path) { return fs::exists(folder_.path("group/Storix Storage/" + path)); }

  Result<std::string> identifier(const URL &url) {
    return answer<Result<std::string>>([&](auto done) { provider().itemIdentifier(url, done); });
  }
  Result<URL> url(const std::string &identifier) {
    return answer<Result<URL>>([&](auto done) { provider().itemURL(identifier, done); });
  }

  TemporaryFolder folder_;
  std::unique_ptr<FolderProvider> provider_;
};

TEST_F(FolderProviderTest, InitialSetupMakesTheProvidedItemsDirectory) {
  fs::remove(folder_.path("group/Storix Storage"));
  EXPECT_EQ(setUp(), std::nullopt);
  EXPECT_TRUE(fs::is_directory(folder_.path("group/Storix Storage")));
}

TEST_F(FolderProviderTest, InitialSetupSaysWhatIsWrongWithTheSource) {
  for (const char *info : {"", "[]", "{}", R"({"FolderProviderSource": 1})", R"({"FolderProviderSource": ""})"}) {
    writeInfo(info);
    const auto error = setUp();
    ASSERT_TRUE(error.has_value()) << info;
    EXPECT_THAT(error->message(), HasSubstr("Info.kvs")) << info;
  }
  writeInfo(R"({"FolderProviderSource": "/nowhere/at/all"})");
  EXPECT_THAT(setUp()->message(), HasSubstr("/nowhere/at/all"));
  fs::remove(folder_.path("docs.appdex/Info.kvs"));
  EXPECT_TRUE(setUp().has_value());
}

TEST_F(FolderProviderTest, TheSourceMayBeAbsolute) {
  folder_.write("docs.appdex/Info.kvs", R"({"FolderProviderSource": ")" + folder_.path("source") + R"("})");
  EXPECT_EQ(setUp(), std::nullopt);
}

TEST_F(FolderProviderTest, ItemsAreKnownByTheirPathBothWays) {
  fs::create_directories(folder_.path("source/a b/100%"));
  folder_.write("source/a b/100%/\xC3\xA9.txt", "x");
  const std::string path = "a b/100%/\xC3\xA9.txt";
  EXPECT_EQ(identifier(item(path)).value(), path);
  EXPECT_EQ(url(path).value(), item(path));
}

TEST_F(FolderProviderTest, ADocumentThatIsNotThereIsAnErrorThatNamesIt) {
  fs::create_directory(folder_.path("source/directory"));
  for (const std::string path : {"missing", "directory", "a/missing"}) {
    for (const auto &message : {identifier(item(path)).error().message(), url(path).error().message(),
                                start(path)->message(), changed(path)->message()}) {
      EXPECT_THAT(message, HasSubstr(path));
    }
    EXPECT_FALSE(placeholder(path).ok());
    EXPECT_FALSE(isProvided(path));
  }
  EXPECT_EQ(start("missing")->code(), ENOENT);
  EXPECT_EQ(start("directory")->code(), EISDIR);
}

TEST_F(FolderProviderTest, NothingOutsideIsServed) {
  folder_.write("secret", "s");
  fs::create_symlink(folder_.path("secret"), folder_.path("source/link"));
  for (const std::string path : {"../secret", "a/../../secret", "link", ".hidden", "a/.b", ""}) {
    EXPECT_FALSE(identifier(item(path)).ok()) << path;
    EXPECT_TRUE(start(path).has_value()) << path;
    EXPECT_TRUE(changed(path).has_value()) << path;
  }
  for (const std::string bad : {"../secret", "/etc/passwd", "link", "", "a/../b", "a//b"}) {
    EXPECT_FALSE(url(bad).ok()) << bad;
  }
  EXPECT_FALSE(identifier(*URL::fileURLWithPath(folder_.path("secret"))).ok());
}

TEST_F(FolderProviderTest, StartCopiesTheDocumentWithItsTime) {
  fs::create_directory(folder_.path("source/a"));
  folder_.write("source/a/b", "hello");
  folder_.setModificationTime("source/a/b", 1'000'000'000);
  EXPECT_EQ(start("a/b"), std::nullopt);
  EXPECT_EQ(copy("a/b"), "hello");
  EXPECT_EQ(fs::last_write_time(folder_.path("source/a/b")),
            fs::last_write_time(folder_.path("group/Storix Storage/a/b")));
}

TEST_F(FolderProviderTest, StartRefreshesAnOldCopyAndLeavesTheSameOneAlone) {
  folder_.write("source/a", "old");
  folder_.setModificationTime("source/a", 1'000);
  EXPECT_EQ(start("a"), std::nullopt);
  auto before = FolderTree::open(folder_.path("group/Storix Storage")).value().openFile("a");
  struct stat first {};
  ASSERT_EQ(::fstat(before.value().get(), &first), 0);
  EXPECT_EQ(start("a"), std::nullopt);
  struct stat second {};
  ASSERT_EQ(::stat(item("a").path().c_str(), &second), 0);
  EXPECT_EQ(first.st_ino, second.st_ino) << "the same document was copied again";
  folder_.write("source/a", "newer");
  folder_.setModificationTime("source/a", 2'000);
  EXPECT_EQ(start("a"), std::nullopt);
  EXPECT_EQ(copy("a"), "newer");
}

TEST_F(FolderProviderTest, StartKeepsChangesThatWereNotCopiedBackYet) {
  folder_.write("source/a", "old");
  folder_.setModificationTime("source/a", 1'000);
  folder_.write("group/Storix Storage/a", "changed here");
  EXPECT_EQ(start("a"), std::nullopt);
  EXPECT_EQ(copy("a"), "changed here");
}

TEST_F(FolderProviderTest, AChangedDocumentIsCopiedBack) {
  folder_.write("source/a", "old");
  fs::permissions(folder_.path("source/a"), fs::perms(0640));
  EXPECT_EQ(start("a"), std::nullopt);
  folder_.write("group/Storix Storage/a", "changed here");
  EXPECT_EQ(changed("a"), std::nullopt);
  EXPECT_EQ(folder_.read("source/a"), "changed here");
  EXPECT_EQ(fs::status(folder_.path("source/a")).permissions(), fs::perms(0640));
}

TEST_F(FolderProviderTest, ANewDocumentIsKnownAndCopiedBack) {
  fs::create_directory(folder_.path("group/Storix Storage/new"));
  folder_.write("group/Storix Storage/new/a", "made here");
  EXPECT_EQ(identifier(item("new/a")).value(), "new/a");
  EXPECT_EQ(url("new/a").value(), item("new/a"));
  EXPECT_EQ(changed("new/a"), std::nullopt);
  EXPECT_EQ(folder_.read("source/new/a"), "made here");
}

TEST_F(FolderProviderTest, StopDropsTheCopy) {
  folder_.write("source/a", "x");
  EXPECT_EQ(start("a"), std::nullopt);
  EXPECT_EQ(stop("a"), std::nullopt);
  EXPECT_FALSE(isProvided("a"));
  EXPECT_EQ(folder_.read("source/a"), "x");
  EXPECT_EQ(stop("a"), std::nullopt) << "nothing to drop is no error";
}

TEST_F(FolderProviderTest, StopCopiesChangesBackBeforeItDrops) {
  folder_.write("source/a", "old");
  folder_.setModificationTime("source/a", 1'000);
  EXPECT_EQ(start("a"), std::nullopt);
  folder_.write("group/Storix Storage/a", "changed here");
  EXPECT_EQ(stop("a"), std::nullopt);
  EXPECT_EQ(folder_.read("source/a"), "changed here");
  EXPECT_FALSE(isProvided("a"));
}

TEST_F(FolderProviderTest, StopKeepsTheCopyWhenItsChangesCannotBeCopiedBack) {
  fs::create_directories(folder_.path("source/a/occupied"));
  folder_.write("group/Storix Storage/a", "changed here");
  EXPECT_TRUE(stop("a").has_value());
  EXPECT_EQ(copy("a"), "changed here");
}

TEST_F(FolderProviderTest, ThePlaceholderIsTheCompanionAndDescribesTheDocument) {
  fs::create_directory(folder_.path("source/a"));
  folder_.write("source/a/100% \"\xC3\xA9\"", "hello");
  folder_.setModificationTime("source/a/100% \"\xC3\xA9\"", 1'000, 500'000'000);
  EXPECT_EQ(placeholder("a/100% \"\xC3\xA9\"").value(), item("a/.100% \"\xC3\xA9\""));
  EXPECT_EQ(copy("a/.100% \"\xC3\xA9\""),
            "{\"modificationTime\":1000.5,\"name\":\"100% \\\"\xC3\xA9\\\"\",\"size\":5}\n");
  EXPECT_FALSE(isProvided("a/100% \"\xC3\xA9\""));
}

TEST_F(FolderProviderTest, ANameThatIsNotUTF8HasNoPlaceholder) {
  folder_.write("source/\xFF", "x");
  EXPECT_EQ(placeholder("\xFF").error().code(), EILSEQ);
}

TEST_F(FolderProviderTest, AnOldProcessesLeftoversGoAway) {
  for (const char *tree : {"source", "group/Storix Storage"}) {
    fs::create_directory(folder_.path(std::string(tree) + "/.incoming"));
    folder_.write(std::string(tree) + "/.incoming/1-0", "half");
  }
  provider();
  EXPECT_TRUE(fs::is_empty(folder_.path("source/.incoming")));
  EXPECT_TRUE(fs::is_empty(folder_.path("group/Storix Storage/.incoming")));
}

TEST_F(FolderProviderTest, RequestsForOneItemDoNotDisturbEachOther) {
  folder_.write("source/a", std::string(200'000, 'x'));
  provider();
  std::vector<std::thread> threads;
  threads.reserve(4);
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([this, i] {
      for (int j = 0; j < 10; ++j) EXPECT_EQ((i + j) % 2 == 0 ? start("a") : stop("a"), std::nullopt);
    });
  }
  for (auto &thread : threads) thread.join();
  EXPECT_EQ(start("a"), std::nullopt);
  EXPECT_EQ(copy("a"), folder_.read("source/a"));
  EXPECT_TRUE(fs::is_empty(folder_.path("group/Storix Storage/.incoming")));
}

}  // namespace
}  // namespace storix::example
