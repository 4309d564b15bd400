#include "tools/tarnelctl/typed_value.h"

#include <gtest/gtest.h>

namespace tarnel::ctl {
namespace {

Value read(std::string_view text, std::string_view type = {}) {
  auto value = typedValue(text, type);
  EXPECT_TRUE(value) << (value ? "" : value.error().localizedDescription());
  return value ? *value : Value();
}

std::string refusal(std::string_view text, std::string_view type) {
  const auto value = typedValue(text, type);
  return value ? "accepted" : value.error().localizedDescription();
}

TEST(TypedValueTest, InfersWhatReadsAsAWhole) {
  EXPECT_EQ(read("true"), Value(true));
  EXPECT_EQ(read("42"), Value(42));
  EXPECT_EQ(read("-7"), Value(-7));
  EXPECT_EQ(read("18446744073709551615"), Value(uint64_t{18446744073709551615U}));
  EXPECT_EQ(read("2.5"), Value(2.5));
  EXPECT_EQ(read("1e3"), Value(1000.0));
  EXPECT_EQ(read("2.5.1"), Value("2.5.1"));
  EXPECT_EQ(read("inf"), Value("inf"));
  EXPECT_EQ(read(""), Value(""));
  EXPECT_EQ(read("yes"), Value("yes"));
}

TEST(TypedValueTest, TakesEachNamedType) {
  EXPECT_EQ(read("42", "string"), Value("42"));
  EXPECT_EQ(read("42", "int"), Value(42));
  EXPECT_EQ(read("42", "real"), Value(42.0));
  EXPECT_EQ(read("yes", "bool"), Value(true));
  EXPECT_EQ(read("1970-01-01T00:00:10Z", "date"), Value(Date{10}));
  EXPECT_EQ(read("AQI=", "data"), Value(Data{1, 2}));
  EXPECT_EQ(read("[1,{\"a\":true}]", "json"), Value(Array{1, Dictionary{{"a", true}}}));
}

TEST(TypedValueTest, RefusesWithARemedy) {
  EXPECT_EQ(refusal("4x", "int"), "'4x' is no integer of 64 bits");
  EXPECT_EQ(refusal("x", "real"), "'x' is no number");
  EXPECT_EQ(refusal("2", "bool"), "'2' is no boolean: write true or false");
  EXPECT_EQ(refusal("today", "date"), "'today' is no date: write it as 2026-01-31T12:00:00Z");
  EXPECT_EQ(refusal("A", "data"), "'A' is no base-64 text");
  EXPECT_EQ(refusal("x", "number"), "unknown type 'number': use string, int, real, bool, date, data or json");
  EXPECT_TRUE(refusal("{", "json").starts_with("'{' is no JSON: "));
  EXPECT_EQ(refusal("\xff", ""), "a value is not UTF-8 text; check the terminal's character set");
}

TEST(TypedValueTest, SplitsPairs) {
  const auto pair = [](std::string_view text) { return *keyValuePair(text); };
  EXPECT_EQ(pair("a=1"), std::pair(std::string("a"), Value(1)));
  EXPECT_EQ(pair("a:string=1"), std::pair(std::string("a"), Value("1")));
  EXPECT_EQ(pair("uuid:x=1"), std::pair(std::string("uuid:x"), Value(1)));
  EXPECT_EQ(pair("a=b=c"), std::pair(std::string("a"), Value("b=c")));
  EXPECT_FALSE(keyValuePair("=1"));
  EXPECT_EQ(keyValuePair("nothing").error().localizedDescription(), "'nothing' is no KEY=VALUE");
}

}  // namespace
}  // namespace tarnel::ctl
