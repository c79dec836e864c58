#include "examples/webdav-provider/DavListing.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "examples/webdav-provider/DavPath.h"

namespace storix::example {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

std::string multistatus(const std::string &responses) {
  return R"(<?xml version="1.0" encoding="utf-8"?><D:multistatus xmlns:D="DAV:">)" + responses + "</D:multistatus>";
}

std::string response(const std::string &href, const std::string &properties = "",
                     const std::string &status = "HTTP/1.1 200 OK") {
  return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop>" + properties + "</D:prop><D:status>" + status +
         "</D:status></D:propstat></D:response>";
}

std::vector<DavEntry> read(const std::string &responses, const std::string &path = "/dav") {
  auto entries = readMultistatus(multistatus(responses), path);
  EXPECT_TRUE(entries.ok()) << (entries.ok() ? "" : entries.error().message());
  return entries.ok() ? entries.value() : std::vector<DavEntry>{};
}

std::vector<std::string> paths(const std::vector<DavEntry> &entries) {
  std::vector<std::string> all;
  all.reserve(entries.size());
  for (const DavEntry &entry : entries) all.push_back(entry.path);
  return all;
}

std::string refusal(const std::string &text) {
  const auto entries = readMultistatus(text, "/dav");
  EXPECT_FALSE(entries.ok()) << text.substr(0, 100);
  if (entries.ok()) return {};
  EXPECT_EQ(entries.error().code(), EPROTO);
  return entries.error().message();
}

TEST(DavListing, PropertiesAreRead) {
  const auto entries = read(response("/dav/a.txt",
                                     "<D:resourcetype/><D:getcontentlength> 12 </D:getcontentlength><D:getetag>\"x\"</"
                                     "D:getetag><D:getlastmodified>Sun, 06 Nov 1994 08:49:37 GMT</D:getlastmodified>"));
  ASSERT_EQ(entries.size(), 1U);
  EXPECT_EQ(entries[0].path, "a.txt");
  EXPECT_FALSE(entries[0].isCollection);
  EXPECT_EQ(entries[0].size, 12);
  EXPECT_EQ(entries[0].etag, "\"x\"");
  EXPECT_EQ(entries[0].modificationTime, 784111777);
}

TEST(DavListing, CollectionsAndTheRequestedOneAreKnown) {
  const auto entries = read(response("/dav/", "<D:resourcetype><D:collection/></D:resourcetype>") +
                            response("/dav/sub/", "<D:resourcetype><D:collection/></D:resourcetype>"));
  EXPECT_THAT(paths(entries), ElementsAre("", "sub"));
  EXPECT_TRUE(entries[0].isCollection);
  EXPECT_TRUE(entries[1].isCollection);
}

TEST(DavListing, NamesAreDecodedOnce) {
  EXPECT_THAT(paths(read(response("/dav/50%25%20%c3%A9.txt") + response("/dav/100%2525") + response("/dav/a&amp;b"))),
              ElementsAre("50% \xC3\xA9.txt", "100%25", "a&b"));
}

TEST(DavListing, ReferencesMayBeAbsoluteAndEndInASlashOrNot) {
  EXPECT_THAT(
      paths(read(response("http://host:80/dav/") + response("https://elsewhere/dav/a") + response(" /dav/b/ "))),
      ElementsAre("", "a", "b"));
  EXPECT_THAT(paths(read(response("http://host") + response("/a"), "/")), ElementsAre("", "a"));
}

TEST(DavListing, WhatIsOutsideOrLeadsAstrayIsLeftOut) {
  EXPECT_THAT(paths(read(response("/dav/") + response("/other/a") + response("/davx") + response("/dav/../etc") +
                         response("/dav/%2e%2e/etc") + response("/dav/a%2Fb") + response("/dav/a%00") +
                         response("/dav//a") + response("/dav/%zz") + response("/dav/%4") + response("relative") +
                         response("//host/dav/a") + response("") + response("/dav/good"))),
              ElementsAre("", "good"));
}

TEST(DavListing, AnotherPrefixStandsForTheRequestedOne) {
  EXPECT_THAT(paths(read(response("/remote/x/") + response("/remote/x/a") + response("/remote/x/b/c"))),
              ElementsAre("", "a", "b/c"));
  EXPECT_THAT(paths(read(response("/remote/x/a.txt"), "/dav/a.txt")), ElementsAre(""));
  EXPECT_THAT(paths(read(response("/one/a") + response("/two/b"))), IsEmpty());
}

TEST(DavListing, OnlyPropertiesThatWereFoundCount) {
  const auto entries = read(
      "<D:response><D:href>/dav/a</D:href><D:propstat><D:prop><D:getetag>\"no\"</D:getetag></D:prop>"
      "<D:status>HTTP/1.1 404 Not Found</D:status></D:propstat><D:propstat><D:prop><D:getcontentlength>5"
      "</D:getcontentlength></D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat>"
      "<D:propstat><D:prop><D:getetag>\"none\"</D:getetag></D:prop></D:propstat></D:response>");
  ASSERT_EQ(entries.size(), 1U);
  EXPECT_EQ(entries[0].etag, "");
  EXPECT_EQ(entries[0].size, 5);
}

TEST(DavListing, ResponsesWithAFailureAreLeftOut) {
  EXPECT_THAT(paths(read("<D:response><D:href>/dav/a</D:href><D:status>HTTP/1.1 404 Not Found</D:status></D:response>"
                         "<D:response><D:href>/dav/b</D:href><D:href>/dav/c</D:href><D:status>HTTP/1.1 200 OK"
                         "</D:status></D:response>")),
              ElementsAre("b", "c"));
}

TEST(DavListing, NamesAreComparedWithTheirNamespace) {
  const auto entries = readMultistatus(
      R"(<m:multistatus xmlns:m="DAV:" xmlns:o="http://other/"><m:response><m:href>/dav/a</m:href><o:href>/dav/b</o:href>
         <o:propstat><m:prop><m:getetag>"1"</m:getetag></m:prop><m:status>HTTP/1.1 200 OK</m:status></o:propstat>
         <m:propstat><m:prop><o:getetag>"2"</o:getetag><m:getcontentlength>7</m:getcontentlength></m:prop>
         <m:status>HTTP/1.1 200 OK</m:status></m:propstat></m:response><o:response><m:href>/dav/c</m:href></o:response>
         </m:multistatus>)",
      "/dav");
  ASSERT_TRUE(entries.ok());
  ASSERT_EQ(entries.value().size(), 1U);
  EXPECT_EQ(entries.value()[0].etag, "");
  EXPECT_EQ(entries.value()[0].size, 7);
  EXPECT_THAT(refusal(R"(<multistatus><response><href>/dav/a</href></response></multistatus>)"), HasSubstr("no DAV"));
  EXPECT_THAT(refusal(R"(<multistatus xmlns="dav:"/>)"), HasSubstr("no DAV"));
  const auto defaulted = readMultistatus(R"(<multistatus xmlns="DAV:"/>)", "/dav");
  ASSERT_TRUE(defaulted.ok());
  EXPECT_THAT(defaulted.value(), IsEmpty());
}

TEST(DavListing, ElementsInOddPlacesCountForNothing) {
  const auto entries = read(response("/dav/a", "<D:x><D:getetag>\"no\"</D:getetag></D:x>") +
                            "<D:x><D:response><D:href>/dav/b</D:href></D:response></D:x>" +
                            "<D:response><D:x><D:href>/dav/c</D:href></D:x></D:response>");
  EXPECT_THAT(paths(entries), ElementsAre("a"));
  EXPECT_EQ(entries[0].etag, "");
}

TEST(DavListing, OddValuesCountAsNone) {
  const auto entries = read(response("/dav/a",
                                     "<D:getcontentlength>-5</D:getcontentlength><D:getlastmodified>soon</"
                                     "D:getlastmodified><D:getetag>\"a&#13;&#10;X: y\"</D:getetag>") +
                            response("/dav/b", "<D:getcontentlength>99999999999999999999</D:getcontentlength>") +
                            response("/dav/c", "<D:getcontentlength>5 bytes</D:getcontentlength>"));
  for (const DavEntry &entry : entries) {
    EXPECT_FALSE(entry.size.has_value());
    EXPECT_FALSE(entry.modificationTime.has_value());
    EXPECT_EQ(entry.etag, "");
    EXPECT_EQ(entry.version(), "");
  }
}

TEST(DavListing, DocumentTypesAreRefusedSoThatNothingIsExpandedOrFetched) {
  const std::string end = multistatus(response("/dav/&a;")).substr(38);
  EXPECT_THAT(refusal(R"(<!DOCTYPE x [<!ENTITY a "aaaa"><!ENTITY b "&a;&a;&a;&a;">]>)" + end),
              HasSubstr("document type"));
  EXPECT_THAT(refusal(R"(<!DOCTYPE x [<!ENTITY a SYSTEM "file:///etc/passwd">]>)" + end), HasSubstr("document type"));
  EXPECT_THAT(refusal(R"(<!DOCTYPE x SYSTEM "http://127.0.0.1/x.dtd">)" + end), HasSubstr("document type"));
}

TEST(DavListing, WhatIsNoXMLIsRefusedWithTheLine) {
  EXPECT_THAT(refusal(""), HasSubstr("line 1"));
  EXPECT_THAT(refusal("<html>\n<body>\n<br></body></html>"), HasSubstr("line 3"));
  refusal("not XML");
  refusal(multistatus(response("/dav/a")).substr(0, 120));
  refusal(multistatus(response("/dav/&undefined;")));
  refusal(multistatus(response("/dav/\xFF")));
  refusal(multistatus("<x:y/>"));
}

TEST(DavListing, DeepNestingIsRefused) {
  std::string deep;
  for (int i = 0; i < 100'000; ++i) deep += "<a>";
  EXPECT_THAT(refusal(deep), HasSubstr("too deep"));
}

TEST(DavListing, LongDocumentsAreRead) {
  std::string responses;
  for (int i = 0; i < 20'000; ++i) responses += response("/dav/" + std::to_string(i), "<D:getetag>\"e\"</D:getetag>");
  const auto entries = read(responses);
  ASSERT_EQ(entries.size(), 20'000U);
  EXPECT_EQ(entries.back().path, "19999");
  EXPECT_EQ(entries.back().etag, "\"e\"");
}

TEST(DavEntry, VersionIsTheETagWithoutItsWeaknessOrSizeAndTime) {
  DavEntry entry;
  entry.size = 5;
  entry.modificationTime = 7;
  EXPECT_EQ(entry.version(), "size 5 time 7");
  entry.etag = "W/\"x\"";
  EXPECT_EQ(entry.version(), "\"x\"");
  entry.etag = "\"x\"";
  EXPECT_EQ(entry.version(), "\"x\"");
}

TEST(DavPath, EverythingThatMayMeanSomethingInAURLIsEncoded) {
  EXPECT_EQ(percentEncodedPath("a b/100%25/\xC3\xA9?#;[&=+~-._"), "a%20b/100%2525/%C3%A9%3F%23%3B%5B%26%3D%2B~-._");
  const std::string all = "!\"#$%&'()*+,-.:;<=>?@[\\]^_`{|}~\x7F\xFF 0Az";
  EXPECT_EQ(decodedPathOfReference("/" + percentEncodedPath(all)), "/" + all);
}

TEST(DavPath, QueriesAndFragmentsAreDropped) {
  EXPECT_EQ(decodedPathOfReference("/a/b?x=/y"), "/a/b");
  EXPECT_EQ(decodedPathOfReference("/a/b#c/d"), "/a/b");
  EXPECT_EQ(decodedPathOfReference("/"), "/");
  EXPECT_EQ(decodedPathOfReference("a/b"), std::nullopt);
}

TEST(DavPath, UTF8IsToldFromOtherBytes) {
  EXPECT_TRUE(isUTF8("plain"));
  EXPECT_TRUE(isUTF8(""));
  EXPECT_TRUE(isUTF8("\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x99\x82"));
  EXPECT_FALSE(isUTF8("\xE9"));
  EXPECT_FALSE(isUTF8("a\xC3"));
  EXPECT_FALSE(isUTF8("\xC0\xAF"));
  EXPECT_FALSE(isUTF8(std::string_view("a\0b", 3)));
}

}  // namespace
}  // namespace storix::example
