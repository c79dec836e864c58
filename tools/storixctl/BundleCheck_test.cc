#include "tools/storixctl/BundleCheck.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "tools/storixctl/CommandsTest.h"

namespace storix::ctl {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;

class BundleCheckTest : public CommandsTest {
 protected:
  void SetUp() override {
    CommandsTest::SetUp();
    std::string name = (fs::temp_directory_path() / "storix-bundle-XXXXXX").string();
    ASSERT_NE(::mkdtemp(name.data()), nullptr);
    directory_ = name;
    surroundings_.currentDirectory = directory_;
    fs::create_directories(directory_ / "docs.appdex/documents");
    write("documents/a.txt", "a document");
    write("fault", "none");
    write("Info.kvs", R"({"KTBundleIdentifier": "org.sample.docs", "KTBundleExecutable": "provider",
                          "KTGroupContainers": ["group"], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
                          "KTExtension": {"KTExtensionStorixDocumentGroup": "group"}})");
    fs::copy_file(STORIX_FAULTY_PROVIDER, directory_ / "docs.appdex/provider");
  }
  void TearDown() override {
    fs::remove_all(directory_);
    CommandsTest::TearDown();
  }
  void write(const std::string &file, const std::string &content) const {
    std::ofstream(directory_ / "docs.appdex" / file) << content;
  }
  fs::path directory_;
};

TEST_F(BundleCheckTest, AdviceAloneIsNoFailure) {
  EXPECT_EQ(run({"check-extension", "docs.appdex/", "--file", "a.txt", "--item=a.txt"}), done);
  EXPECT_THAT(printed(), StartsWith("advice: Info.kvs: \"KTBundleVersion\" is missing"));
  EXPECT_THAT(printed(), HasSubstr("\n0 errors, 1 piece of advice\n"));
  EXPECT_THAT(complaint(), StartsWith("provider: the fault: none\n"));
}

TEST_F(BundleCheckTest, AnErrorIsStatusOne) {
  write("fault", "answers neither");
  EXPECT_EQ(run({"check-extension", "docs.appdex"}), requestFailed);
  EXPECT_THAT(printed(), HasSubstr("\nerror:  IdentifierForItemAtURL for "));
  EXPECT_THAT(printed(), HasSubstr("Only bad input was tried"));
}

TEST_F(BundleCheckTest, JsonHoldsTheSame) {
  EXPECT_EQ(run({"check-extension", "--json", "docs.appdex"}), done);
  EXPECT_THAT(printed(), StartsWith("{\n  \"advice\": 1,\n  \"bundle\": \"" + (directory_ / "docs.appdex").string() +
                                    "\",\n  \"documentsTried\": false,\n  \"errors\": 0,\n"));
  EXPECT_THAT(printed(), HasSubstr("\"severity\": \"advice\""));
  EXPECT_EQ(run({"check-extension", "--json", "nothing.appdex"}), requestFailed);
  EXPECT_THAT(printed(), HasSubstr("\"errors\": 1,"));
}

TEST_F(BundleCheckTest, WhatCannotBeCheckedIsAComplaint) {
  EXPECT_EQ(run({"check-extension", "docs.appdex", "--container", "nowhere"}), requestFailed);
  EXPECT_THAT(printed(), IsEmpty());
  EXPECT_THAT(complaint(), StartsWith("storixctl: check-extension: "));
  EXPECT_THAT(complaint(), HasSubstr("nowhere as the group's container"));
}

}  // namespace
}  // namespace storix::ctl
