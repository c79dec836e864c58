#include "platform/linux/identity/FlatpakInfo.h"

#include <gtest/gtest.h>

namespace storix::linuxhost {
namespace {

FlatpakInfo parsed(std::string_view text) {
  const std::optional<FlatpakInfo> info = parseFlatpakInfo(text);
  if (!info) ADD_FAILURE() << "refused: " << text;
  return info.value_or(FlatpakInfo());
}

TEST(FlatpakInfo, NameAndPoliciesAreRead) {
  const FlatpakInfo info = parsed(
      "# made by a sandbox\n"
      "[Application]\nname=org.sample.Editor\nruntime=runtime/org.sample/x86_64/1\n\n"
      "[Instance]\nname=other\n"
      "[Policy com.tessel.storix]\nacl-read=true\nacl-write = 1\nlevel=-2\nshare=0.5\nwhat=a\\sb\\;c;\nno=false\n"
      "[Policy other]\nx=TRUE\n");
  EXPECT_EQ(info.applicationName, "org.sample.Editor");
  EXPECT_EQ(info.entitlements, Dictionary({{"com.tessel.storix.acl-read", true},
                                           {"com.tessel.storix.acl-write", 1},
                                           {"com.tessel.storix.level", -2},
                                           {"com.tessel.storix.share", 0.5},
                                           {"com.tessel.storix.what", "a b\\;c;"},
                                           {"com.tessel.storix.no", false},
                                           {"other.x", "TRUE"}}));
}

TEST(FlatpakInfo, OnlyDecimalNumbersAreNumbers) {
  const FlatpakInfo info =
      parsed("[Policy p]\na=+1\nb=0x1\nc=1e3\nd=1.\ne=.5\nf=\ng=-\nh=1 \ni=007\nj=99999999999999999999\nk=nan\n");
  for (const char *key : {"p.a", "p.b", "p.c", "p.d", "p.e", "p.f", "p.g", "p.h", "p.k"}) {
    EXPECT_NE(info.entitlements.at(key).string(), nullptr) << key;
  }
  EXPECT_EQ(info.entitlements.at("p.i"), Value(7));
  EXPECT_EQ(info.entitlements.at("p.j"), Value(99999999999999999999.0));
  EXPECT_EQ(*parsed("[Policy p]\na=" + std::string(400, '9')).entitlements.at("p.a").string(), std::string(400, '9'));
}

TEST(FlatpakInfo, WithoutANameThereIsNoIdentifier) {
  EXPECT_EQ(parsed("").applicationName, std::nullopt);
  EXPECT_EQ(parsed("[Runtime]\nname=org.sample.Runtime\n").applicationName, std::nullopt);
  EXPECT_EQ(parsed("[Application]\nname=\n").applicationName, std::nullopt);
  EXPECT_EQ(parsed("[Application]\nname[de]=x\n").applicationName, std::nullopt);
  EXPECT_EQ(parsed("[Application]\r\nname=org.sample.A\r\n").applicationName, "org.sample.A");
  EXPECT_EQ(parsed("[Application]\nname=org.sample.A").applicationName, "org.sample.A");
}

TEST(FlatpakInfo, WhatCannotBeUnderstoodIsRefused) {
  const std::string_view zero("[Application]\nname=a\0b\n", 23);
  for (const std::string_view text :
       {std::string_view("name=org.sample.A\n"), std::string_view("[Application]\nname\n"),
        std::string_view("[Application\nname=a\n"), std::string_view("[Application]]\nname=a\n"),
        std::string_view("[]\nname=a\n"), std::string_view("[Application] x\nname=a\n"),
        std::string_view("[Application]\n=a\n"), std::string_view("[Application]\n name=a\n"),
        std::string_view("[Application]\nname=\xFF\n"), std::string_view("[A\x01]\n"),
        std::string_view("[Application]\nna\tme=a\n"), zero}) {
    EXPECT_EQ(parseFlatpakInfo(text), std::nullopt) << text;
  }
}

TEST(FlatpakInfo, WhatIsSaidTwiceIsRefused) {
  EXPECT_EQ(parseFlatpakInfo("[Application]\nname=a\nname=b\n"), std::nullopt);
  EXPECT_EQ(parseFlatpakInfo("[Application]\nname=a\n[Application]\nname=b\n"), std::nullopt);
  EXPECT_EQ(parseFlatpakInfo("[Policy p]\na=1\n[Policy p]\nb=1\n"), std::nullopt);
}

}  // namespace
}  // namespace storix::linuxhost
