#include "platform/Log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>

#include "platform/fake/FakeHostTest.h"

namespace storix {
namespace {

using fake::LogLine;
using testing::ElementsAre;
using testing::IsEmpty;

/// Counts how often it is described.
struct Described {
  mutable int count = 0;
  [[nodiscard]] std::string description() const {
    ++count;
    return "described";
  }
};

class LogTest : public fake::FakeHostTest {
 protected:
  std::vector<LogLine> lines() { return platform().log().take(); }
  std::string printed(const Value &value) {
    sx_default_log().info("%@", value);
    const std::vector<LogLine> all = lines();
    return all.empty() ? "" : all.back().text;
  }
};

TEST_F(LogTest, EachLevelHasItsSeverity) {
  sx_default_log().debug("[DEBUG] a");
  sx_default_log().info("[INFO] b");
  sx_default_log().notice("[NOTICE] c");
  sx_default_log().fault("[ERROR] d");
  EXPECT_THAT(lines(),
              ElementsAre(LogLine{LogSeverity::debug, "[DEBUG] a"}, LogLine{LogSeverity::info, "[INFO] b"},
                          LogLine{LogSeverity::standard, "[NOTICE] c"}, LogLine{LogSeverity::fault, "[ERROR] d"}));
}

TEST_F(LogTest, ArgumentsStandInTheOrderOfThePlaceholders) {
  sx_default_log().info("%s: %d tries of %@, %@", "start", -3, *URL::fromString("file:///a%20b"), std::string("last"));
  EXPECT_EQ(lines().front().text, "start: -3 tries of file:///a%20b, last");
}

TEST_F(LogTest, PlaceholdersInsideArgumentsAreLeftAlone) {
  sx_default_log().info("%@ and %@", "%@%d", "%s");
  EXPECT_EQ(lines().front().text, "%@%d and %s");
}

TEST_F(LogTest, NothingIsDescribedForASeverityThatIsOff) {
  const Described argument;
  platform().log().setEnabled(LogSeverity::debug, false);
  sx_default_log().debug("%@", argument);
  EXPECT_EQ(argument.count, 0);
  EXPECT_THAT(lines(), IsEmpty());
  sx_default_log().info("%@", argument);
  EXPECT_EQ(argument.count, 1);
}

TEST_F(LogTest, AbsentArgumentsPrintAsNull) {
  sx_default_log().info("%@ %@ %@ %@", std::optional<std::string>(), std::optional<URL>(), std::optional<SXError>(),
                        std::shared_ptr<Described>());
  EXPECT_EQ(lines().front().text, "(null) (null) (null) (null)");
  sx_default_log().info("%@ %@", std::optional<std::string>("here"), std::make_shared<Described>());
  EXPECT_EQ(lines().front().text, "here described");
}

TEST_F(LogTest, ValuesOfEveryKindPrintReadably) {
  EXPECT_EQ(printed(true), "true");
  EXPECT_EQ(printed(false), "false");
  EXPECT_EQ(printed(-12), "-12");
  EXPECT_EQ(printed(0.5), "0.5");
  EXPECT_EQ(printed("text"), "text");
  EXPECT_EQ(printed(*URL::fromString("file:///a")), "file:///a");
  EXPECT_EQ(printed(Data{"123"}), "<3 bytes>");
  EXPECT_EQ(printed(List{"a", 2, List{}}), "(a, 2, ())");
  EXPECT_EQ(printed(Dictionary{{"k", "v"}, {"k2", Dictionary{{"x", 1}}}}), "{k = v; k2 = {x = 1}}");
  EXPECT_EQ(printed(SXError("d", 7)), "d 7");
}

TEST_F(LogTest, ListOfTextsPrintsInParentheses) {
  sx_default_log().info("%@", std::vector<std::string>{"a", "b"});
  EXPECT_EQ(lines().front().text, "(a, b)");
}

TEST_F(LogTest, ErrorPrintsItsDomainCodeMessageAndCause) {
  const SXError cause("org.a", 5, {{"description", "Out of paper."}, {"underlyingError", SXError("org.b", 6)}});
  sx_default_log().fault("%@", SXError("d", -1, {{"description", "Failed."}, {"underlyingError", cause}}));
  EXPECT_EQ(lines().front().text, "d -1 \"Failed.\" (caused by org.a 5 \"Out of paper.\")");
}

TEST_F(LogTest, ArgumentCannotForgeALine) {
  sx_default_log().info("Item “%@”", "a\n[ERROR] forged\r\t\x1B[31m\x7F");
  EXPECT_EQ(lines().front().text, "Item “a\\n[ERROR] forged\\r\\t\\x1b[31m\\x7f”");
}

TEST_F(LogTest, ArgumentInsideAListOrAnErrorCannotForgeALineEither) {
  EXPECT_EQ(printed(List{"a\nb"}), "(a\\nb)");
  EXPECT_EQ(printed(SXError("d\n", 1, {{"description", "x\ny"}})), "d\\n 1 \"x\\ny\"");
}

TEST(EscapedForLog, PrintableTextStaysAsItIs) {
  EXPECT_EQ(escapedForLog("“é” 漢字 😀 \\ %"), "“é” 漢字 😀 \\ %");
  EXPECT_EQ(escapedForLog(""), "");
}

TEST(EscapedForLog, ControlCharactersOfUnicodeAreEscaped) {
  EXPECT_EQ(escapedForLog(std::string_view("a\0b", 3)), "a\\x00b");
  EXPECT_EQ(escapedForLog("\xC2\x85|\xC2\x9F|\xC2\xA0"), "\\xc2\\x85|\\xc2\\x9f|\xC2\xA0");
  EXPECT_EQ(escapedForLog("\xE2\x80\xA8|\xE2\x80\xA9|\xE2\x80\xAA"), "\\xe2\\x80\\xa8|\\xe2\\x80\\xa9|\xE2\x80\xAA");
}

TEST(EscapedForLog, BytesThatAreNotUTF8AreEscaped) {
  EXPECT_EQ(escapedForLog("a\xFFz"), "a\\xffz");
  EXPECT_EQ(escapedForLog("\xC0\xAF"), "\\xc0\\xaf");                    // overlong
  EXPECT_EQ(escapedForLog("\xE0\x80\x8A"), "\\xe0\\x80\\x8a");           // overlong line end
  EXPECT_EQ(escapedForLog("\xED\xA0\x80"), "\\xed\\xa0\\x80");           // surrogate
  EXPECT_EQ(escapedForLog("\xF4\x90\x80\x80"), "\\xf4\\x90\\x80\\x80");  // beyond Unicode
  EXPECT_EQ(escapedForLog("\xE2\x80"), "\\xe2\\x80");                    // cut off
  EXPECT_EQ(escapedForLog("\xE2\x80x"), "\\xe2\\x80x");
}

TEST(LogWithoutScope, LinesAreDropped) {
  const Described argument;
  sx_default_log().fault("%@", argument);
  EXPECT_EQ(argument.count, 0);
}

TEST(LogWithoutScope, HandleIsTheSameEveryTime) { EXPECT_EQ(&sx_default_log(), &sx_default_log()); }

TEST(ProgrammingErrorDeathTest, EndsTheProcessAndSaysWhatWasWrong) {
  EXPECT_DEATH(endProcessForProgrammingError("An identifier\nis absent."),
               "storix: programming error: An identifier\\\\nis absent\\.");
}

using LogDeathTest = LogTest;

TEST_F(LogDeathTest, ProgrammingErrorReachesTheSinkBeforeTheEnd) {
  platform().log().setObserver([](const LogLine &line) {
    if (line.severity == LogSeverity::fault) std::fprintf(stderr, "sink: %s\n", line.text.c_str());
  });
  EXPECT_DEATH(endProcessForProgrammingError("An identifier is absent."),
               "sink: \\[ERROR\\] Ending the process after a programming error: An identifier is absent\\.");
}

}  // namespace
}  // namespace storix
