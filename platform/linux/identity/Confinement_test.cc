#include "platform/linux/identity/Confinement.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include "platform/linux/TestDirectory.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

ProcessRestrictions sample() {
  ProcessRestrictions restrictions;
  restrictions.seccompFilters = 0;
  restrictions.mountNamespace = {1, 2};
  restrictions.userNamespace = {1, 3};
  restrictions.securityLabel = "unconfined\n";
  return restrictions;
}

TEST(Confinement, ProcessLikeTheDaemonIsNotConfined) { EXPECT_FALSE(isConfined(sample(), sample())); }

TEST(Confinement, WhatIsNotKnownCountsAsConfined) {
  EXPECT_TRUE(isConfined(std::nullopt, sample()));
  EXPECT_TRUE(isConfined(sample(), std::nullopt));
  EXPECT_TRUE(isConfined(std::nullopt, std::nullopt));
}

TEST(Confinement, EachDifferenceConfines) {
  ProcessRestrictions other = sample();
  other.noNewPrivileges = true;
  EXPECT_TRUE(isConfined(other, sample()));
  EXPECT_TRUE(isConfined(other, other)) << "also where the daemon has given up privileges itself";
  other = sample();
  other.mountNamespace.second = 9;
  EXPECT_TRUE(isConfined(other, sample()));
  other = sample();
  other.userNamespace.second = 9;
  EXPECT_TRUE(isConfined(other, sample()));
  other = sample();
  other.securityLabel = "sample (enforce)\n";
  EXPECT_TRUE(isConfined(other, sample()));
  other = sample();
  other.seccompMode = 1;
  EXPECT_TRUE(isConfined(other, sample()));
}

TEST(Confinement, MoreFiltersThanTheDaemonsConfine) {
  ProcessRestrictions own = sample();
  own.seccompMode = 2;
  own.seccompFilters = 1;
  ProcessRestrictions other = own;
  EXPECT_FALSE(isConfined(other, own));
  EXPECT_TRUE(isConfined(other, sample()));
  EXPECT_FALSE(isConfined(sample(), own));
  other.seccompFilters = 2;
  EXPECT_TRUE(isConfined(other, own));
  other.seccompFilters.reset();
  EXPECT_TRUE(isConfined(other, own));
  own.seccompFilters.reset();
  EXPECT_TRUE(isConfined(own, own));
}

class RestrictionsTest : public ::testing::Test {
 protected:
  RestrictionsTest() {
    test_.makeFile("ns/mnt", "");
    test_.makeFile("ns/user", "");
    test_.makeFile("status", "Name:\tx\nNoNewPrivs:\t1\nSeccomp:\t2\nSeccomp_filters:\t3\n");
    test_.makeFile("attr/current", "label\n");
  }
  [[nodiscard]] std::optional<ProcessRestrictions> read() const {
    const UniqueFd directory(::open(test_.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    return readRestrictions(directory.get());
  }
  void remove(const char *name) const { std::filesystem::remove(test_ / name); }

  TestDirectory test_;
};

TEST_F(RestrictionsTest, EverythingIsRead) {
  const std::optional<ProcessRestrictions> restrictions = read();
  ASSERT_TRUE(restrictions);
  EXPECT_TRUE(restrictions->noNewPrivileges);
  EXPECT_EQ(restrictions->seccompMode, 2);
  EXPECT_EQ(restrictions->seccompFilters, 3);
  EXPECT_EQ(restrictions->securityLabel, "label\n");
  EXPECT_NE(restrictions->mountNamespace, restrictions->userNamespace);
}

TEST_F(RestrictionsTest, KernelWithoutLabelsOrSeccompIsUnderstood) {
  remove("attr/current");
  test_.makeFile("status", "Name:\tx\nNoNewPrivs:\t0\n");
  const std::optional<ProcessRestrictions> restrictions = read();
  ASSERT_TRUE(restrictions);
  EXPECT_EQ(restrictions->securityLabel, "");
  EXPECT_EQ(restrictions->seccompMode, 0);
  EXPECT_EQ(restrictions->seccompFilters, std::nullopt);
}

TEST_F(RestrictionsTest, NameOfAProcessCannotPassForALine) {
  test_.makeFile("status", "Name:\tNoNewPrivs:\t0\nNoNewPrivs:\t1\n");
  EXPECT_TRUE(read()->noNewPrivileges);
}

TEST_F(RestrictionsTest, WhatIsMissingMakesTheWholeUnknown) {
  remove("ns/mnt");
  EXPECT_FALSE(read());
  test_.makeFile("ns/mnt", "");
  remove("ns/user");
  EXPECT_FALSE(read());
  test_.makeFile("ns/user", "");
  test_.makeFile("status", "Name:\tx\n");
  EXPECT_FALSE(read());
  test_.makeFile("status", "Name:\tx\nNoNewPrivs:\tx\n");
  EXPECT_FALSE(read());
  remove("status");
  EXPECT_FALSE(read());
}

}  // namespace
}  // namespace storix::linuxhost
