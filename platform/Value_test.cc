#include "platform/Value.h"

#include <gtest/gtest.h>

#include "platform/SXError.h"

namespace storix {
namespace {

TEST(Value, EachKindIsReadBackAsItselfAndAsNothingElse) {
  const std::vector<std::pair<Value, ValueKind>> values{{Value(true), ValueKind::boolean},
                                                        {Value(7), ValueKind::number},
                                                        {Value(7.5), ValueKind::number},
                                                        {Value("text"), ValueKind::string},
                                                        {Value(*URL::fromString("file:///a")), ValueKind::URL},
                                                        {Value(Data{"bytes"}), ValueKind::data},
                                                        {Value(List{1, "b"}), ValueKind::list},
                                                        {Value(Dictionary{{"k", 1}}), ValueKind::dictionary},
                                                        {Value(SXNotPermittedError()), ValueKind::error}};
  for (const auto &[value, kind] : values) {
    EXPECT_EQ(value.kind(), kind);
    EXPECT_EQ(value.boolean() != nullptr, kind == ValueKind::boolean);
    EXPECT_EQ(value.integer() != nullptr || value.real() != nullptr, kind == ValueKind::number);
    EXPECT_EQ(value.string() != nullptr, kind == ValueKind::string);
    EXPECT_EQ(value.url() != nullptr, kind == ValueKind::URL);
    EXPECT_EQ(value.data() != nullptr, kind == ValueKind::data);
    EXPECT_EQ(value.list() != nullptr, kind == ValueKind::list);
    EXPECT_EQ(value.dictionary() != nullptr, kind == ValueKind::dictionary);
    EXPECT_EQ(value.error() != nullptr, kind == ValueKind::error);
  }
}

TEST(Value, KindsHaveNamesForPeople) {
  EXPECT_EQ(valueKindName(ValueKind::boolean), "boolean");
  EXPECT_EQ(valueKindName(ValueKind::number), "number");
  EXPECT_EQ(valueKindName(ValueKind::string), "string");
  EXPECT_EQ(valueKindName(ValueKind::URL), "URL");
  EXPECT_EQ(valueKindName(ValueKind::data), "data");
  EXPECT_EQ(valueKindName(ValueKind::list), "list");
  EXPECT_EQ(valueKindName(ValueKind::dictionary), "dictionary");
  EXPECT_EQ(valueKindName(ValueKind::error), "error");
}

TEST(Value, OnlyNumbersAndBooleansThatAreNotZeroAreTrue) {
  EXPECT_TRUE(Value(true).isTrueNumber());
  EXPECT_TRUE(Value(1).isTrueNumber());
  EXPECT_TRUE(Value(-1).isTrueNumber());
  EXPECT_TRUE(Value(0.5).isTrueNumber());
  EXPECT_FALSE(Value(false).isTrueNumber());
  EXPECT_FALSE(Value(0).isTrueNumber());
  EXPECT_FALSE(Value(0.0).isTrueNumber());
  EXPECT_FALSE(Value("true").isTrueNumber());
  EXPECT_FALSE(Value("1").isTrueNumber());
  EXPECT_FALSE(Value(List{1}).isTrueNumber());
  EXPECT_FALSE(Value(Dictionary{{"a", 1}}).isTrueNumber());
}

TEST(Value, EqualityLooksAtKindAndContent) {
  EXPECT_EQ(Value("a"), Value(std::string("a")));
  EXPECT_NE(Value("a"), Value("b"));
  EXPECT_NE(Value("1"), Value(1));
  EXPECT_NE(Value("file:///a"), Value(*URL::fromString("file:///a")));
  EXPECT_NE(Value("a"), Value(Data{"a"}));
  EXPECT_EQ(Value(List{1, Dictionary{{"k", "v"}}}), Value(List{1, Dictionary{{"k", "v"}}}));
  EXPECT_NE(Value(List{1, Dictionary{{"k", "v"}}}), Value(List{1, Dictionary{{"k", "w"}}}));
}

TEST(Value, ErrorsAreComparedByContent) {
  EXPECT_EQ(Value(SXNotFoundError("org.a")), Value(SXNotFoundError("org.a")));
  EXPECT_NE(Value(SXNotFoundError("org.a")), Value(SXNotFoundError("org.b")));
  EXPECT_NE(Value(SXNotPermittedError()), Value("text"));
  EXPECT_NE(Value("text"), Value(SXNotPermittedError()));
}

TEST(Value, CopyIsDeep) {
  Value original(Dictionary{{"list", List{"a"}}});
  Value copy = original;
  copy.dictionary()->at("list").list()->push_back("b");
  EXPECT_EQ(original.dictionary()->at("list").list()->size(), 1U);
  EXPECT_EQ(copy.dictionary()->at("list").list()->size(), 2U);
}

}  // namespace
}  // namespace storix
