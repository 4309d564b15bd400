#include "platform/linux/bundles/adaptor_values.h"

#include <gtest/gtest.h>

#include <string>

#include "tarnel/tarnel_adaptor.h"

// The table of functions with which an adaptor reads what it is handed.

namespace tarnel {
namespace {

class AdaptorValuesTest : public testing::Test {
 protected:
  const tarnel_value* find(const char* key) const { return values.dictionary_find(dictionary, key); }

  const tarnel_adaptor_values& values = adaptorValues();
  const MaybeDictionary held = Dictionary{{"bool", true},
                                          {"integer", -5},
                                          {"unsigned", UINT64_MAX},
                                          {"real", 2.75},
                                          {"date", Date{12.25}},
                                          {"text", "gr\xC3\xBC"},
                                          {"data", Data{0, 255}},
                                          {"array", Array{1, "two"}},
                                          {"dictionary", Dictionary{{"x", 1}}}};
  const tarnel_dictionary* const dictionary = forAdaptor(held);
};

TEST_F(AdaptorValuesTest, TheTableSaysItsSize) {
  EXPECT_EQ(values.size, sizeof(tarnel_adaptor_values));
  EXPECT_EQ(&adaptorValues(), &values);
}

TEST_F(AdaptorValuesTest, EntriesAreInTheirOrderAndNothingIsBeyond) {
  ASSERT_EQ(values.dictionary_count(dictionary), 9U);
  EXPECT_STREQ(values.dictionary_key_at(dictionary, 0), "bool");
  EXPECT_STREQ(values.dictionary_key_at(dictionary, 8), "dictionary");
  EXPECT_EQ(values.dictionary_value_at(dictionary, 8), find("dictionary"));
  EXPECT_EQ(values.dictionary_key_at(dictionary, 9), nullptr);
  EXPECT_EQ(values.dictionary_value_at(dictionary, 9), nullptr);
  EXPECT_EQ(find("none"), nullptr);
  EXPECT_EQ(find(nullptr), nullptr);
  const tarnel_array* const array = values.value_array(find("array"));
  ASSERT_EQ(values.array_count(array), 2U);
  EXPECT_EQ(values.value_int64(values.array_value_at(array, 0)), 1);
  EXPECT_EQ(values.array_value_at(array, 2), nullptr);
}

TEST_F(AdaptorValuesTest, ValuesAreReadAsWhatTheyAre) {
  EXPECT_EQ(values.value_type(find("bool")), TARNEL_TYPE_BOOLEAN);
  EXPECT_EQ(values.value_type(find("integer")), TARNEL_TYPE_INTEGER);
  EXPECT_EQ(values.value_type(find("unsigned")), TARNEL_TYPE_UNSIGNED_INTEGER);
  EXPECT_EQ(values.value_type(find("real")), TARNEL_TYPE_REAL);
  EXPECT_EQ(values.value_type(find("date")), TARNEL_TYPE_DATE);
  EXPECT_EQ(values.value_type(find("text")), TARNEL_TYPE_STRING);
  EXPECT_EQ(values.value_type(find("data")), TARNEL_TYPE_DATA);
  EXPECT_EQ(values.value_type(find("array")), TARNEL_TYPE_ARRAY);
  EXPECT_EQ(values.value_type(find("dictionary")), TARNEL_TYPE_DICTIONARY);
  EXPECT_TRUE(values.value_bool(find("bool")));
  EXPECT_EQ(values.value_int64(find("integer")), -5);
  EXPECT_EQ(values.value_uint64(find("unsigned")), UINT64_MAX);
  EXPECT_EQ(values.value_double(find("real")), 2.75);
  EXPECT_EQ(values.value_date(find("date")), 12.25);
  size_t length = 9;
  EXPECT_STREQ(values.value_string(find("text"), &length), "gr\xC3\xBC");
  EXPECT_EQ(length, 4U);
  EXPECT_STREQ(values.value_string(find("text"), nullptr), "gr\xC3\xBC");
  const uint8_t* const data = values.value_data(find("data"), &length);
  ASSERT_EQ(length, 2U);
  EXPECT_EQ(data[1], 255);
  EXPECT_EQ(values.value_data(find("data"), nullptr), data);
  EXPECT_EQ(values.dictionary_count(values.value_dictionary(find("dictionary"))), 1U);
}

TEST_F(AdaptorValuesTest, NumbersAreConverted) {
  EXPECT_EQ(values.value_int64(find("bool")), 1);
  EXPECT_EQ(values.value_uint64(find("bool")), 1U);
  EXPECT_EQ(values.value_double(find("bool")), 1);
  EXPECT_EQ(values.value_int64(find("real")), 2);
  EXPECT_EQ(values.value_double(find("integer")), -5);
  EXPECT_TRUE(values.value_bool(find("integer")));
}

TEST_F(AdaptorValuesTest, AValueOfAnotherTypeAndNoValueReadAsNothing) {
  for (const tarnel_value* value : {find("none"), find("dictionary")}) {
    size_t length = 9;
    EXPECT_FALSE(values.value_bool(value));
    EXPECT_EQ(values.value_int64(value), 0);
    EXPECT_EQ(values.value_uint64(value), 0U);
    EXPECT_EQ(values.value_double(value), 0);
    EXPECT_EQ(values.value_date(value), 0);
    EXPECT_EQ(values.value_string(value, &length), nullptr);
    EXPECT_EQ(length, 0U);
    length = 9;
    EXPECT_EQ(values.value_data(value, &length), nullptr);
    EXPECT_EQ(length, 0U);
    EXPECT_EQ(values.value_array(value), nullptr);
  }
  EXPECT_EQ(values.value_dictionary(find("text")), nullptr);
  EXPECT_EQ(values.value_dictionary(nullptr), nullptr);
  EXPECT_EQ(values.value_type(nullptr), TARNEL_TYPE_NULL);
  EXPECT_EQ(forAdaptor(std::nullopt), nullptr);
  EXPECT_EQ(values.dictionary_count(nullptr), 0U);
  EXPECT_EQ(values.dictionary_key_at(nullptr, 0), nullptr);
  EXPECT_EQ(values.dictionary_value_at(nullptr, 0), nullptr);
  EXPECT_EQ(values.dictionary_find(nullptr, "x"), nullptr);
  EXPECT_EQ(values.array_count(nullptr), 0U);
  EXPECT_EQ(values.array_value_at(nullptr, 0), nullptr);
}

}  // namespace
}  // namespace tarnel
