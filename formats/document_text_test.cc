#include <cmath>
#include <limits>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "formats/document.h"

namespace tarnel {
namespace {

using testing::HasSubstr;
using namespace std::string_literals;

Value parsed(std::string_view text) {
  auto result = parseDocument(text);
  EXPECT_TRUE(result) << text << ": " << (result ? "" : result.error().localizedDescription());
  return result ? *result : Value("not parsed");
}

std::string refusal(std::string_view text, const DocumentLimits& limits = {}) {
  const auto result = parseDocument(text, limits);
  if (result) return "accepted";
  EXPECT_EQ(result.error().domain(), kDocumentErrorDomain);
  return result.error().localizedDescription();
}

TEST(TextDocumentTest, refusesControlCharactersInTexts) {
  for (int control = 0; control < 0x20; ++control) {
    for (size_t place = 0; place < 50; ++place) {
      std::string text = '"' + std::string(50, 'x') + '"';
      text[place + 1] = static_cast<char>(control);
      EXPECT_FALSE(parseDocument(text)) << "character " << control << " at " << place;
    }
  }
}

TEST(TextDocumentTest, readsEveryKindOfValue) {
  const Value value =
      parsed(R"( {"text": "a\u00e9\n", "yes": true, "no": false, "none": null, "list": [1, -2, 0.5],
                                 "inner": {"a": {}}, "when": {"$date": "2026-01-31T12:00:00.25+01:00"},
                                 "bytes": {"$data": "AQID"}} )");
  EXPECT_EQ(value, Value(Dictionary{{"text", "a\xC3\xA9\n"},
                                    {"yes", true},
                                    {"no", false},
                                    {"none", Value()},
                                    {"list", Array{1, -2, 0.5}},
                                    {"inner", Dictionary{{"a", Dictionary{}}}},
                                    {"when", Date{1769857200.25}},
                                    {"bytes", Data{1, 2, 3}}}));
}

TEST(TextDocumentTest, takesAnyValueAtTheTop) {
  EXPECT_EQ(parsed("true"), Value(true));
  EXPECT_EQ(parsed(" null\n"), Value());
  EXPECT_EQ(parsed("-12"), Value(-12));
  EXPECT_EQ(parsed("\"x\""), Value("x"));
  EXPECT_EQ(parsed("[]"), Value(Array{}));
  EXPECT_EQ(parsed("\xEF\xBB\xBF{}"), Value(Dictionary{}));
  EXPECT_EQ(parsed("{\"$date\": \"1970-01-01T00:00:00Z\"}"), Value(Date{0}));
}

TEST(TextDocumentTest, keepsIntegersThatFitAndMakesTheRestDoubles) {
  EXPECT_EQ(parsed("9223372036854775807"), Value(std::numeric_limits<int64_t>::max()));
  EXPECT_EQ(parsed("-9223372036854775808"), Value(std::numeric_limits<int64_t>::min()));
  EXPECT_EQ(parsed("18446744073709551615"), Value(std::numeric_limits<uint64_t>::max()));
  EXPECT_EQ(parsed("18446744073709551616"), Value(18446744073709551616.0));
  EXPECT_EQ(parsed("-9223372036854775809"), Value(-9223372036854775808.0));
  EXPECT_EQ(parsed("1.0"), Value(1.0));
  EXPECT_EQ(parsed("0.1"), Value(0.1));
  EXPECT_EQ(parsed("2.2250738585072011e-308"), Value(2.2250738585072011e-308));
  EXPECT_THAT(refusal("1e999"), HasSubstr("at byte 0"));
}

TEST(TextDocumentTest, readsNumbersAtTheEndsOfTheRange) {
  for (const char* zero :
       {"0e308", "0.0E116", "0e-999", "1e-400", "2e-324", "0.0001e-321", "10e-99999999999999999999"}) {
    EXPECT_EQ(parsed(zero), Value(0.0)) << zero;
    const auto negative = parsed("-" + std::string(zero));
    ASSERT_NE(negative.real(), nullptr) << zero;
    EXPECT_TRUE(*negative.real() == 0 && std::signbit(*negative.real())) << zero;
  }
  EXPECT_EQ(parsed("0." + std::string(400, '0') + "1e5"), Value(0.0));
  EXPECT_EQ(parsed("3e-324"), Value(5e-324));
  EXPECT_EQ(parsed("1.7976931348623157e308"), Value(std::numeric_limits<double>::max()));
  for (const std::string large : {"1.8e308", "1.7976931348623159e+308", "1000e306", "-2E308"}) {
    EXPECT_EQ(refusal("[1, " + large + "]"), "Number too big to be stored in double at byte 4") << large;
  }
}

TEST(TextDocumentTest, letsTheLastOfEqualKeysWin) {
  EXPECT_EQ(parsed(R"({"a": 1, "b": 2, "a": 3})"), Value(Dictionary{{"a", 3}, {"b", 2}}));
}

TEST(TextDocumentTest, readsNulAndSurrogatePairsInsideText) {
  EXPECT_EQ(parsed(R"("a\u0000b")"), Value("a\0b"s));
  EXPECT_EQ(parsed(R"({"a\u0000": 1})"), Value(Dictionary{{"a\0"s, 1}}));
  EXPECT_EQ(parsed(R"("\ud83d\ude00")"), Value("\xF0\x9F\x98\x80"));
}

TEST(TextDocumentTest, convertsOnlySingleKeysToDatesAndData) {
  EXPECT_EQ(parsed(R"({"$date": "x", "b": 1})").dictionary()->size(), 2U);
  EXPECT_EQ(parsed(R"({"$other": "x"})").dictionary()->size(), 1U);
  EXPECT_EQ(parsed(R"({"$data": ""})"), Value(Data{}));
  EXPECT_THAT(refusal(R"({"$date": "yesterday"})"), HasSubstr("\"$date\" that is no RFC 3339 time at byte "));
  EXPECT_THAT(refusal(R"({"$date": 5})"), HasSubstr("\"$date\" that is no RFC 3339 time"));
  EXPECT_THAT(refusal(R"({"$data": "A"})"), HasSubstr("\"$data\" that is no base-64 text"));
  EXPECT_THAT(refusal(R"({"$data": []})"), HasSubstr("\"$data\" that is no base-64 text"));
}

TEST(TextDocumentTest, refusesWhatIsNotJsonAndSaysWhere) {
  EXPECT_EQ(refusal(""), "the document is empty");
  for (const auto& text : {" "s,
                           "{"s,
                           "[1,]"s,
                           "{\"a\" 1}"s,
                           "{a: 1}"s,
                           "nul"s,
                           "01"s,
                           "+1"s,
                           "NaN"s,
                           "'a'"s,
                           "\"a"s,
                           "\"\\x\""s,
                           "// no\n1"s,
                           "\"a\nb\""s,
                           "\"a\0b\""s,
                           "[1] 2"s,
                           "{}}"s,
                           "{} x"s,
                           "{}\0"s,
                           "1\0 garbage"s,
                           "<html>"s,
                           "\xEF\xBB\xBF"s,
                           "[\"\xFF\"]"s,
                           "\"\\ud800\""s,
                           "\"\\udc00\""s,
                           "\"\\ud800\\u0041\""s,
                           "{\"\xC3\": 1}"s}) {
    EXPECT_THAT(refusal(text), HasSubstr(" at byte ")) << text;
  }
  EXPECT_THAT(refusal("{\"a\": 1} x"), HasSubstr("at byte 9"));
  EXPECT_THAT(refusal("\xEF\xBB\xBF[1 2]"), HasSubstr("at byte 6"));
  EXPECT_THAT(refusal("[\"\xFF\"]"), HasSubstr("text that is not UTF-8"));
}

TEST(TextDocumentTest, holdsToItsLimits) {
  const DocumentLimits limits{.bytes = 100, .depth = 3, .values = 6};
  EXPECT_EQ(refusal("[[[1]]]", limits), "accepted");
  EXPECT_THAT(refusal("[[[[]]]]", limits), HasSubstr("more than 3 levels of nesting at byte 3"));
  EXPECT_THAT(refusal(R"([{"a":[{}]}])", limits), HasSubstr("more than 3 levels"));
  EXPECT_EQ(refusal("[1,2,3,4,5]", limits), "accepted");
  EXPECT_THAT(refusal("[1,2,3,4,5,6]", limits), HasSubstr("more than 6 values"));
  EXPECT_THAT(refusal(R"({"a":1,"b":2,"c":3})", limits), HasSubstr("more than 6 values"));
  EXPECT_EQ(refusal(std::string(101, ' '), limits), "the document has 101 bytes, more than 100");
  EXPECT_EQ(parseDocument("[[[[]]]]", limits).error().code(), kDocumentTooLarge);
  EXPECT_EQ(parseDocument("[", limits).error().code(), kDocumentMalformed);
}

TEST(TextDocumentTest, survivesAnyDepthOfNesting) {
  const std::string deep(1000000, '[');
  EXPECT_THAT(refusal(deep), HasSubstr("more than 32 levels"));
  DocumentLimits generous;
  generous.depth = 1000;
  EXPECT_THAT(refusal(deep, generous), HasSubstr("more than 1000 levels"));
}

TEST(TextDocumentTest, writesWhatItReads) {
  const Dictionary all = {{"text", "q\" \\ \n \0 \xC3\xA9"s},
                          {"yes", true},
                          {"none", Value()},
                          {"small", std::numeric_limits<int64_t>::min()},
                          {"large", std::numeric_limits<uint64_t>::max()},
                          {"whole", 5.0},
                          {"minusZero", -0.0},
                          {"tiny", 5e-324},
                          {"huge", 1.7976931348623157e308},
                          {"list", Array{Array{}, Dictionary{}, 0.1}},
                          {"when", Date{1769857200.123456}},
                          {"before", Date{-0.1}},
                          {"bytes", Data{0, 255}}};
  for (const bool pretty : {false, true}) {
    const std::string text = writeTextDocument(all, pretty);
    EXPECT_EQ(parsed(text), Value(all)) << text;
    EXPECT_TRUE(std::signbit(*parsed(text).dictionary()->find("minusZero")->real()));
  }
  EXPECT_EQ(writeTextDocument(Dictionary{{"a", Array{1, 2.0}}, {"b", Date{0.5}}, {"c", Data{1}}}),
            R"({"a":[1,2.0],"b":{"$date":"1970-01-01T00:00:00.5Z"},"c":{"$data":"AQ=="}})");
  EXPECT_EQ(writeTextDocument(Dictionary{{"a", Array{1}}}, true), "{\n  \"a\": [\n    1\n  ]\n}");
}

TEST(TextDocumentTest, writesValidTextWhateverTheValue) {
  const double infinity = std::numeric_limits<double>::infinity();
  EXPECT_EQ(writeTextDocument(Array{infinity, -infinity, std::nan(""), Date{infinity}, Date{1e18}}),
            "[null,null,null,null,null]");
  EXPECT_EQ(writeTextDocument("a\xFF\xC3\xA9\xE2\x82"), "\"a\xEF\xBF\xBD\xC3\xA9\xEF\xBF\xBD\xEF\xBF\xBD\"");
  EXPECT_EQ(writeTextDocument(Dictionary{{"\x80", 1}}), "{\"\xEF\xBF\xBD\":1}");
}

}  // namespace
}  // namespace tarnel
