#include "service/BookmarkableString.h"

#include <gtest/gtest.h>

namespace storix {
namespace {

void expectParsed(std::string_view text, std::string_view provider, std::string_view item) {
  const std::optional<BookmarkableString> bookmark = BookmarkableString::parse(text);
  ASSERT_TRUE(bookmark) << text;
  EXPECT_EQ(bookmark->providerIdentifier, provider);
  EXPECT_EQ(bookmark->itemIdentifier, item);
  EXPECT_EQ(bookmark->text(), text);
}

TEST(BookmarkableString, NamesAProviderAndAnItem) { expectParsed("storix:org.sample.docs/a", "org.sample.docs", "a"); }

TEST(BookmarkableString, TheItemKeepsItsSlashes) {
  expectParsed("storix:org.sample.docs/a/b/c", "org.sample.docs", "a/b/c");
  expectParsed("storix:org.sample.docs/a//b", "org.sample.docs", "a//b");
}

TEST(BookmarkableString, TheItemKeepsASlashAtItsEnd) {
  expectParsed("storix:org.sample.docs/a/", "org.sample.docs", "a/");
}

TEST(BookmarkableString, NothingIsEscapedOrDecoded) {
  expectParsed("storix:org.é/100% {}\n“x” storix:", "org.é", "100% {}\n“x” storix:");
}

TEST(BookmarkableString, IsWrittenFromItsParts) {
  EXPECT_EQ((BookmarkableString{"org.sample.docs", "folder/doc"}.text()), "storix:org.sample.docs/folder/doc");
}

TEST(BookmarkableString, RefusesWhatLacksAPart) {
  for (const char *text : {"", "storix:", "storix:/", "storix:/a", "storix:org.sample.docs", "storix:org.sample.docs/",
                           "storix:org.sample.docs//a", "storix:org.sample.docs//"}) {
    EXPECT_FALSE(BookmarkableString::parse(text)) << text;
  }
}

TEST(BookmarkableString, RefusesAnyOtherPrefix) {
  for (const char *text : {" storix:org.sample.docs/a", "  storix:org.sample.docs/a", "Storix:org.sample.docs/a",
                           "STORIX:org.sample.docs/a", "org.sample.docs/a", "storix/org.sample.docs/a", "stori"}) {
    EXPECT_FALSE(BookmarkableString::parse(text)) << text;
  }
}

}  // namespace
}  // namespace storix
