#include "tools/storixctl/Arguments.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace storix::ctl {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Pair;

Invocation understood(const std::vector<std::string> &arguments) {
  const auto parsed = parseArguments(arguments);
  const auto *invocation = std::get_if<Invocation>(&parsed);
  EXPECT_NE(invocation, nullptr);
  return invocation ? *invocation : Invocation{};
}

std::string complaint(const std::vector<std::string> &arguments) {
  const auto parsed = parseArguments(arguments);
  const auto *error = std::get_if<UsageError>(&parsed);
  return error ? error->sentence : "no complaint";
}

TEST(Arguments, VerbWithItsOperands) {
  const Invocation invocation = understood({"extend", "/a/b", "org.sample.docs", "org.sample.reader"});
  ASSERT_NE(invocation.verb, nullptr);
  EXPECT_EQ(invocation.verb->verb, Verb::extend);
  EXPECT_THAT(invocation.operands, ElementsAre("/a/b", "org.sample.docs", "org.sample.reader"));
  EXPECT_FALSE(invocation.json);
  EXPECT_EQ(invocation.timeout, std::chrono::seconds(60));
}

TEST(Arguments, OptionsMayStandAnywhere) {
  const Invocation invocation = understood({"--json", "share", "a", "--timeout", "2.5", "b"});
  EXPECT_TRUE(invocation.json);
  EXPECT_EQ(invocation.timeout, std::chrono::milliseconds(2500));
  EXPECT_THAT(invocation.operands, ElementsAre("a", "b"));
  EXPECT_EQ(understood({"wake", "--timeout=7"}).timeout, std::chrono::seconds(7));
}

TEST(Arguments, AfterTwoDashesNothingIsAnOption) {
  EXPECT_THAT(understood({"bookmark", "--", "--json"}).operands, ElementsAre("--json"));
  EXPECT_THAT(understood({"bookmark", "-"}).operands, ElementsAre("-"));
  EXPECT_THAT(understood({"bookmark", ""}).operands, ElementsAre(""));
}

TEST(Arguments, OnlyWhatAVerbTakesMayBeGiven) {
  EXPECT_THAT(understood({"open", "dG9rZW4=", "--output", "copy"}).values, ElementsAre(Pair(Option::output, "copy")));
  EXPECT_THAT(understood({"open", "-o", "copy", "dG9rZW4="}).values, ElementsAre(Pair(Option::output, "copy")));
  EXPECT_THAT(understood({"grants", "--provider=a", "--consumer", "b"}).values,
              ElementsAre(Pair(Option::provider, "a"), Pair(Option::consumer, "b")));
  EXPECT_THAT(understood({"open", "-o", "copy", "dG9rZW4=", "-o", "other"}).values,
              ElementsAre(Pair(Option::output, "other")));
  EXPECT_THAT(understood({"check-extension", "a", "--item", "1", "--file", "f", "--item=2"}).allValues(Option::item),
              ElementsAre("1", "2"));
  EXPECT_EQ(complaint({"check-extension", "a", "--container="}), "--container needs a path");
  EXPECT_EQ(complaint({"wake", "--output=x"}), "\"wake\" takes no --output");
  EXPECT_EQ(complaint({"providers", "--provider=x"}), "\"providers\" takes no --provider");
  EXPECT_EQ(complaint({"grants", "--provider"}), "--provider needs an identifier");
  EXPECT_EQ(complaint({"open", "dG9rZW4=", "--output="}), "--output needs the name of a file");
  EXPECT_EQ(complaint({"open", "dG9rZW4=", "--json"}), "\"open\" with --json needs --output");
}

TEST(Arguments, WhatIsNotUnderstoodIsSaid) {
  EXPECT_EQ(complaint({}), "a verb is needed");
  EXPECT_EQ(complaint({"--json"}), "a verb is needed");
  EXPECT_EQ(complaint({"fetch"}), "there is no verb \"fetch\"");
  EXPECT_EQ(complaint({"wake", "--fast"}), "there is no option --fast");
  EXPECT_EQ(complaint({"wake", "-x"}), "there is no option -x");
  EXPECT_EQ(complaint({"wake", "now"}), "\"wake\" takes no operands");
  EXPECT_EQ(complaint({"start", "a", "b"}), "\"start\" takes DOCUMENT PROVIDER CONSUMER");
  EXPECT_EQ(complaint({"bookmark", "a", "b"}), "\"bookmark\" takes DOCUMENT");
  EXPECT_EQ(complaint({"wake", "--json=yes"}), "--json takes no value");
}

TEST(Arguments, TimeoutMustBeAPositiveNumberOfSeconds) {
  for (const char *value : {"", "0", "-1", "ten", "1s", "nan", "inf", "1e9", "86401"}) {
    EXPECT_EQ(complaint({"wake", "--timeout", value}), "--timeout needs a number of seconds, from 0.001 to 86400")
        << value;
  }
  EXPECT_EQ(complaint({"wake", "--timeout"}), "--timeout needs a number of seconds, from 0.001 to 86400");
}

TEST(Arguments, HelpOfTheProgramNamesEveryVerbAndExitStatus) {
  const auto parsed = parseArguments({"--help"});
  ASSERT_TRUE(std::holds_alternative<HelpRequest>(parsed));
  const std::string text = helpText(std::get<HelpRequest>(parsed));
  for (const auto &verb : verbs()) EXPECT_THAT(text, HasSubstr("\n  " + std::string(verb.name) + " "));
  for (const char *status : {"\n  0  ", "\n  1  ", "\n  2  ", "\n  3  "}) EXPECT_THAT(text, HasSubstr(status));
}

TEST(Arguments, HelpOfAVerbNeedsNoOperandsAndNamesThem) {
  for (const auto &verb : verbs()) {
    const auto parsed = parseArguments({std::string(verb.name), "--help"});
    ASSERT_TRUE(std::holds_alternative<HelpRequest>(parsed)) << verb.name;
    const std::string text = helpText(std::get<HelpRequest>(parsed));
    EXPECT_THAT(text, HasSubstr("storixctl " + std::string(verb.name)));
    for (const auto &operand : verb.operands) EXPECT_THAT(text, HasSubstr("  " + std::string(operand.name) + " "));
    for (const auto &option : options()) {
      EXPECT_EQ(text.find("\n  " + std::string(option.name) + " ") != std::string::npos, verb.takes(option.option))
          << verb.name << option.name;
    }
  }
}

TEST(DocumentURL, PathsAndURLsNameTheSameDocument) {
  EXPECT_EQ(documentURL("file:///a/b%20c", "/x").value().path(), "/a/b c");
  EXPECT_EQ(documentURL("/a/b c", "/x").value(), documentURL("file:///a/b%20c", "/x").value());
  EXPECT_EQ(documentURL("b c", "/a").value(), documentURL("/a/b c", "/x").value());
  EXPECT_EQ(documentURL("/100% é", "/x").value().absoluteString(), "file:///100%25%20%C3%A9");
}

TEST(DocumentURL, APathThatEndsInASlashIsADirectory) {
  EXPECT_TRUE(documentURL("/a/b/", "/x").value().hasDirectoryPath());
  EXPECT_FALSE(documentURL("/a/b", "/x").value().hasDirectoryPath());
}

TEST(DocumentURL, WhatNamesNoFileIsRefused) {
  for (const char *operand : {"", "file:/a", "file://host/a", "file:///a%00b", "file:///a?b", "file:///a%zz"}) {
    EXPECT_FALSE(documentURL(operand, "/x").ok()) << operand;
  }
}

}  // namespace
}  // namespace storix::ctl
