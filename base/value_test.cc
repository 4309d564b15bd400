#include "base/value.h"

#include <array>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <limits>
#include <string>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

constexpr double kInfinity = std::numeric_limits<double>::infinity();
constexpr int64_t kMin64 = std::numeric_limits<int64_t>::min();
constexpr int64_t kMax64 = std::numeric_limits<int64_t>::max();

TEST(ValueTest, keepsEveryIntegerSignedThatFitsSigned) {
  EXPECT_EQ(Value(uint8_t{7}).type(), Value::Type::integer);
  EXPECT_EQ(Value(static_cast<uint64_t>(kMax64)).type(), Value::Type::integer);
  EXPECT_EQ(Value(static_cast<uint64_t>(kMax64) + 1).type(), Value::Type::unsignedInteger);
  EXPECT_EQ(Value(uint32_t{5}), Value(int64_t{5}));
  EXPECT_NE(Value(1), Value(1.0));
  EXPECT_NE(Value(1), Value(true));
}

TEST(ValueTest, countsBooleansAsNumbersAndNothingElse) {
  EXPECT_TRUE(Value(false).isNumber());
  EXPECT_TRUE(Value(-1).isNumber());
  EXPECT_TRUE(Value(~uint64_t{0}).isNumber());
  EXPECT_TRUE(Value(0.5).isNumber());
  EXPECT_FALSE(Value().isNumber());
  EXPECT_FALSE(Value(Date{1}).isNumber());
  EXPECT_FALSE(Value("1").isNumber());
  EXPECT_FALSE(Value(Data{1}).isNumber());
}

TEST(ValueTest, offersTheHeldValueOnlyWhenTheTypeFits) {
  Value text("a");
  EXPECT_EQ(*text.string(), "a");
  *text.mutableString() = "b";
  EXPECT_EQ(text, Value(std::string("b")));
  EXPECT_EQ(text.integer(), nullptr);
  EXPECT_EQ(text.dictionary(), nullptr);
  EXPECT_EQ(text.mutableArray(), nullptr);
  EXPECT_TRUE(Value().isNull());
}

TEST(ValueTest, readsIntegersInNarrowerWidthsByTheirLowBits) {
  const Value wide(int64_t{0x1'2345'6789});
  EXPECT_EQ(wide.uint32Value(), 0x2345'6789U);
  EXPECT_EQ(wide.uint16Value(), 0x6789U);
  EXPECT_EQ(Value(int64_t{0xFFFF'FFFF}).int32Value(), -1);
  EXPECT_EQ(Value(-1).uint16Value(), 0xFFFFU);
  EXPECT_EQ(Value(~uint64_t{0}).int64Value(), -1);
  EXPECT_EQ(Value(~uint64_t{0}).uint64Value(), ~uint64_t{0});
  EXPECT_EQ(Value(true).int64Value(), 1);
}

TEST(ValueTest, cutsRealsTowardZeroAndHoldsThemToTheRange) {
  EXPECT_EQ(Value(2.9).int64Value(), 2);
  EXPECT_EQ(Value(-2.9).int64Value(), -2);
  EXPECT_EQ(Value(1e300).int64Value(), kMax64);
  EXPECT_EQ(Value(-1e300).int64Value(), kMin64);
  EXPECT_EQ(Value(9223372036854775808.0).int64Value(), kMax64);
  EXPECT_EQ(Value(-9223372036854775808.0).int64Value(), kMin64);
  EXPECT_EQ(Value(kInfinity).int64Value(), kMax64);
  EXPECT_EQ(Value(std::nan("")).int64Value(), 0);
}

TEST(ValueTest, holdsNumbersToThirtyTwoBits) {
  constexpr int32_t kMost = std::numeric_limits<int32_t>::max();
  constexpr int32_t kLeast = std::numeric_limits<int32_t>::min();
  EXPECT_EQ(Value(5).boundedInt32Value(), 5);
  EXPECT_EQ(Value(-5).boundedInt32Value(), -5);
  EXPECT_EQ(Value(true).boundedInt32Value(), 1);
  EXPECT_EQ(Value(int64_t{kMost}).boundedInt32Value(), kMost);
  EXPECT_EQ(Value(int64_t{kMost} + 1).boundedInt32Value(), kMost);
  EXPECT_EQ(Value(int64_t{kLeast}).boundedInt32Value(), kLeast);
  EXPECT_EQ(Value(int64_t{kLeast} - 1).boundedInt32Value(), kLeast);
  EXPECT_EQ(Value((int64_t{1} << 32) + 1).boundedInt32Value(), kMost);
  EXPECT_EQ(Value(kMin64).boundedInt32Value(), kLeast);
  EXPECT_EQ(Value(~uint64_t{0}).boundedInt32Value(), kMost);
  EXPECT_EQ(Value(1.9).boundedInt32Value(), 1);
  EXPECT_EQ(Value(-1.9).boundedInt32Value(), -1);
  EXPECT_EQ(Value(1e300).boundedInt32Value(), kMost);
  EXPECT_EQ(Value(-kInfinity).boundedInt32Value(), kLeast);
  EXPECT_EQ(Value(std::nan("")).boundedInt32Value(), 0);
  EXPECT_EQ(Value("4294967297").boundedInt32Value(), kMost);
  EXPECT_EQ(Value(Array{1}).boundedInt32Value(), 0);
}

TEST(ValueTest, readsTheLeadingIntegerOfText) {
  const struct {
    const char* text;
    int64_t number;
  } cases[] = {{"600", 600},
               {" \t\n-12abc", -12},
               {"+7", 7},
               {"+-7", 0},
               {"-+7", 0},
               {"", 0},
               {"x1", 0},
               {"3.9", 3},
               {"99999999999999999999", kMax64},
               {"-99999999999999999999", kMin64},
               {"0x10", 0}};
  for (const auto& one : cases) EXPECT_EQ(Value(one.text).int64Value(), one.number) << one.text;
  EXPECT_EQ(Value(Date{5}).int64Value(), 0);
  EXPECT_EQ(Value(Array{1}).int64Value(), 0);
  EXPECT_EQ(Value().uint32Value(), 0U);
}

TEST(ValueTest, tellsANumberThatIsThereFromNone) {
  for (const Value& one : {Value(0), Value(false), Value(2.5), Value(UINT64_MAX), Value("0"), Value(" \t+7x"),
                           Value("-12"), Value("99999999999999999999")}) {
    EXPECT_TRUE(one.hasInteger()) << one.description();
  }
  for (const Value& one :
       {Value(), Value(""), Value("x1"), Value("+-7"), Value("-+7"), Value("-"), Value(".5"), Value(Date{5}),
        Value(Data{49}), Value(Array{1}), Value(Dictionary{{"1", 1}})}) {
    EXPECT_FALSE(one.hasInteger()) << one.description();
  }
}

TEST(ValueTest, readsTheLeadingRealOfText) {
  const struct {
    const char* text;
    double number;
  } cases[] = {{"0.25", 0.25},
               {" +1.5e3x", 1500},
               {"-.5", -0.5},
               {"nan", 0},
               {"-inf", 0},
               {"infinity", 0},
               {"", 0},
               {"-", 0},
               {"1e999", kInfinity},
               {"-1e999", -kInfinity},
               {"1e-999", 0},
               {"7", 7},
               {"+-1", 0},
               {"12e", 12}};
  for (const auto& one : cases) EXPECT_EQ(Value(one.text).doubleValue(), one.number) << one.text;
  EXPECT_EQ(Value(std::string(400, '9')).doubleValue(), kInfinity);
  EXPECT_EQ(Value("0." + std::string(400, '0') + "1").doubleValue(), 0);
  EXPECT_EQ(Value(~uint64_t{0}).doubleValue(), 18446744073709551616.0);
  EXPECT_EQ(Value(true).doubleValue(), 1);
  EXPECT_EQ(Value(Data{1}).doubleValue(), 0);
}

TEST(ValueTest, readsBooleans) {
  for (const char* text : {"YES", "y", "true", "T", "1", " +0009", "-0t", "9x"}) {
    EXPECT_TRUE(Value(text).boolValue()) << text;
  }
  for (const char* text : {"", "no", "0", "false", "+-1", "x1", " 0", "00"}) {
    EXPECT_FALSE(Value(text).boolValue()) << text;
  }
  EXPECT_TRUE(Value(0.1).boolValue());
  EXPECT_TRUE(Value(std::nan("")).boolValue());
  EXPECT_FALSE(Value(0.0).boolValue());
  EXPECT_TRUE(Value(-1).boolValue());
  EXPECT_TRUE(Value(~uint64_t{0}).boolValue());
  EXPECT_FALSE(Value().boolValue());
  EXPECT_FALSE(Value(Date{1}).boolValue());
}

TEST(ValueTest, describesItselfForPeople) {
  EXPECT_EQ(Value().description(), "(null)");
  EXPECT_EQ(Value(true).description(), "1");
  EXPECT_EQ(Value(false).description(), "0");
  EXPECT_EQ(Value(kMin64).description(), "-9223372036854775808");
  EXPECT_EQ(Value(~uint64_t{0}).description(), "18446744073709551615");
  EXPECT_EQ(Value(0.1).description(), "0.1");
  EXPECT_EQ(Value(100000.0).description(), "100000");
  EXPECT_EQ(Value("a\"b").description(), "a\"b");
  EXPECT_EQ(Value(Data{0x00, 0xAF}).description(), "<00af>");
  EXPECT_EQ(Value(Date{0}).description(), "1970-01-01 00:00:00 +0000");
  EXPECT_EQ(Value(Date{-0.5}).description(), "1969-12-31 23:59:59 +0000");
  EXPECT_EQ(Value(Date{kInfinity}).description(), "inf");
  EXPECT_EQ(Value(Date{253402300800.0}).description(), "253402300800");
  const Dictionary mixed = {{"a\"", Array{1, "x\ny", Value()}}, {"b", Dictionary{}}};
  EXPECT_EQ(Value(mixed).description(), R"({"a\"": [1, "x\ny", (null)], "b": {}})");
}

TEST(ValueTest, writesRealsInTheShortestTextThatReadsBack) {
  const struct {
    double number;
    const char* text;
  } cases[] = {{0, "0"},           {-0.0, "-0"},
               {1, "1"},           {0.1, "0.1"},
               {300000, "300000"}, {1e-5, "0.00001"},
               {1e-6, "1e-06"},    {1e16, "10000000000000000"},
               {1e17, "1e+17"},    {1769860800.123456, "1769860800.123456"},
               {5e-324, "5e-324"}, {1.7976931348623157e308, "1.7976931348623157e+308"},
               {-2.5, "-2.5"}};
  for (const auto& one : cases) {
    std::array<char, kRealTextSize> buffer{};
    EXPECT_EQ(writeReal(one.number, buffer), one.text);
    EXPECT_EQ(std::strtod(one.text, nullptr), one.number);
  }
}

TEST(ValueTest, copiesOfArraysShareUntilOneIsWritten) {
  Array original = {1, 2};
  Array copy = original;
  EXPECT_EQ(copy.begin(), original.begin());
  copy.append(3);
  EXPECT_NE(copy.begin(), original.begin());
  EXPECT_EQ(original.size(), 2U);
  EXPECT_EQ(copy.size(), 3U);
  const Value* const before = copy.begin();
  copy.mutableValues()[0] = "x";
  EXPECT_EQ(copy.begin(), before) << "an only owner writes in place";
  EXPECT_EQ(original[0], Value(1));
  EXPECT_EQ(copy, (Array{"x", 2, 3}));
  EXPECT_EQ(Array{}, Array());
  EXPECT_NE(original, copy);
  EXPECT_TRUE(Array().empty());
  EXPECT_EQ(Array().begin(), Array().end());
}

TEST(ValueTest, keepsWhatACopySharesWhenTheOriginalGoes) {
  Value copy;
  {
    const Value original(Dictionary{{"k", Array{"v"}}});
    copy = original;
  }
  EXPECT_EQ(copy, Value(Dictionary{{"k", Array{"v"}}}));
}

TEST(ValueTest, sendsWhatIsNotFiniteAsMinusOne) {
  EXPECT_EQ(finiteOrMinusOne(kInfinity), -1.0);
  EXPECT_EQ(finiteOrMinusOne(-kInfinity), -1.0);
  EXPECT_EQ(finiteOrMinusOne(std::nan("")), -1.0);
  EXPECT_EQ(finiteOrMinusOne(2.5), 2.5);
}

}  // namespace
}  // namespace tarnel
