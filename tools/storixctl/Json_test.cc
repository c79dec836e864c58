#include "tools/storixctl/Json.h"

#include <gtest/gtest.h>

#include <cmath>

namespace storix::ctl {
namespace {

TEST(Json, EveryKindOfValueHasAForm) {
  Dictionary dictionary;
  dictionary.emplace("boolean", true);
  dictionary.emplace("data", Data{"token"});
  dictionary.emplace("integer", std::int64_t{-9'007'199'254'740'993});
  dictionary.emplace("list", List{Value(1), Value("two")});
  dictionary.emplace("nothing", std::nan(""));
  dictionary.emplace("text", "\"\n\xC3\xA9");
  dictionary.emplace("url", *URL::fileURLWithPath("/a b"));
  EXPECT_EQ(jsonText(dictionary),
            "{\n"
            "  \"boolean\": true,\n"
            "  \"data\": \"dG9rZW4=\",\n"
            "  \"integer\": -9007199254740993,\n"
            "  \"list\": [\n    1,\n    \"two\"\n  ],\n"
            "  \"nothing\": null,\n"
            "  \"text\": \"\\\"\\n\xC3\xA9\",\n"
            "  \"url\": \"file:///a%20b\"\n"
            "}\n");
}

TEST(Json, AnErrorShowsItsSentenceAndDetails) {
  EXPECT_EQ(jsonText({{"error", SXError("org.sample", 7, {{"description", "no"}, {"key", 1}})}}),
            "{\n"
            "  \"error\": {\n"
            "    \"code\": 7,\n"
            "    \"details\": {\n      \"description\": \"no\",\n      \"key\": 1\n    },\n"
            "    \"domain\": \"org.sample\",\n"
            "    \"message\": \"no\"\n"
            "  }\n"
            "}\n");
}

TEST(Json, WhatIsNotUTF8IsShownAsQuestionMarks) {
  EXPECT_EQ(jsonText({{"a", "x\xFFy\xC3"}}), "{\n  \"a\": \"x?y?\"\n}\n");
}

TEST(Base64, TokensSurviveTheWayThereAndBack) {
  for (const std::string &bytes :
       {std::string("a"), std::string("ab"), std::string("abc"), std::string("\0\xFF/+", 4)}) {
    EXPECT_EQ(fromBase64(base64(Data{bytes})), Data{bytes});
  }
  EXPECT_EQ(base64(Data{""}), "");
}

TEST(Base64, WhatIsNoTokenIsRefused) {
  for (const char *text : {"", "dG9rZW4", "dG9rZW4=x", "dG9r ZW4=", "*", "dG9rZW4=\n"}) {
    EXPECT_EQ(fromBase64(text), std::nullopt) << text;
  }
}

}  // namespace
}  // namespace storix::ctl
