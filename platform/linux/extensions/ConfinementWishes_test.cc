#include "platform/linux/extensions/ConfinementWishes.h"

#include <gmock/gmock.h>

#include "platform/linux/files/KeyedValueFile.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

Result<ConfinementWishes> wishesOf(const std::string &sandbox) {
  return confinementWishes(parseKeyedValues(R"({"KTSandbox": )" + sandbox + "}", "test").value());
}

std::string refusalOf(const std::string &sandbox) {
  const Result<ConfinementWishes> wishes = wishesOf(sandbox);
  return wishes ? "accepted" : wishes.error().message();
}

TEST(ConfinementWishes, WhoAsksForNothingGetsNothing) {
  EXPECT_EQ(confinementWishes({}).value(), ConfinementWishes());
  EXPECT_EQ(wishesOf("{}").value(), ConfinementWishes());
}

TEST(ConfinementWishes, NetworkAndPlacesAreRead) {
  const ConfinementWishes wishes =
      wishesOf(R"({"network": true, "readOnly": ["/srv/a", "~/Music"], "readWrite": ["~/Documents/x"]})").value();
  EXPECT_TRUE(wishes.network);
  EXPECT_THAT(wishes.readOnly, ElementsAre("/srv/a", "~/Music"));
  EXPECT_THAT(wishes.readWrite, ElementsAre("~/Documents/x"));
  EXPECT_FALSE(wishesOf(R"({"network": false})").value().network);
}

TEST(ConfinementWishes, SlashesThatMeanNothingAreDropped) {
  EXPECT_THAT(wishesOf(R"({"readOnly": ["//srv///a/", "~//Music/", "/", "~/", "/..a/b..", "/a/.b"]})").value().readOnly,
              ElementsAre("/srv/a", "~/Music", "/", "~/", "/..a/b..", "/a/.b"));
}

TEST(ConfinementWishes, PathThatDoesNotGoStraightDownIsRefused) {
  for (const char *path : {"", "a", "./a", "~", "~user/a", "/a/../b", "/..", "/a/..", "/./a", "/a/.", "~/..", "~/../b",
                           "~/a/./b", "/a\\u0000b"}) {
    EXPECT_EQ(refusalOf(R"({"readOnly": [")" + std::string(path) + "\"]}"),
              "\"readOnly\" in \"KTSandbox\" must hold paths that are absolute or begin with \"~/\", without \".\" and "
              "\"..\".")
        << path;
  }
  EXPECT_THAT(refusalOf(R"({"readWrite": [1]})"), HasSubstr("\"readWrite\" in \"KTSandbox\" must hold paths"));
}

TEST(ConfinementWishes, WhatIsNotUnderstoodIsRefused) {
  EXPECT_EQ(refusalOf("true"), "\"KTSandbox\" must be a dictionary.");
  EXPECT_EQ(refusalOf(R"({"network": "yes"})"), "\"network\" in \"KTSandbox\" must be true or false.");
  EXPECT_EQ(refusalOf(R"({"network": 1})"), "\"network\" in \"KTSandbox\" must be true or false.");
  EXPECT_EQ(refusalOf(R"({"readOnly": "/srv"})"), "\"readOnly\" in \"KTSandbox\" must be a list of paths.");
  EXPECT_EQ(refusalOf(R"({"netwrok": true})"),
            "\"KTSandbox\" holds \"netwrok\"; it may hold \"network\", \"readOnly\" and \"readWrite\" alone.");
}

TEST(ConfinementWishes, PlaceIsAskedForInOneWay) {
  EXPECT_EQ(refusalOf(R"({"readOnly": ["/srv/a"], "readWrite": ["/srv//a/"]})"),
            "\"KTSandbox\" asks for /srv/a in both \"readOnly\" and \"readWrite\".");
}

}  // namespace
}  // namespace storix::linuxhost
