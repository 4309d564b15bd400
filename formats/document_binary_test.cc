#include <cmath>
#include <limits>
#include <string>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "formats/document.h"

namespace tarnel {
namespace {

using testing::HasSubstr;

std::string bytesOf(std::string_view hex) {
  std::string out;
  for (size_t i = 0; i + 1 < hex.size(); i += 2) {
    out += static_cast<char>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16));
  }
  return out;
}

Value parsed(std::string_view bytes) {
  auto result = parseDocument(bytes);
  EXPECT_TRUE(result) << (result ? "" : result.error().localizedDescription());
  return result ? *result : Value("not parsed");
}

std::string refusal(std::string_view hex, const DocumentLimits& limits = {}) {
  const auto result = parseDocument(bytesOf(hex), limits);
  if (result) return "accepted " + result->description();
  EXPECT_EQ(result.error().domain(), kDocumentErrorDomain);
  return result.error().localizedDescription();
}

TEST(BinaryDocumentTest, readsEveryKindOfItem) {
  const struct {
    const char* hex;
    Value value;
  } cases[] = {
      {"80", Array{}},
      {"a0", Dictionary{}},
      {"8518181901f41a000f42401b000000e8d4a510001bffffffffffffffff",
       Array{24, 500, 1000000, 1000000000000, std::numeric_limits<uint64_t>::max()}},
      {"83f4f5f6", Array{false, true, Value()}},
      {"81f7", Array{Value()}},
      {"83f93e00fa47c35000fb3ff199999999999a", Array{1.5, 100000.0, 1.1}},
      {"8244010203046161", Array{Data{1, 2, 3, 4}, "a"}},
      {"a26161016162820203", Dictionary{{"a", 1}, {"b", Array{2, 3}}}},
      {"9f018202039fffff", Array{1, Array{2, 3}, Array{}}},
      {"bf61610161629fff6163bfffff", Dictionary{{"a", 1}, {"b", Array{}}, {"c", Dictionary{}}}},
      {"825f42010243030405ff7f657374726561646d696e67ff", Array{Data{1, 2, 3, 4, 5}, "streaming"}},
      {"a17f6161ff02", Dictionary{{"a", 2}}},
      {"c11a514b67b0", Date{1363896240}},
      {"c1fb41d452d9ec200000", Date{1363896240.5}},
      {"c1f90000", Date{0}},
      {"c120", Date{-1}},
      {"c074323031332d30332d32315432303a30343a30305a", Date{1363896240}},
      {"c07f6a323031332d30332d32316a5432303a30343a30305aff", Date{1363896240}},
      {"d9d9f705", 5},
      {"d9d9f76161", "a"},
      {"d9d9f780", Array{}},
      {"a2616101616102", Dictionary{{"a", 2}}},
      {"813bffffffffffffffff", Array{-18446744073709551616.0}},
      {"813b7fffffffffffffff", Array{std::numeric_limits<int64_t>::min()}},
      {"813b8000000000000000", Array{-9223372036854775809.0}},
      {"82203903e7", Array{-1, -1000}},
      {"f6", Value()},
      {"f5", true},
      {"fb3ff0000000000000", 1.0},
  };
  for (const auto& one : cases) {
    EXPECT_EQ(parsed(bytesOf(one.hex)), one.value) << one.hex;
  }
}

TEST(BinaryDocumentTest, refusesWhatIsNotACompleteDocument) {
  for (const char* hex : {"81", "9f", "a16161", "bf6161", "826161", "c1", "d9d9f7", "d9d9", "8262c3", "8144",
                          "9f5f4101", "fb3ff0", "81c0"}) {
    EXPECT_THAT(refusal(hex), HasSubstr("ends too early")) << hex;
  }
  EXPECT_THAT(refusal("8000"), HasSubstr("bytes after the document at byte 1"));
  EXPECT_THAT(refusal("f5f5"), HasSubstr("bytes after the document"));
}

TEST(BinaryDocumentTest, refusesItemsThatHaveNoPlace) {
  EXPECT_THAT(refusal("811c"), HasSubstr("an item that CBOR does not know at byte 1"));
  EXPECT_THAT(refusal("81f800"), HasSubstr("an item that CBOR does not know"));
  EXPECT_THAT(refusal("81e0"), HasSubstr("an item that CBOR does not know"));
  EXPECT_THAT(refusal("a10102"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("a1410102"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("a15f4101ff02"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("a18002"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("a1c0616102"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("a1f602"), HasSubstr("a key that is not text"));
  EXPECT_THAT(refusal("8161ff"), HasSubstr("text that is not UTF-8"));
  EXPECT_THAT(refusal("a161ff01"), HasSubstr("a key that is not UTF-8"));
  EXPECT_THAT(refusal("817f61c361a9ff"), HasSubstr("accepted"));
  EXPECT_THAT(refusal("ff"), HasSubstr("a break where nothing can end"));
  EXPECT_THAT(refusal("81ff"), HasSubstr("a break where nothing can end"));
  EXPECT_THAT(refusal("bf6161ff"), HasSubstr("a break where nothing can end"));
  EXPECT_THAT(refusal("9fc1ff"), HasSubstr("a break where nothing can end"));
  EXPECT_THAT(refusal("815f6161ff"), HasSubstr("a chunk that is not of the kind of its string"));
  EXPECT_THAT(refusal("817f4161ff"), HasSubstr("a chunk that is not of the kind of its string"));
  EXPECT_THAT(refusal("817f7f6161ffff"), HasSubstr("a chunk that is not of the kind of its string"));
  EXPECT_THAT(refusal("817f01ff"), HasSubstr("a chunk that is not of the kind of its string"));
}

TEST(BinaryDocumentTest, refusesTagsButDates) {
  EXPECT_THAT(refusal("c24101"), HasSubstr("tag 2, which is not known here"));
  EXPECT_THAT(refusal("d81c80"), HasSubstr("tag 28"));
  EXPECT_THAT(refusal("81d9d9f700"), HasSubstr("tag 55799"));
  EXPECT_THAT(refusal("c0c06161"), HasSubstr("tag 0"));
  EXPECT_THAT(refusal("c06161"), HasSubstr("a date that is no RFC 3339 time"));
  for (const char* hex : {"c16161", "c001", "c180", "c1a0", "c1f5", "c1f6", "c04101", "c0f6", "c19fff"}) {
    EXPECT_THAT(refusal(hex), HasSubstr("a date tag on something that is no date")) << hex;
  }
}

TEST(BinaryDocumentTest, setsNothingAsideForWhatIsOnlyClaimed) {
  EXPECT_THAT(refusal("9b7fffffffffffffff"), HasSubstr("claims to hold more than it has bytes for"));
  EXPECT_THAT(refusal("9bffffffffffffffff"), HasSubstr("claims to hold more than it has bytes for"));
  EXPECT_THAT(refusal("bb7fffffffffffffff"), HasSubstr("claims to hold more than it has bytes for"));
  EXPECT_THAT(refusal("829a7fffffff00"), HasSubstr("claims to hold more than it has bytes for"));
  EXPECT_THAT(refusal("815b7fffffffffffffff00"), HasSubstr("ends too early"));
  EXPECT_THAT(refusal("817bffffffffffffffff00"), HasSubstr("ends too early"));
}

TEST(BinaryDocumentTest, holdsToItsLimits) {
  const DocumentLimits limits{.bytes = 100, .depth = 3, .values = 6};
  EXPECT_THAT(refusal("81818101", limits), HasSubstr("accepted"));
  EXPECT_THAT(refusal("8181818101", limits), HasSubstr("more than 3 levels of nesting at byte 3"));
  EXPECT_THAT(refusal("9f9f9f9f", limits), HasSubstr("more than 3 levels of nesting"));
  EXPECT_THAT(refusal("850102030405", limits), HasSubstr("accepted"));
  EXPECT_THAT(refusal("86010203040506", limits), HasSubstr("more than 6 values"));
  EXPECT_THAT(refusal("a3616101616202616303", limits), HasSubstr("more than 6 values"));
  const std::string deep(1000000, '\x81');
  EXPECT_EQ(parseDocument(deep).error().code(), kDocumentTooLarge);
}

TEST(BinaryDocumentTest, writesWhatItReads) {
  const Dictionary all = {{"text", std::string("a\0\xC3\xA9", 4)},
                          {"long", std::string(70000, 'x')},
                          {"yes", true},
                          {"none", Value()},
                          {"small", std::numeric_limits<int64_t>::min()},
                          {"minus", -1},
                          {"large", std::numeric_limits<uint64_t>::max()},
                          {"real", 0.1},
                          {"whole", 5.0},
                          {"infinite", std::numeric_limits<double>::infinity()},
                          {"list", Array{Array{}, Dictionary{}, 1}},
                          {"when", Date{1769857200.123456}},
                          {"bytes", Data{0, 255}}};
  EXPECT_EQ(parsed(writeBinaryDocument(all)), Value(all));
  EXPECT_EQ(writeBinaryDocument(all), writeBinaryDocument(Dictionary(all)));
}

TEST(BinaryDocumentTest, marksADocumentThatWouldLookLikeText) {
  for (const Value& value :
       {Value(5), Value(-5), Value("text"), Value(Data{1}), Value(123456789), Value(0)}) {
    const std::string bytes = writeBinaryDocument(value);
    EXPECT_EQ(bytes.substr(0, 3), "\xD9\xD9\xF7");
    EXPECT_EQ(parsed(bytes), value);
  }
  for (const Value& value :
       {Value(Array{}), Value(Dictionary{}), Value(true), Value(), Value(1.5), Value(Date{1})}) {
    const std::string bytes = writeBinaryDocument(value);
    EXPECT_NE(bytes.substr(0, 3), "\xD9\xD9\xF7");
    EXPECT_EQ(parsed(bytes), value);
  }
}

}  // namespace
}  // namespace tarnel
