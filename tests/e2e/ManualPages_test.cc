// The manual pages are well formed and say what the programs' help says.

#include <csignal>
#include <filesystem>
#include <set>

#include "tests/e2e/E2ETest.h"
#include "tools/storixctl/Commands.h"
#include "tools/storixctl/Verbs.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

class ManualPages : public testing::Test, public testing::WithParamInterface<const char *> {
 protected:
  static std::string page(const std::string &name) {
    return (fs::path(STORIX_SOURCE_DIR) / "packaging/man" / name).string();
  }
  /// As a terminal shows it, but for what makes letters bold.
  std::string text(const std::string &name) {
    const Finished formatted = run({"mandoc", "-T", "ascii", "-O", "width=200", page(name)}, session_.environment);
    EXPECT_EQ(0, formatted.status) << formatted.errors;
    std::string plain;
    for (const char letter : formatted.output) {
      if (letter == '\b') {
        plain.pop_back();
      } else {
        plain += letter;
      }
    }
    return plain;
  }
  Session session_;
};

TEST_P(ManualPages, FormatsWithoutWarnings) {
  const Finished linted = run({"mandoc", "-T", "lint", "-W", "warning", page(GetParam())}, session_.environment);
  EXPECT_EQ(0, linted.status) << linted.output << linted.errors;
  EXPECT_EQ("", linted.output);
}

INSTANTIATE_TEST_SUITE_P(All, ManualPages, testing::Values("storixctl.1", "storixd.8"));

TEST_F(ManualPages, EveryPageIsTested) {
  std::set<std::string> names;
  for (const auto &entry : fs::directory_iterator(page(""))) names.insert(entry.path().filename());
  EXPECT_EQ((std::set<std::string>{"storixctl.1", "storixd.8"}), names);
}

TEST_F(ManualPages, StorixctlsHasEveryVerbWithItsOperandsAndOptions) {
  const std::string text = this->text("storixctl.1");
  for (const auto &verb : ctl::verbs()) {
    std::string line = "\n     " + std::string(verb.name);
    for (const auto &option : ctl::options()) {
      if (ctl::isCommon(option.option) || !verb.takes(option.option)) continue;
      std::string value(option.value);
      for (char &letter : value) letter = static_cast<char>(std::tolower(letter));
      line += " [" + std::string(option.name) + " " + value + "]";
    }
    for (const auto &operand : verb.operands) {
      line += " ";
      for (const char letter : operand.name) line += static_cast<char>(std::tolower(letter));
    }
    // What is said of it follows on the same line or on the next.
    EXPECT_TRUE(text.find(line + "\n") != std::string::npos || text.find(line + "  ") != std::string::npos) << line;
  }
  for (const auto &option : ctl::options()) {
    const std::string pattern =
        option.shortName.empty() ? "\n     " + std::string(option.name) : "\n     " + std::string(option.shortName);
    EXPECT_NE(std::string::npos, text.find(pattern)) << pattern;
    EXPECT_NE(std::string::npos, text.find(std::string(option.name))) << option.name;
  }
  for (const int status : std::initializer_list<int>{ctl::done, ctl::requestFailed, ctl::notUnderstood,
                                                     ctl::daemonNotReachable, 128 + SIGINT, ctl::readerGone}) {
    EXPECT_NE(std::string::npos, text.find("\n     " + std::to_string(status) + " ")) << status;
  }
}

TEST_F(ManualPages, StorixdsHasEveryOptionAndVariableOfItsHelp) {
  const std::string text = this->text("storixd.8");
  const std::string help = run({builtProgram("storixd").string(), "--help"}, session_.environment).output;
  const std::string letters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ_-";
  std::set<std::string> names;
  for (const char *beginning : {"--", "STORIX_", "XDG_"}) {
    for (std::size_t at = help.find(beginning); at != std::string::npos; at = help.find(beginning, at + 1)) {
      names.insert(help.substr(at, help.find_first_not_of(letters, at) - at));
    }
  }
  EXPECT_GE(names.size(), 8U) << help;
  for (const std::string &each : names) EXPECT_NE(std::string::npos, text.find(each)) << each;
}

}  // namespace
}  // namespace storix::e2e
