#include "tools/receiving/gunzip.h"

#include <gmock/gmock.h>
#include <zlib.h>

#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;

std::string problem(std::string_view input, size_t maxBytes = 1000) {
  const Result<std::string> output = gunzip(input, maxBytes);
  return output ? "" : output.error().localizedDescription();
}

TEST(Gunzip, UnpacksOneOrMoreMembers) {
  EXPECT_EQ(*gunzip(gzipped("hello"), 1000), "hello");
  EXPECT_EQ(*gunzip(gzipped("hello ") + gzipped("again"), 1000), "hello again");
  EXPECT_EQ(*gunzip(gzipped(""), 1000), "");
  const std::string large(100'000, 'x');
  EXPECT_EQ(*gunzip(gzipped(large), large.size()), large);
}

TEST(Gunzip, BoundsWhatComesOut) {
  EXPECT_TRUE(gunzip(gzipped(std::string(1000, 'x')), 1000));
  EXPECT_EQ(problem(gzipped(std::string(1001, 'x'))), "gzip: unpacks to more than 1000 bytes");
  EXPECT_EQ(problem(gzipped(std::string(20'000'000, 'x'))), "gzip: unpacks to more than 1000 bytes");
}

TEST(Gunzip, DamageIsNamed) {
  EXPECT_EQ(problem(""), "gzip: the body is empty");
  EXPECT_THAT(problem("{\"postTime\":1}"), HasSubstr("incorrect header check"));
  const std::string whole = gzipped("some text that is worth packing");
  for (size_t size = 1; size < whole.size(); ++size) {
    EXPECT_EQ(problem(whole.substr(0, size)), "gzip: ends before its end: it was cut off") << size;
  }
  std::string damaged = whole;
  damaged[damaged.size() - 6] ^= 1;
  EXPECT_THAT(problem(damaged), HasSubstr("incorrect data check"));
  EXPECT_THAT(problem(whole + "rest"), HasSubstr("gzip: "));
}

}  // namespace
}  // namespace tarnel::lab
