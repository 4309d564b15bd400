#include "formats/toml.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace tarnel {
namespace {

Dictionary parsed(const std::string& text) {
  const auto document = parseToml(text);
  EXPECT_TRUE(document) << (document ? "" : document.error().description()) << "\n" << text;
  return document ? *document->value().dictionary() : Dictionary();
}

TEST(Toml, WhatIsWrittenReadsBackEqual) {
  Dictionary inner{{"a b", 1}, {"", "empty key"}};
  Array list{Value(true), Value(-5), Value("x\ty\"\\\n"), Value(inner), Value(Array{})};
  const Dictionary all{{"uuid:Foo:Bar", "4CE2A1F0-0000-4000-8000-000000000001"},
                       {"flag", false},
                       {"min", std::numeric_limits<int64_t>::min()},
                       {"max", std::numeric_limits<int64_t>::max()},
                       {"whole real", 3.0},
                       {"tiny", 5e-324},
                       {"huge", 1.7976931348623157e308},
                       {"inf", std::numeric_limits<double>::infinity()},
                       {"-inf", -std::numeric_limits<double>::infinity()},
                       {"date", Date{1700000000.25}},
                       {"old date", Date{-62167219200.0}},
                       {"umlaut ä\x7F", "ÿ\x01\x1F\x7F€"},
                       {"list", list},
                       {"table", inner},
                       {"nothing in it", Dictionary{}}};
  const auto text = writeToml(all);
  ASSERT_TRUE(text);
  EXPECT_EQ(parsed(*text), all) << *text;
}

TEST(Toml, RealsAndDatesKeepTheirType) {
  const auto text = writeToml(Dictionary{{"r", 2.0}, {"e", 1e300}, {"d", Date{0}}, {"n", std::nan("")}});
  ASSERT_TRUE(text);
  EXPECT_EQ(*text, "\"r\" = 2.0\n\"e\" = 1e+300\n\"d\" = 1970-01-01T00:00:00.000000Z\n\"n\" = nan\n");
  EXPECT_TRUE(std::isnan(*parsed(*text).find("n")->real()));
}

TEST(Toml, ADateReadsWithItsOffsetOrAsUtc) {
  const auto values =
      parsed("a = 1970-01-01T01:00:00+01:00\nb = 1970-01-01T00:00:01\nc = 1970-01-02\nd = 10:00:00\n");
  EXPECT_EQ(*values.find("a")->date(), Date{0});
  EXPECT_EQ(*values.find("b")->date(), Date{1});
  EXPECT_EQ(*values.find("c")->date(), Date{86400});
  EXPECT_TRUE(values.find("d")->isNull());
}

TEST(Toml, WhatCannotStandIsRefusedByItsKey) {
  Value deep = Value(1);
  for (int level = 0; level < 34; ++level) deep = Value(Array{deep});
  for (const Value& value : {Value(), Value(std::numeric_limits<uint64_t>::max()), Value(Data{1}),
                             Value("\xFF"), Value(Date{1e18}), Value(Date{std::nan("")}),
                             Value(Array{Value()}), Value(Dictionary{{"\xC3", 1}}), deep}) {
    const auto text = writeToml(Dictionary{{"good", 1}, {"bad key", value}});
    ASSERT_FALSE(text) << value.description();
    EXPECT_NE(text.error().localizedDescription().find("\"bad key\""), std::string::npos);
  }
}

TEST(Toml, AnErrorNamesItsLine) {
  const auto document = parseToml("a = 1\nb = 2\nc = = 3\n");
  ASSERT_FALSE(document);
  EXPECT_EQ(document.error().code(), 3);
  EXPECT_FALSE(document.error().localizedDescription().empty());
}

TEST(Toml, NodesKnowTheirLine) {
  const auto document = parseToml("a = 1\n[t]\nb = [1,\n 2]\n");
  ASSERT_TRUE(document);
  EXPECT_EQ(document->find("a")->line, 1U);
  EXPECT_EQ(document->find("t")->find("b")->line, 3U);
  EXPECT_EQ(document->find("t")->find("b")->elements[1].line, 4U);
}

TEST(Toml, HostileTextsAreErrors) {
  EXPECT_FALSE(parseToml(std::string(100000, '[')));
  EXPECT_FALSE(parseToml("a = " + std::string(100000, '[')));
  EXPECT_FALSE(parseToml("a = \"\xFF\""));
  EXPECT_FALSE(parseToml(std::string("a\0b", 3)));
  EXPECT_FALSE(parseToml("a = 1\na = 2\n"));
}

}  // namespace
}  // namespace tarnel
