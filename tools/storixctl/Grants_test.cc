#include "tools/storixctl/Grants.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "tools/storixctl/Json.h"
#include "tools/storixctl/TemporaryDirectory.h"

namespace storix::ctl {
namespace {

namespace fs = std::filesystem;
using ::testing::AllOf;
using ::testing::HasSubstr;

class GrantsTest : public ::testing::Test {
 protected:
  GrantsTest() { fs::create_directories(home_ / "Library/Storix"); }

  void write(const std::string &text) const { home_.write("Library/Storix/AccessControl.kvs", text); }
  [[nodiscard]] fs::path file() const { return home_ / "Library/Storix/AccessControl.kvs"; }

  [[nodiscard]] Result<Printed> list(std::vector<std::string> arguments = {}, bool forTerminal = false) const {
    arguments.insert(arguments.begin(), "grants");
    return grants(std::get<Invocation>(parseArguments(arguments)), home_.path().string(), forTerminal);
  }
  [[nodiscard]] std::string complaint() const {
    const auto printed = list();
    return printed ? "no complaint" : printed.error().message();
  }

  TemporaryDirectory home_;
};

constexpr const char *someGrants = R"({"p": {"c": {"AllowedItemIDs": ["z", "a/b"], "More": 1}, "d": {}},
  "q": {"c": {"AllowedItemIDs": ["x"]}}})";

TEST_F(GrantsTest, EveryGrantIsALine) {
  write(someGrants);
  EXPECT_EQ(list().value().text, "p\tc\tz\np\tc\ta/b\nq\tc\tx\n");
  EXPECT_EQ(list({}, true).value().text,
            "PROVIDER  APPLICATION  ITEM\n"
            "p         c            z\n"
            "p         c            a/b\n"
            "q         c            x\n");
  EXPECT_THAT(
      jsonText(list({}).value().json),
      HasSubstr("    {\n      \"consumer\": \"c\",\n      \"item\": \"a/b\",\n      \"provider\": \"p\"\n    }"));
}

TEST_F(GrantsTest, OptionsChooseAmongThem) {
  write(someGrants);
  EXPECT_EQ(list({"--provider", "q"}).value().text, "q\tc\tx\n");
  EXPECT_EQ(list({"--consumer", "c", "--provider", "p"}).value().text, "p\tc\tz\np\tc\ta/b\n");
  EXPECT_EQ(list({"--consumer", "d"}).value().text, "");
  EXPECT_EQ(jsonText(list({"--consumer", "nobody"}).value().json), "{\n  \"grants\": []\n}\n");
}

TEST_F(GrantsTest, NoFileIsSaid) {
  EXPECT_THAT(complaint(),
              AllOf(HasSubstr(file().string()), HasSubstr("No such file"), HasSubstr("Nothing has been granted yet")));
}

TEST_F(GrantsTest, ACorruptFileIsSaidAndLeftAsItIs) {
  write("{\"p\": ");
  EXPECT_THAT(complaint(), AllOf(HasSubstr(file().string()), HasSubstr("line 1"), HasSubstr("put it right, or away")));
  EXPECT_TRUE(fs::exists(file()));
  write(R"({"p": {"c": {"AllowedItemIDs": "x"}}})");
  EXPECT_THAT(complaint(), AllOf(HasSubstr(file().string()), HasSubstr("consumer “c” of provider “p”"),
                                 HasSubstr("put it right, or away")));
}

TEST_F(GrantsTest, AFileThatCannotBeReadIsSaid) {
  fs::create_directory(file());
  EXPECT_THAT(complaint(), HasSubstr(file().string()));
}

TEST(Grants, AHomeDirectoryIsNeeded) {
  const auto printed = grants(std::get<Invocation>(parseArguments({"grants"})), "", false);
  ASSERT_FALSE(printed);
  EXPECT_THAT(printed.error().message(), HasSubstr("set HOME"));
}

}  // namespace
}  // namespace storix::ctl
