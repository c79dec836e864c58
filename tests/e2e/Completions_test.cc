// The completions of storixctl's command line know what the program knows.

#include <algorithm>
#include <filesystem>
#include <sstream>

#include "tests/e2e/E2ETest.h"
#include "tools/storixctl/Verbs.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

const fs::path completions = fs::path(STORIX_SOURCE_DIR) / "packaging/completions";

std::vector<std::string> sorted(std::vector<std::string> words) {
  std::sort(words.begin(), words.end());
  return words;
}

class Completions : public E2ETest {
 protected:
  Completions() {
    const fs::path programs = session.directory() / "bin";
    fs::create_directory(programs);
    fs::create_symlink(session.installApplication("org.sample.ctl", builtProgram("storixctl"),
                                                  R"({"com.tessel.storix.acl-write": true})"),
                       programs / "storixctl");
    session.environment["PATH"] = programs.string() + ":/usr/bin:/bin";
  }

  /// What bash offers for the last of the words after the program's name.
  [[nodiscard]] std::vector<std::string> offered(const std::vector<std::string> &words) const {
    std::vector<std::string> command{
        "bash", "-c",
        "source \"$0\"; cd \"$1\"; shift; COMP_WORDS=(storixctl \"$@\"); COMP_CWORD=$#; _storixctl; "
        "[[ ${#COMPREPLY[@]} == 0 ]] || printf '%s\\n' \"${COMPREPLY[@]}\"",
        (completions / "storixctl.bash").string(), session.directory().string()};
    command.insert(command.end(), words.begin(), words.end());
    const Finished finished = run(command, session.environment);
    EXPECT_EQ("", finished.errors);
    std::vector<std::string> lines;
    std::istringstream output(finished.output);
    for (std::string line; std::getline(output, line);) lines.push_back(line);
    return sorted(lines);
  }
  using Words = std::vector<std::string>;
};

TEST_F(Completions, BashKnowsEveryVerb) {
  Words names;
  for (const auto &verb : ctl::verbs()) names.emplace_back(verb.name);
  EXPECT_EQ(sorted(names), offered({""}));
  EXPECT_EQ(sorted(names), offered({"--timeout", "5", ""}));
  EXPECT_EQ((Words{"placeholder", "providers"}), offered({"--json", "p"}));
}

TEST_F(Completions, BashKnowsTheOptionsOfEveryVerb) {
  for (const auto &verb : ctl::verbs()) {
    Words names;
    for (const auto &option : ctl::options()) {
      if (!verb.takes(option.option)) continue;
      names.emplace_back(option.name);
      if (!option.shortName.empty()) names.emplace_back(option.shortName);
    }
    EXPECT_EQ(sorted(names), offered({std::string(verb.name), "-"})) << verb.name;
  }
  EXPECT_EQ((Words{"--output"}), offered({"read", "--o"}));
  EXPECT_TRUE(offered({"read", "--", "-"}).empty());
}

TEST_F(Completions, BashCompletesFiles) {
  session.write(session.directory() / "a b.txt", "");
  session.write(session.directory() / "a", "");
  for (const Words &words : {Words{"read", "a"},
                             {"write", "a"},
                             {"bookmark", "a"},
                             {"share", "a"},
                             {"start", "a"},
                             {"read", "-o", "a"},
                             {"cat", "x", "--output", "a"},
                             {"cat", "--output", "=", "a"},
                             {"write", "x", "--input", "a"},
                             {"read", "--", "a"}}) {
    EXPECT_EQ((Words{"a", "a b.txt", "applications"}), offered(words)) << words[0] << " " << words[1];
  }
  EXPECT_TRUE(offered({"open", "a"}).empty());
  EXPECT_TRUE(offered({"read", "file", ":", "///x", "a"}).empty()) << "a URL is one operand";
  EXPECT_TRUE(offered({"read", "--timeout", "a"}).empty());
}

TEST_F(Completions, BashAsksForProvidersAndApplications) {
  EXPECT_TRUE(offered({"extend", "a", ""}).empty()) << "without a daemon";
  session.installProvider("org.sample.docs");
  session.installProvider("org.sample.more");
  start();
  const Words providers{"org.sample.docs", "org.sample.more"};
  EXPECT_EQ(providers, offered({"extend", "a", ""}));
  EXPECT_EQ(providers, offered({"grants", "--provider", "org"}));
  EXPECT_EQ(Words{"org.sample.more"}, offered({"grants", "--provider", "=", "org.sample.m"}));
  EXPECT_EQ(providers, offered({"grants", "--provider", "="}));
  const auto client = makeClient();
  for (const char *consumer : {"org.sample.editor", "org.sample.reader"}) {
    for (const char *name : {"a", "b"}) {
      EXPECT_TRUE(client->extendSandbox(itemURL("org.sample.docs", name), "org.sample.docs", consumer));
    }
  }
  const Words applications{"org.sample.editor", "org.sample.reader"};
  EXPECT_EQ(applications, offered({"share", "a", ""}));
  EXPECT_EQ(applications, offered({"start", "a", "org.sample.docs", ""}));
  EXPECT_EQ(applications, offered({"grants", "--consumer", ""}));
}

TEST_F(Completions, ZshKnowsEveryVerbAndOption) {
  const Finished checked = run({"zsh", "-n", (completions / "_storixctl").string()}, session.environment);
  EXPECT_EQ(0, checked.status) << checked.errors;
  // The functions of zsh's completion system are not there outside of it; these print what they are given.
  const auto offeredByZsh = [this](const std::string &verb) {
    const Finished finished = run({"zsh", "-fc",
                                   "_arguments() { print -rl -- \"$@\"; state=$wanted; return 1 }\n"
                                   "_describe() { print -rl -- ${(P)4}; return 1 }\n"
                                   "words=($2); wanted=${2:+operands}; wanted=${wanted:-verb}; source $1",
                                   "zsh", (completions / "_storixctl").string(), verb},
                                  session.environment);
    EXPECT_EQ("", finished.errors);
    return finished.output;
  };
  const std::string verbs = offeredByZsh("");
  for (const auto &verb : ctl::verbs()) {
    const std::string line = std::string(verb.name) + ":" + std::string(verb.summary) + "\n";
    EXPECT_NE(std::string::npos, verbs.find("\n" + line)) << line;
    const std::string offers = offeredByZsh(std::string(verb.name));
    for (const auto &option : ctl::options()) {
      const std::string name = std::string(option.name) + (option.value.empty() ? "[" : "=[");
      const bool offersIt = offers.find(name) != std::string::npos;
      EXPECT_EQ(verb.takes(option.option), offersIt) << verb.name << " " << option.name;
      if (verb.takes(option.option) && !option.shortName.empty()) {
        EXPECT_NE(std::string::npos, offers.find(")" + std::string(option.shortName))) << option.shortName;
      }
    }
    EXPECT_EQ(verb.operands.empty(), offers.rfind("\n1:") < offers.rfind("->operands")) << verb.name;
  }
}

}  // namespace
}  // namespace storix::e2e
