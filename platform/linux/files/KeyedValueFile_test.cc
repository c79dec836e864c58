#include "platform/linux/files/KeyedValueFile.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <limits>
#include <thread>

#include "platform/linux/TestDirectory.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

Dictionary parsed(const std::string &text) {
  Result<Dictionary> result = parseKeyedValues(text, "sample.kvs");
  if (!result) {
    ADD_FAILURE() << result.error().message();
    return {};
  }
  return result.value();
}

std::string refusal(std::string_view text) {
  const Result<Dictionary> result = parseKeyedValues(text, "sample.kvs");
  if (result) return "accepted";
  EXPECT_EQ(result.error().domain(), filesErrorDomain);
  EXPECT_EQ(result.error().code(), keyedValueFormatErrorCode);
  return result.error().message();
}

std::string textOf(const Dictionary &content) {
  const Result<std::string> text = keyedValueText(content);
  return text ? text.value() : "refused: " + text.error().message();
}

std::string nested(std::size_t levels) {
  std::string text;
  for (std::size_t i = 0; i < levels; ++i) text += R"({"a":)";
  text += "1";
  text.append(levels, '}');
  return text;
}

mode_t modeOf(const std::string &path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
  return status.st_mode & 07777;
}

// The writer takes many characters at once where it can.
TEST(KeyedValueText, WhatIsWrittenInItsOwnWayStandsAnywhereInAText) {
  for (const std::string special : {"\"", "\\", "\x01", "é", "\x7F"}) {
    for (std::size_t before = 0; before < 36; ++before) {
      for (const std::size_t after : {0U, 1U, 15U, 16U, 33U}) {
        const std::string text = std::string(before, 'a') + special + std::string(after, 'b');
        EXPECT_EQ(parsed(textOf({{text, text}})), (Dictionary{{text, text}})) << before << ", " << after;
      }
      EXPECT_THAT(textOf({{"a", std::string(before, 'a') + "\xE2\x82" + std::string(36, 'b')}}),
                  HasSubstr("is not UTF-8"));
    }
  }
}

TEST(KeyedValueText, EveryKindIsReadBackAsItWasWritten) {
  const Dictionary content{{"text", "é “quoted” \"x\" \\ \n \x01"},
                           {"zero", std::string("a\0b", 3)},
                           {"", "empty key"},
                           {"least", std::numeric_limits<std::int64_t>::min()},
                           {"most", std::numeric_limits<std::int64_t>::max()},
                           {"real", 0.1},
                           {"whole real", 3.0},
                           {"tiny", std::numeric_limits<double>::denorm_min()},
                           {"huge", std::numeric_limits<double>::max()},
                           {"yes", true},
                           {"no", false},
                           {"list", List{1, "two", List{}, Dictionary{}}},
                           {"dictionary", Dictionary{{"AllowedItemIDs", List{"a/b", ""}}}}};
  const Dictionary back = parsed(textOf(content));
  EXPECT_EQ(Value(back), Value(content));
  EXPECT_NE(back.at("whole real").real(), nullptr);
  EXPECT_NE(back.at("most").integer(), nullptr);
  EXPECT_NE(back.at("yes").boolean(), nullptr);
}

TEST(KeyedValueText, KeysAreSortedAndTheTextEndsInALineEnd) {
  EXPECT_EQ(textOf({{"b", 1}, {"a", List{true}}, {"B", Dictionary{{"z", "1"}, {"y", 2.5}}}}),
            "{\"B\":{\"y\":2.5,\"z\":\"1\"},\"a\":[true],\"b\":1}\n");
  EXPECT_EQ(textOf({}), "{}\n");
}

TEST(KeyedValueText, WholeNumbersTooLargeForAnIntegerAreRead) {
  const Dictionary content =
      parsed(R"({"a": 9223372036854775807, "b": 9223372036854775808, "c": 36893488147419103232})");
  EXPECT_EQ(*content.at("a").integer(), std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(*content.at("b").real(), 9223372036854775808.0);
  EXPECT_EQ(*content.at("c").real(), 36893488147419103232.0);
}

TEST(KeyedValueText, NumbersWithExponentsAtTheirLimitsAreRead) {
  const Dictionary content = parsed(R"({"a": 0e308, "b": -0e-400, "d": 1e-400, "e": 1e308, "f": 0.0e308})");
  EXPECT_EQ(*content.at("a").real(), 0.0);
  EXPECT_EQ(*content.at("b").real(), 0.0);
  EXPECT_EQ(*content.at("d").real(), 0.0);
  EXPECT_EQ(*content.at("e").real(), 1e308);
  EXPECT_EQ(*content.at("f").real(), 0.0);
  EXPECT_THAT(refusal(R"({"a": 1e309})"), HasSubstr("Number too big to be stored in double"));
}

TEST(KeyedValueText, SyntaxErrorSaysLineColumnAndByte) {
  EXPECT_THAT(refusal("{\n  \"a\": 1,\n  \"b\" 2\n}"),
              HasSubstr("sample.kvs: line 3, column 7 (byte 19): Missing a colon"));
  EXPECT_THAT(refusal(""), HasSubstr("line 1, column 1 (byte 1): The document is empty"));
  EXPECT_THAT(refusal("{\"a\": \"x"), HasSubstr("byte 9"));
  EXPECT_THAT(refusal("{\"a\": tru}"), HasSubstr("Invalid value"));
  EXPECT_THAT(refusal("{'a': 1}"), HasSubstr("Missing a name"));
  EXPECT_THAT(refusal("{\"a\": [1,]}"), HasSubstr("Invalid value"));
  EXPECT_THAT(refusal("{\"a\": 1e999}"), HasSubstr("too big"));
  EXPECT_THAT(refusal("{\"a\": NaN}"), HasSubstr("Invalid value"));
  EXPECT_THAT(refusal("\xEF\xBB\xBF{}"), HasSubstr("byte 1"));
}

TEST(KeyedValueText, DuplicateKeyIsRefusedInEveryOrderAndLevel) {
  EXPECT_THAT(refusal(R"({"a": 1, "a": 1})"), HasSubstr("column 13 (byte 13): the key “a” stands twice in one object"));
  EXPECT_THAT(refusal(R"({"b": 1, "a": 1, "b": 2})"), HasSubstr("the key “b” stands twice"));
  EXPECT_THAT(refusal(R"({"x": [{"a": 1, "\u0061": {}}]})"), HasSubstr("the key “a” stands twice"));
  EXPECT_EQ(parsed(R"({"x": {"a": 1}, "y": {"a": 1}})").size(), 2U);
}

TEST(KeyedValueText, SixtyFourLevelsAreReadAndOneMoreIsRefused) {
  EXPECT_EQ(parsed(nested(64)).size(), 1U);
  EXPECT_THAT(refusal(nested(65)), HasSubstr("more than 64 levels"));
  EXPECT_THAT(refusal("{\"a\":" + std::string(100000, '[')), HasSubstr("more than 64 levels"));
}

TEST(KeyedValueText, RootThatIsNoObjectIsRefused) {
  for (const char *text : {"[]", "1", "\"x\"", "true", "[{}]", "-1", "1.5", "18446744073709551615"}) {
    EXPECT_THAT(refusal(text), HasSubstr("the text is not an object")) << text;
  }
}

TEST(KeyedValueText, NullIsRefused) {
  EXPECT_THAT(refusal("{\"a\": null}"), HasSubstr("column 11 (byte 11): null is no value here"));
  EXPECT_THAT(refusal("null"), HasSubstr("null is no value here"));
}

TEST(KeyedValueText, TextAfterTheObjectIsRefused) {
  EXPECT_THAT(refusal("{} {}"), HasSubstr("byte 4"));
  EXPECT_THAT(refusal("{}x"), HasSubstr("byte 3"));
  EXPECT_THAT(refusal(std::string_view("{}\0", 3)), HasSubstr("byte 3): a zero byte"));
  EXPECT_THAT(refusal(std::string_view("{}\0{\"a\":1}", 10)), HasSubstr("a zero byte"));
  EXPECT_TRUE(parsed(" \n{ } \t\r\n").empty());
}

TEST(KeyedValueText, TextThatIsNotUtf8IsRefused) {
  EXPECT_THAT(refusal("{\"a\": \"\xFF\"}"), HasSubstr("byte 8): Invalid encoding"));
  EXPECT_THAT(refusal("{\"\xC0\xAF\": 1}"), HasSubstr("Invalid encoding"));
  EXPECT_THAT(refusal("{\"a\": \"\xED\xA0\x80\"}"), HasSubstr("Invalid encoding"));
  EXPECT_THAT(refusal("{\"a\": \"\xF4\x90\x80\x80\"}"), HasSubstr("Invalid encoding"));
  EXPECT_THAT(refusal("{\"a\": \"\xE2\x82\"}"), HasSubstr("Invalid encoding"));
  EXPECT_THAT(refusal(R"({"a": "\ud800"})"), HasSubstr("surrogate"));
  EXPECT_THAT(refusal(R"({"a": "\udc00"})"), HasSubstr("half a character"));
  EXPECT_THAT(refusal(R"({"\udfff": 1})"), HasSubstr("half a character"));
  EXPECT_EQ(*parsed(R"({"a": "\ud83d\ude00\ud7ff"})").at("a").string(), "😀\xED\x9F\xBF");
}

TEST(KeyedValueText, NamesInErrorsCannotForgeLines) {
  const Result<Dictionary> result = parseKeyedValues("", "a\n[ERROR] b\xFF");
  ASSERT_FALSE(result);
  EXPECT_THAT(result.error().message(), HasSubstr("a\\n[ERROR] b\\xff"));
  EXPECT_THAT(refusal("{\"a\\nb\": 1, \"a\\nb\": 2}"), HasSubstr("the key “a\\nb” stands twice"));
}

TEST(KeyedValueText, WhatCannotBeReadBackIsNotWritten) {
  EXPECT_THAT(textOf({{"a", *URL::fromString("file:///a")}}), HasSubstr("kind URL cannot be written"));
  EXPECT_THAT(textOf({{"a", Data{"x"}}}), HasSubstr("kind data cannot be written"));
  EXPECT_THAT(textOf({{"a", List{SXNotPermittedError()}}}), HasSubstr("kind error cannot be written"));
  EXPECT_THAT(textOf({{"a", std::numeric_limits<double>::infinity()}}), HasSubstr("not finite"));
  EXPECT_THAT(textOf({{"a", std::numeric_limits<double>::quiet_NaN()}}), HasSubstr("not finite"));
  EXPECT_THAT(textOf({{"a", "\xFF"}}), HasSubstr("is not UTF-8"));
  EXPECT_THAT(textOf({{"\xED\xA0\x80", 1}}), HasSubstr("is not UTF-8"));

  Value deep = Dictionary();
  for (int i = 0; i < 63; ++i) deep = i % 2 == 0 ? Value(Dictionary{{"a", deep}}) : Value(List{deep});
  const Value tooDeep = Dictionary{{"a", deep}};
  EXPECT_EQ(parsed(textOf({{"a", List{}}})).size(), 1U);
  EXPECT_EQ(Value(parsed(textOf(*deep.dictionary()))), deep);
  EXPECT_THAT(textOf(*tooDeep.dictionary()), HasSubstr("more than 64 levels"));
}

TEST(KeyedValueFile, FileOfManyPiecesIsReadAndItsErrorPlaced) {
  const TestDirectory directory;
  Dictionary content;
  for (int i = 0; i < 20000; ++i) content.emplace("key " + std::to_string(i), List{i, std::string(20, 'x')});
  ASSERT_EQ(writeKeyedValueFile(content, directory / "a.kvs"), std::nullopt);
  const Result<Dictionary> back = readKeyedValueFile(directory / "a.kvs");
  ASSERT_TRUE(back) << back.error().message();
  EXPECT_EQ(Value(back.value()), Value(content));

  std::string text = "{\n";
  for (int i = 0; i < 20000; ++i) text += "\"" + std::to_string(i) + "\": 1,\n";
  text += "\"0\": 2}";
  directory.makeFile("b.kvs", text);
  const Result<Dictionary> refused = readKeyedValueFile(directory / "b.kvs");
  ASSERT_FALSE(refused);
  EXPECT_THAT(refused.error().message(),
              HasSubstr("line 20002, column 4 (byte " + std::to_string(text.size() - 3) + ")"));
}

TEST(KeyedValueFile, FileBeyondTheSizeLimitIsRefusedBeforeItIsRead) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("large.kvs", "{}");
  ASSERT_EQ(::truncate(path.c_str(), static_cast<off_t>(keyedValueSizeLimit) + 1), 0);
  const Result<Dictionary> refused = readKeyedValueFile(path);
  ASSERT_FALSE(refused);
  EXPECT_THAT(refused.error().message(), HasSubstr("byte 268435457: the text is longer than 268435456 bytes"));

  const std::string small = directory.makeFile("small.kvs", "{\n}  ");
  const UniqueFd fd(::open(small.c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_FALSE(readKeyedValues(fd.get(), "small.kvs", 4));
  EXPECT_TRUE(readKeyedValues(fd.get(), "small.kvs", 5));
}

TEST(KeyedValueFile, TextThatGrowsBeyondTheLimitWhileItIsReadIsRefused) {
  for (const std::size_t limit : {4U, 5U}) {
    std::array<int, 2> ends{};
    ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    const UniqueFd readEnd(ends[0]);
    UniqueFd writeEnd(ends[1]);
    ASSERT_EQ(::write(writeEnd.get(), "{\n}  ", 5), 5);
    writeEnd.reset();
    const Result<Dictionary> result = readKeyedValues(readEnd.get(), "pipe", limit);
    EXPECT_EQ(result.ok(), limit == 5);
    if (result) continue;
    EXPECT_EQ(result.error().code(), keyedValueFormatErrorCode);
    EXPECT_THAT(result.error().message(),
                HasSubstr("pipe: line 2, column 3 (byte 5): the text is longer than 4 bytes"));
  }
}

TEST(KeyedValueFile, WhatIsNoFileIsRefusedWithoutWaiting) {
  const TestDirectory directory;
  ASSERT_EQ(::mkfifo((directory / "fifo").c_str(), 0600), 0);
  EXPECT_EQ(readKeyedValueFile(directory / "fifo").error().code(), EINVAL);
  EXPECT_EQ(readKeyedValueFile(directory.path()).error().code(), EINVAL);
  EXPECT_EQ(readKeyedValueFile("/dev/zero").error().code(), EINVAL);
  EXPECT_EQ(readKeyedValueFile(directory / "absent").error().code(), ENOENT);
  EXPECT_EQ(readKeyedValueFile(directory / "absent").error().domain(), posixErrorDomain);
  const UniqueFd unreadable(::open(directory.path().c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(readKeyedValues(unreadable.get(), "x").error().code(), EISDIR);
}

TEST(KeyedValueFile, NewFileIsPrivateAndNothingElseIsLeft) {
  const TestDirectory directory;
  ASSERT_EQ(writeKeyedValueFile({{"a", 1}}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs"), "{\"a\":1}\n");
  EXPECT_EQ(modeOf(directory / "a.kvs"), 0600U);
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs"), "{}\n");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
}

TEST(KeyedValueFile, ReaderThatHasTheFileOpenKeepsTheOldContent) {
  const TestDirectory directory;
  ASSERT_EQ(writeKeyedValueFile({{"a", 1}}, directory / "a.kvs"), std::nullopt);
  const UniqueFd reader(::open((directory / "a.kvs").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(writeKeyedValueFile({{"a", 2}}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(readKeyedValues(reader.get(), "a.kvs").value(), Dictionary({{"a", 1}}));
}

TEST(KeyedValueFile, ReadOnlyFileAndLinkAreReplaced) {
  const TestDirectory directory;
  directory.makeFile("target", "mine");
  directory.makeLink("a.kvs", "target");
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(directory.contentOf("target"), "mine");
  EXPECT_FALSE(std::filesystem::is_symlink(directory / "a.kvs"));
  ASSERT_EQ(::chmod((directory / "a.kvs").c_str(), 0400), 0);
  EXPECT_EQ(writeKeyedValueFile({{"a", 1}}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(modeOf(directory / "a.kvs"), 0600U);
}

TEST(KeyedValueFile, FailedWriteLeavesTheOldFileAndNoOther) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("a.kvs", "old");
  EXPECT_EQ(writeKeyedValueFile({{"a", Data{"x"}}}, path)->domain(), filesErrorDomain);
  EXPECT_EQ(writeKeyedValueFile({}, directory / "absent/a.kvs")->code(), ENOENT);
  EXPECT_EQ(writeKeyedValueFile({}, path + "/a.kvs")->code(), ENOTDIR);
  EXPECT_EQ(writeKeyedValueFile({}, directory / "")->code(), EINVAL);
  EXPECT_EQ(writeKeyedValueFile({}, directory / "..")->code(), EINVAL);
  EXPECT_EQ(writeKeyedValueFile({}, directory / std::string(252, 'a'))->code(), ENAMETOOLONG);
  directory.makeDirectory("directory.kvs");
  EXPECT_EQ(writeKeyedValueFile({}, directory / "directory.kvs")->code(), EISDIR);
  EXPECT_EQ(writeKeyedValueFile({}, directory / "directory.kvs", PreviousFile::keptAsCorrupt)->code(), EISDIR);
  EXPECT_EQ(directory.contentOf("a.kvs"), "old");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs", "directory.kvs"));
}

TEST(KeyedValueFile, DiskThatTakesOnlyHalfLeavesTheOldFile) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("a.kvs", "old");
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{1000, 1000};
    ::setrlimit(RLIMIT_FSIZE, &limit);
    const std::optional<SXError> error = writeKeyedValueFile({{"a", std::string(5000, 'x')}}, path);
    ::_exit(error && error->code() == EFBIG ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(directory.contentOf("a.kvs"), "old");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
}

TEST(KeyedValueFile, WhatACrashLeftIsUsedUp) {
  const TestDirectory directory;
  directory.makeFile(".a.kvs.new", std::string(10000, 'x'));
  ASSERT_EQ(::chmod((directory / ".a.kvs.new").c_str(), 0666), 0);
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs"), "{}\n");
  EXPECT_EQ(modeOf(directory / "a.kvs"), 0600U);
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
}

TEST(KeyedValueFile, ForeignThingUnderTheTemporaryNameIsNotWrittenThrough) {
  const TestDirectory directory;
  directory.makeFile("victim", "precious");
  directory.makeLink(".a.kvs.new", "victim");
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  std::filesystem::create_hard_link(directory / "victim", directory / ".a.kvs.new");
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  ASSERT_EQ(::mkfifo((directory / ".a.kvs.new").c_str(), 0600), 0);
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs"), std::nullopt);
  EXPECT_EQ(directory.contentOf("victim"), "precious");
  EXPECT_EQ(directory.contentOf("a.kvs"), "{}\n");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs", "victim"));
}

TEST(KeyedValueFile, PreviousFileIsKeptForOneGeneration) {
  const TestDirectory directory;
  directory.makeFile("a.kvs", "first");
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs", PreviousFile::keptAsCorrupt), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "first");
  directory.makeFile("a.kvs", "second");
  ASSERT_EQ(writeKeyedValueFile({}, directory / "a.kvs", PreviousFile::keptAsCorrupt), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "second");
  EXPECT_EQ(directory.contentOf("a.kvs"), "{}\n");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs", "a.kvs.corrupt"));
  ASSERT_EQ(::unlink((directory / "a.kvs").c_str()), 0);
  EXPECT_EQ(writeKeyedValueFile({}, directory / "a.kvs", PreviousFile::keptAsCorrupt), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "second");
}

TEST(KeyedValueFile, PreviousFileThatCannotBeKeptIsNotReplaced) {
  const TestDirectory directory;
  directory.makeFile("a.kvs", "precious");
  directory.makeDirectory("a.kvs.corrupt");
  EXPECT_NE(writeKeyedValueFile({}, directory / "a.kvs", PreviousFile::keptAsCorrupt), std::nullopt);
  EXPECT_EQ(directory.contentOf("a.kvs"), "precious");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs", "a.kvs.corrupt"));
}

TEST(KeyedValueFile, ManyWritersOfOnePathEachPutAWholeFileInPlace) {
  const TestDirectory directory;
  const std::string path = directory / "a.kvs";
  ASSERT_EQ(writeKeyedValueFile({{"a", "start"}}, path), std::nullopt);
  std::vector<std::thread> writers;
  writers.reserve(4);
  for (int writer = 0; writer < 4; ++writer) {
    writers.emplace_back([&path, writer] {
      for (int i = 0; i < 10; ++i) {
        const std::optional<SXError> error =
            writeKeyedValueFile({{"a", std::string(static_cast<std::size_t>(writer * 30000 + i), 'x')}}, path);
        EXPECT_FALSE(error) << error->message();
        const Result<Dictionary> read = readKeyedValueFile(path);
        EXPECT_TRUE(read) << read.error().message();
      }
    });
  }
  for (std::thread &writer : writers) writer.join();
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
}

}  // namespace
}  // namespace storix::linuxhost
