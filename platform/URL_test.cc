#include "platform/URL.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace storix {
namespace {

URL url(std::string_view text) {
  const std::optional<URL> parsed = URL::fromString(text);
  EXPECT_TRUE(parsed) << text;
  return parsed ? *parsed : *URL::fileURLWithPath("/");
}

TEST(URL, TextIsKeptAsItWasParsed) {
  for (const char *text : {"file:///", "file:///a", "file:///a/", "file:///a//b", "file:///a/%C3%A9%20b", "file:///%e9",
                           "file:///-._~!$&'()*+,;=:@", "file:///a/../b/."}) {
    EXPECT_EQ(url(text).absoluteString(), text);
  }
}

TEST(URL, RefusalSaysWhyAndWhatToDo) {
  const std::pair<std::string, const char *> refusals[] = {
      {"", "give an absolute file URL"},
      {"/a/b", "give an absolute file URL"},
      {"a/b", "give an absolute file URL"},
      {"http:///a", "give an absolute file URL"},
      {"FILE:///a", "give an absolute file URL"},
      {"file:/x", "give an absolute file URL"},
      {"file://", "write three slashes"},
      {"file://host/a", "write three slashes"},
      {"file://localhost/a", "write three slashes"},
      {"file:///a?b", "write \"%3F\""},
      {"file:///a#b", "write \"%23\""},
      {"file:///a%00b", "\"%00\" is refused"},
      {"file:///a%2Fb", "\"%2F\" is refused"},
      {"file:///a%2fb", "\"%2F\" is refused"},
      {"file:///a%", "write \"%25\""},
      {"file:///a%4", "write \"%25\""},
      {"file:///a%G0", "write \"%25\""},
      {"file:///a%4G", "write \"%25\""},
      {"file:///a b", "byte 9 may not stand in a URL as it is; write \"%20\""},
      {"file:///é", "write \"%C3\""},
      {"file:///a\nb", "write \"%0A\""},
      {"file:///a[b]", "write \"%5B\""},
      {"file:///a\\b", "write \"%5C\""},
      {std::string("file:///a\0b", 11), "write \"%00\""},
  };
  for (const auto &[text, expected] : refusals) {
    SCOPED_TRACE(text);
    std::string reason;
    EXPECT_FALSE(URL::fromString(text, &reason));
    EXPECT_THAT(reason, testing::HasSubstr(expected));
    EXPECT_FALSE(URL::fromString(text));
  }
}

TEST(URL, LongestTextIsParsedAndOneByteMoreIsRefused) {
  std::string text = "file:///";
  text.append(URL::maximumLength - text.size(), 'a');
  EXPECT_TRUE(URL::fromString(text));
  std::string reason;
  EXPECT_FALSE(URL::fromString(text + "a", &reason));
  EXPECT_THAT(reason, testing::HasSubstr("longer than 65536 bytes"));
}

TEST(URL, AcceptedTextLeavesTheReasonAlone) {
  std::string reason = "untouched";
  EXPECT_TRUE(URL::fromString("file:///a", &reason));
  EXPECT_EQ(reason, "untouched");
}

TEST(URL, PathIsDecodedWithoutTheSlashAtItsEnd) {
  EXPECT_EQ(url("file:///").path(), "/");
  EXPECT_EQ(url("file:////").path(), "/");
  EXPECT_EQ(url("file:///a/b/").path(), "/a/b");
  EXPECT_EQ(url("file:///a/b//").path(), "/a/b");
  EXPECT_EQ(url("file:///a%20b/%C3%a9%25").path(), "/a b/é%");
  EXPECT_EQ(url("file:///%FF").fileSystemRepresentation(), "/\xFF");
}

TEST(URL, EveryByteOfAPathComesBack) {
  std::string path = "/";
  for (int byte = 1; byte < 256; ++byte) path += static_cast<char>(byte);
  const std::optional<URL> made = URL::fileURLWithPath(path);
  ASSERT_TRUE(made);
  EXPECT_EQ(made->path(), path);
  EXPECT_EQ(URL::fromString(made->absoluteString()), made);
}

TEST(URL, FileURLWithPathRefusesRelativePathsAndZeroBytes) {
  EXPECT_FALSE(URL::fileURLWithPath(""));
  EXPECT_FALSE(URL::fileURLWithPath("a/b"));
  EXPECT_FALSE(URL::fileURLWithPath(std::string_view("/a\0b", 4)));
}

TEST(URL, DirectoryURLEndsInASlash) {
  EXPECT_EQ(URL::fileURLWithPath("/a", true)->absoluteString(), "file:///a/");
  EXPECT_EQ(URL::fileURLWithPath("/a/")->absoluteString(), "file:///a/");
  EXPECT_EQ(URL::fileURLWithPath("/a///", true)->absoluteString(), "file:///a/");
  EXPECT_EQ(URL::fileURLWithPath("/a")->absoluteString(), "file:///a");
  EXPECT_EQ(URL::fileURLWithPath("/", true)->absoluteString(), "file:///");
  EXPECT_TRUE(url("file:///a/").hasDirectoryPath());
  EXPECT_TRUE(url("file:///").hasDirectoryPath());
  EXPECT_FALSE(url("file:///a").hasDirectoryPath());
}

TEST(URL, DirectoryURLDiffersFromTheSamePathWithoutSlash) {
  EXPECT_NE(url("file:///a"), url("file:///a/"));
  EXPECT_NE(url("file:///%61"), url("file:///a"));
  EXPECT_EQ(url("file:///a"), url("file:///a"));
  EXPECT_LT(url("file:///a"), url("file:///b"));
}

TEST(URL, LastPathComponentIsDecoded) {
  EXPECT_EQ(url("file:///a/b%20c").lastPathComponent(), "b c");
  EXPECT_EQ(url("file:///a/b/").lastPathComponent(), "b");
  EXPECT_EQ(url("file:///").lastPathComponent(), "/");
}

TEST(URL, AppendedComponentIsEncoded) {
  EXPECT_EQ(url("file:///a").appendingPathComponent("Storix Storage", true).absoluteString(),
            "file:///a/Storix%20Storage/");
  EXPECT_EQ(url("file:///a/").appendingPathComponent("b%20").absoluteString(), "file:///a/b%2520");
  EXPECT_EQ(url("file:///").appendingPathComponent("b").absoluteString(), "file:///b");
  EXPECT_EQ(url("file:///a").appendingPathComponent("/b/c/").absoluteString(), "file:///a/b/c/");
  EXPECT_EQ(url("file:///a").appendingPathComponent("").absoluteString(), "file:///a");
  EXPECT_EQ(url("file:///a").appendingPathComponent("", true).absoluteString(), "file:///a/");
  EXPECT_EQ(url("file:///a").appendingPathComponent(std::string_view("b\0c", 3)).absoluteString(), "file:///a/bc");
}

TEST(URL, DeletingTheLastComponentGivesTheDirectory) {
  EXPECT_EQ(url("file:///a/b").deletingLastPathComponent().absoluteString(), "file:///a/");
  EXPECT_EQ(url("file:///a/b/").deletingLastPathComponent().absoluteString(), "file:///a/");
  EXPECT_EQ(url("file:///a//b").deletingLastPathComponent().absoluteString(), "file:///a/");
  EXPECT_EQ(url("file:///a").deletingLastPathComponent().absoluteString(), "file:///");
  EXPECT_EQ(url("file:///").deletingLastPathComponent().absoluteString(), "file:///");
}

TEST(PathText, LastComponentIsTakenFromTheTextAsItIs) {
  EXPECT_EQ(stringLastPathComponent("file:///a/b/"), "b");
  EXPECT_EQ(stringLastPathComponent("file:///a/b%20c"), "b%20c");
  EXPECT_EQ(stringLastPathComponent("file:///a"), "a");
  EXPECT_EQ(stringLastPathComponent("a"), "a");
  EXPECT_EQ(stringLastPathComponent("/"), "/");
  EXPECT_EQ(stringLastPathComponent(""), "");
}

TEST(PathText, DeletingLeavesTheRootAndDoubleSlashesAlone) {
  EXPECT_EQ(stringByDeletingLastPathComponent("file:///a/b/"), "file:///a");
  EXPECT_EQ(stringByDeletingLastPathComponent("file:///a"), "file:///");
  EXPECT_EQ(stringByDeletingLastPathComponent("file:///a//b"), "file:///a//");
  EXPECT_EQ(stringByDeletingLastPathComponent("/a"), "/");
  EXPECT_EQ(stringByDeletingLastPathComponent("/"), "/");
  EXPECT_EQ(stringByDeletingLastPathComponent("a"), "");
  EXPECT_EQ(stringByDeletingLastPathComponent(""), "");
}

TEST(PathText, AppendingPutsExactlyOneSlashBetween) {
  EXPECT_EQ(stringByAppendingPathComponent("/home/u", "Library/Storix"), "/home/u/Library/Storix");
  EXPECT_EQ(stringByAppendingPathComponent("file:///", ".a"), "file:///.a");
  EXPECT_EQ(stringByAppendingPathComponent("", "a"), "a");
}

TEST(PathText, HiddenSiblingOfAnItemIsAURLAgain) {
  for (const auto &[item, sibling] :
       {std::pair("file:///a/b%20c", "file:///a/.b%20c"), std::pair("file:///a", "file:///.a"),
        std::pair("file:///a//b", "file:///a//.b"), std::pair("file:///a/b/", "file:///a/.b")}) {
    const std::string made =
        stringByAppendingPathComponent(stringByDeletingLastPathComponent(item), "." + stringLastPathComponent(item));
    EXPECT_EQ(url(made).absoluteString(), sibling);
  }
}

}  // namespace
}  // namespace storix
