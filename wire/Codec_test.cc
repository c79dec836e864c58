#include "wire/Codec.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "platform/SXError.h"
#include "wire/TestConnection.h"

namespace storix::wire {
namespace {

using testing::HasSubstr;

const ProtocolDescription &everyKind() {
  static const ProtocolDescription protocol{"Every",
                                            "org.sample.Every",
                                            "/org/sample",
                                            {{"every",
                                              "Every",
                                              {{"string", ValueKind::string},
                                               {"URL", ValueKind::URL},
                                               {"data", ValueKind::data},
                                               {"error", ValueKind::error},
                                               {"dictionary", ValueKind::dictionary}},
                                              {}},
                                             {"one", "One", {{"dictionary", ValueKind::dictionary}}, {}},
                                             {"failure", "Failure", {{"error", ValueKind::error}}, {}}}};
  return protocol;
}

class CodecTest : public testing::Test {
 protected:
  enum Row : std::size_t { everyRow, oneRow, failureRow };

  OwnedMessage newMessage() { return client_.message("/org/sample", "org.sample.Every", "Every"); }

  static MessageRow rowAt(std::size_t row, const LinkInterface &interface) {
    return {interface, everyKind().operations[row], interfaceOf(everyKind()).methods[row].inSignature, false};
  }

  static void seal(const OwnedMessage &message) { ASSERT_GE(sd_bus_message_seal(message.get(), 1, 0), 0); }

  /// Written into a message and read from it again.
  std::variant<Arguments, MethodFailure> roundTrip(std::size_t row, const Arguments &arguments) {
    const OwnedMessage message = newMessage();
    if (auto failure = appendArguments(message.get(), rowAt(row, interface_), arguments)) return *failure;
    seal(message);
    return readArguments(message.get(), rowAt(row, interface_));
  }
  Value sentAndRead(const Value &value) {
    const auto result = roundTrip(oneRow, {Value(Dictionary{{"value", value}})});
    const Arguments *arguments = std::get_if<Arguments>(&result);
    EXPECT_TRUE(arguments) << std::get<MethodFailure>(result).text;
    return arguments ? arguments->front()->dictionary()->at("value") : Value("nothing");
  }

  /// The failure of reading a dictionary argument whose one value was written by hand.
  template <class... Content>
  MethodFailure readingFails(const char *types, Content... content) {
    const OwnedMessage message = newMessage();
    EXPECT_GE(sd_bus_message_append(message.get(), types, content...), 0);
    seal(message);
    auto result = readArguments(message.get(), rowAt(oneRow, interface_));
    EXPECT_TRUE(std::holds_alternative<MethodFailure>(result));
    return std::holds_alternative<MethodFailure>(result) ? std::get<MethodFailure>(result) : MethodFailure{};
  }

  LinkInterface interface_{everyKind()};
  std::pair<UniqueFd, UniqueFd> sockets_ = makeSocketPair();
  PlainClient client_{std::move(sockets_.first)};
};

TEST_F(CodecTest, EveryKindMayBeAbsent) {
  const Arguments absent(5);
  EXPECT_EQ(std::get<Arguments>(roundTrip(everyRow, absent)), absent);
}

TEST_F(CodecTest, EveryKindMayBeEmptyAndIsNotAbsentThen) {
  const Arguments empty{Value(""), Value(*URL::fromString("file:///")), Value(Data{}), Value(SXError("", 0)),
                        Value(Dictionary{})};
  EXPECT_EQ(std::get<Arguments>(roundTrip(everyRow, empty)), empty);
}

TEST_F(CodecTest, EveryKindInsideADictionaryKeepsItsKind) {
  for (const Value &value :
       {Value(true), Value(false), Value(0), Value(std::numeric_limits<std::int64_t>::min()), Value(0.0), Value(-1.5),
        Value("file:///a"), Value(*URL::fromString("file:///a")), Value(Data{std::string("\0\xff", 2)}),
        Value(List{Value(List{}), Value("x")}), Value(Dictionary{{"", Value(Dictionary{})}}),
        Value(SXError("d", 5, {{"underlyingError", Value(SXError("e", 6))}}))}) {
    const Value read = sentAndRead(value);
    EXPECT_EQ(read, value);
    EXPECT_EQ(read.kind(), value.kind());
  }
}

TEST_F(CodecTest, ArgumentOfAnotherKindIsNotSent) {
  const auto result = roundTrip(oneRow, {Value("text")});
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).text,
            "the argument \"dictionary\" must be of the kind dictionary, not string");
}

TEST_F(CodecTest, AnotherNumberOfArgumentsIsNotSent) {
  const auto result = roundTrip(oneRow, {});
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::invalidArgs);
}

TEST_F(CodecTest, TypesThatTheTableDoesNotHaveAreRefused) {
  for (const char *type : {"u", "i", "t", "q", "o", "g", "as", "a{ss}", "(ss)", "v", "aay"}) {
    const OwnedMessage message = newMessage();
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'a', "a{sv}"), 0);
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'a', "{sv}"), 0);
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'e', "sv"), 0);
    ASSERT_GE(sd_bus_message_append(message.get(), "s", "key"), 0);
    const std::string_view view(type);
    if (view == "o") {
      ASSERT_GE(sd_bus_message_append(message.get(), "v", type, "/a"), 0);
    } else if (view == "g") {
      ASSERT_GE(sd_bus_message_append(message.get(), "v", type, "s"), 0);
    } else if (view == "(ss)") {
      ASSERT_GE(sd_bus_message_append(message.get(), "v", type, "a", "b"), 0);
    } else if (view == "v") {
      ASSERT_GE(sd_bus_message_append(message.get(), "v", type, "s", "a"), 0);
    } else {
      ASSERT_GE(sd_bus_message_append(message.get(), "v", type, 0, 0), 0);
    }
    for (int i = 0; i < 3; ++i) ASSERT_GE(sd_bus_message_close_container(message.get()), 0);
    seal(message);
    const auto result = readArguments(message.get(), rowAt(oneRow, interface_));
    ASSERT_TRUE(std::holds_alternative<MethodFailure>(result)) << type;
    EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::invalidArgs);
    EXPECT_THAT(std::get<MethodFailure>(result).text, HasSubstr("\"" + std::string(type) + "\""));
  }
}

TEST_F(CodecTest, KeyThatStandsTwiceIsRefused) {
  const MethodFailure failure = readingFails("aa{sv}", 1, 2, "key", "s", "a", "key", "s", "b");
  EXPECT_EQ(failure.name, busErrorName::invalidArgs);
  EXPECT_EQ(failure.text, "a dictionary has a key twice");
}

TEST_F(CodecTest, URLInsideADictionaryIsCheckedToo) {
  EXPECT_EQ(readingFails("aa{sv}", 1, 1, "key", "(s)", "http://a").name, busErrorName::invalidArgs);
}

TEST_F(CodecTest, TwoValuesOfAnyKindAreRefused) {
  EXPECT_EQ(readingFails("aa{sv}", 2, 0, 0).text, "the argument \"dictionary\" may have one value at most");
}

// --- Nesting

Value nestedDictionaries(int levels) {
  Value value{Dictionary{}};
  for (int i = 1; i < levels; ++i) value = Value(Dictionary{{"inside", value}});
  return value;
}

SXError nestedErrors(int levels) {
  SXError error("domain", 1);
  for (int i = 1; i < levels; ++i) error = SXError("domain", i + 1, {{"underlyingError", Value(error)}});
  return error;
}

TEST_F(CodecTest, SixteenLevelsPass) {
  const Arguments dictionaries{nestedDictionaries(maximumNesting)};
  EXPECT_EQ(std::get<Arguments>(roundTrip(oneRow, dictionaries)), dictionaries);
  const Arguments errors{Value(nestedErrors(maximumNesting))};
  EXPECT_EQ(std::get<Arguments>(roundTrip(failureRow, errors)), errors);
}

TEST_F(CodecTest, WhatIsNestedDeeperIsCutWithAWord) {
  const auto result = roundTrip(failureRow, {Value(nestedErrors(100))});
  ASSERT_TRUE(std::holds_alternative<Arguments>(result)) << std::get<MethodFailure>(result).text;
  const SXError *error = std::get<Arguments>(result).front()->error();
  for (int level = 2; level < maximumNesting; ++level) {
    ASSERT_TRUE(error->underlyingError()) << level;
    error = error->underlyingError();
  }
  EXPECT_EQ(error->code(), 100 - maximumNesting + 2);
  EXPECT_EQ(error->stringDetail("underlyingError"), "(cut: nested too deeply)");
}

TEST_F(CodecTest, DeepListsAndDictionariesAreCutToo) {
  Value list{List{}};
  for (int i = 0; i < 100; ++i) list = Value(List{list});
  EXPECT_TRUE(std::holds_alternative<Arguments>(roundTrip(oneRow, {Value(Dictionary{{"list", list}})})));
  EXPECT_TRUE(std::holds_alternative<Arguments>(roundTrip(oneRow, {nestedDictionaries(1000)})));
}

TEST_F(CodecTest, DeeperNestingOfAPeerIsRefused) {
  const OwnedMessage message = newMessage();
  ASSERT_GE(sd_bus_message_open_container(message.get(), 'a', "a{sv}"), 0);
  for (int level = 1; level <= maximumNesting; ++level) {
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'a', "{sv}"), 0);
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'e', "sv"), 0);
    ASSERT_GE(sd_bus_message_append(message.get(), "s", "key"), 0);
    if (level == maximumNesting) break;
    ASSERT_GE(sd_bus_message_open_container(message.get(), 'v', "a{sv}"), 0);
  }
  ASSERT_GE(sd_bus_message_append(message.get(), "v", "s", "level 17"), 0);
  for (int level = maximumNesting; level >= 1; --level) {
    ASSERT_GE(sd_bus_message_close_container(message.get()), 0);
    ASSERT_GE(sd_bus_message_close_container(message.get()), 0);
    ASSERT_GE(sd_bus_message_close_container(message.get()), 0);
  }
  seal(message);
  const auto result = readArguments(message.get(), rowAt(oneRow, interface_));
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::limitsExceeded);
}

// --- Limits

TEST_F(CodecTest, LongestStringPassesAndALongerOneDoesNot) {
  const Arguments fits{Value(std::string(maximumStringSize, 'x')), {}, {}, {}, {}};
  EXPECT_EQ(std::get<Arguments>(roundTrip(everyRow, fits)), fits);
  const auto result = roundTrip(everyRow, {Value(std::string(maximumStringSize + 1, 'x')), {}, {}, {}, {}});
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::limitsExceeded);
  EXPECT_EQ(std::get<MethodFailure>(result).text, "the argument \"string\" is longer than 65536 bytes");
}

TEST_F(CodecTest, MessageBeyondOneMebibyteIsNotMade) {
  const auto filled = [](std::size_t size) { return Arguments{{}, {}, Value(Data{std::string(size, 'x')}), {}, {}}; };
  EXPECT_TRUE(std::holds_alternative<Arguments>(roundTrip(everyRow, filled(maximumMessageSize - 2048))));
  const auto result = roundTrip(everyRow, filled(maximumMessageSize - 512));
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::limitsExceeded);
}

TEST_F(CodecTest, ManySmallValuesAreCountedToo) {
  List list;
  for (int i = 0; i < 100'000; ++i) list.emplace_back(i);
  const auto result = roundTrip(oneRow, {Value(Dictionary{{"list", Value(std::move(list))}})});
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(result));
  EXPECT_EQ(std::get<MethodFailure>(result).name, busErrorName::limitsExceeded);
}

TEST_F(CodecTest, BytesThatAreNoTextAreWrittenOutInsteadOfSpoilingTheMessage) {
  EXPECT_EQ(sentAndRead(Value("caf\xC3\xA9")), Value("caf\xC3\xA9"));
  EXPECT_EQ(sentAndRead(Value("caf\xE9")), Value("caf\\xe9"));
  EXPECT_EQ(sentAndRead(Value(std::string("a\0b", 3))), Value("a\\x00b"));
  // Code points that never are characters.
  EXPECT_EQ(sentAndRead(Value("\xEF\xB7\x90")), Value("\\xef\\xb7\\x90"));
  EXPECT_EQ(sentAndRead(Value("\xEF\xBF\xBE")), Value("\\xef\\xbf\\xbe"));
  EXPECT_EQ(sentAndRead(Value("\xF0\x9F\xBF\xBF")), Value("\\xf0\\x9f\\xbf\\xbf"));
  // Their neighbours are.
  EXPECT_EQ(sentAndRead(Value("\xEF\xBF\xBD\xF0\x9F\x98\x80")), Value("\xEF\xBF\xBD\xF0\x9F\x98\x80"));
  EXPECT_EQ(sentAndRead(Value("\xE0\xBF\xBF")), Value("\xE0\xBF\xBF"));
}

// --- Permitted kinds

TEST_F(CodecTest, KindThatIsNotPermittedIsRefusedAtAnyDepthBothWays) {
  const Arguments arguments{Value(Dictionary{{"a", Value(Dictionary{{"b", Value(1)}})}})};
  const OwnedMessage message = newMessage();
  ASSERT_EQ(appendArguments(message.get(), rowAt(oneRow, interface_), arguments), std::nullopt);
  seal(message);
  interface_.setPermittedKinds({ValueKind::dictionary, ValueKind::string}, "one", 0, false);
  const auto read = readArguments(message.get(), rowAt(oneRow, interface_));
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(read));
  EXPECT_EQ(std::get<MethodFailure>(read).name, busErrorName::invalidArgs);
  const auto written = roundTrip(oneRow, arguments);
  ASSERT_TRUE(std::holds_alternative<MethodFailure>(written));
  EXPECT_EQ(std::get<MethodFailure>(written).name, busErrorName::invalidArgs);
}

TEST_F(CodecTest, PermittedKindsSpeakOfTheirOwnSideAlone) {
  const Arguments arguments{Value(Dictionary{{"b", Value(1)}})};
  interface_.setPermittedKinds({ValueKind::string}, "one", 0, true);
  EXPECT_EQ(std::get<Arguments>(roundTrip(oneRow, arguments)), arguments);
}

}  // namespace
}  // namespace storix::wire
