#include "formats/json_writer.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <string>

#include <gtest/gtest.h>

#include "formats/document.h"

namespace tarnel {
namespace {

using namespace std::string_literals;

std::string compact(const Value& value) {
  std::string out;
  EXPECT_TRUE(writeJson(value, JsonStyle::compact, out));
  return out;
}

TEST(JsonWriterTest, writesEveryKindOfValue) {
  EXPECT_EQ(compact(Dictionary{{"b", true},
                               {"a", false},
                               {"int", -5},
                               {"big", ~uint64_t{0}},
                               {"real", 0.1},
                               {"date", Date{1.5}},
                               {"none", Value()},
                               {"list", Array{1, Array{}, Dictionary{}}},
                               {"text", "t"}}),
            R"({"b":true,"a":false,"int":-5,"big":18446744073709551615,"real":0.1,"date":1.5,"none":null,)"
            R"("list":[1,[],{}],"text":"t"})");
  EXPECT_EQ(compact("top"), "\"top\"");
  EXPECT_EQ(compact(Array{}), "[]");
}

TEST(JsonWriterTest, writesDoublesInTheShortestTextThatReadsBack) {
  const struct {
    double number;
    const char* text;
  } cases[] = {{0, "0.0"},
               {-0.0, "-0.0"},
               {1, "1.0"},
               {-1, "-1.0"},
               {300000, "300000.0"},
               {0.1, "0.1"},
               {0.3, "0.3"},
               {1769860800.123456, "1769860800.123456"},
               {999999999999999, "999999999999999.0"},
               {1e15, "1000000000000000.0"},
               {1e17, "1e+17"},
               {5e-324, "5e-324"},
               {9007199254740993.0, "9007199254740992.0"},
               {1.7976931348623157e308, "1.7976931348623157e+308"},
               {2.0 / 3, "0.6666666666666666"}};
  for (const auto& one : cases) EXPECT_EQ(compact(one.number), one.text);
}

// Long texts are copied block by block, which must leave no control character as it is.
TEST(JsonWriterTest, escapesEveryControlCharacterAtEveryPlace) {
  for (int control = 0; control < 0x20; ++control) {
    for (size_t place = 0; place < 50; ++place) {
      std::string text(50, 'x');
      text[place] = static_cast<char>(control);
      const std::string written = compact(text);
      EXPECT_EQ(std::count_if(written.begin(), written.end(),
                              [](char c) { return static_cast<unsigned char>(c) < 0x20; }),
                0)
          << "character " << control << " at " << place;
      const auto read = parseDocument(written);
      ASSERT_TRUE(read) << "character " << control << " at " << place;
      EXPECT_EQ(*read, Value(text));
    }
  }
}

TEST(JsonWriterTest, escapesWhatMustBeEscaped) {
  EXPECT_EQ(compact("\"\\/\b\f\n\r\t\x01\x1F\x7F\0end"s),
            "\"\\\"\\\\/\\b\\f\\n\\r\\t\\u0001\\u001F\x7F\\u0000end\"");
  EXPECT_EQ(compact(Dictionary{{"a\"\0"s, 1}}), R"({"a\"\u0000":1})");
  for (size_t place = 0; place < 40; ++place) {
    std::string text(40, 'x');
    text[place] = '"';
    std::string expected = '"' + std::string(place, 'x') + "\\\"" + std::string(39 - place, 'x') + '"';
    EXPECT_EQ(compact(text), expected);
  }
  EXPECT_EQ(compact("\xC3\xA9\xF0\x9F\x98\x80"), "\"\xC3\xA9\xF0\x9F\x98\x80\"");
}

TEST(JsonWriterTest, refusesWhatJsonCannotHoldAndLeavesTheTextAsItWas) {
  const double infinity = std::numeric_limits<double>::infinity();
  for (const Value& value :
       {Value(infinity), Value(-infinity), Value(std::nan("")), Value(Date{infinity}), Value(Data{1}),
        Value("\xFF"), Value("\xED\xA0\x80"), Value(Dictionary{{"\xC3", 1}})}) {
    for (const JsonStyle style : {JsonStyle::compact, JsonStyle::pretty}) {
      std::string out = "before";
      EXPECT_FALSE(writeJson(value, style, out)) << value.description();
      EXPECT_FALSE(writeJson(Dictionary{{"a", 1}, {"b", Array{value}}}, style, out));
      EXPECT_EQ(out, "before");
    }
  }
  EXPECT_EQ(compact(1), "1") << "a refusal leaves nothing behind";
}

TEST(JsonWriterTest, appendsToTheText) {
  std::string out = "a";
  ASSERT_TRUE(writeJson(Array{1}, JsonStyle::compact, out));
  ASSERT_TRUE(writeJson(Array{2}, JsonStyle::compact, out));
  EXPECT_EQ(out, "a[1][2]");
}

TEST(JsonWriterTest, indentsPrettyTextByTwoBlanks) {
  std::string out;
  const Dictionary value = {{"a", Array{1, 2.0}}, {"b", Dictionary{{"c", "d"}}}, {"e", Dictionary{}}};
  ASSERT_TRUE(writeJson(value, JsonStyle::pretty, out));
  EXPECT_EQ(out, R"({
  "a": [
    1,
    2.0
  ],
  "b": {
    "c": "d"
  },
  "e": {}
})");
}

TEST(JsonWriterTest, writesLargeTextsAndSmallOnesAfterThem) {
  const std::string large(5U << 20U, 'x');
  EXPECT_EQ(compact(large).size(), large.size() + 2);
  EXPECT_EQ(compact("small"), "\"small\"");
}

}  // namespace
}  // namespace tarnel
