#include "tools/tarnelctl/visible_output.h"

#include <gtest/gtest.h>

#include <ostream>
#include <sstream>
#include <string>

namespace tarnel::ctl {
namespace {

std::string shown(const std::string& text) {
  std::ostringstream target;
  VisibleOutput visible(*target.rdbuf());
  std::ostream(&visible) << text << std::flush;
  return target.str();
}

TEST(VisibleOutputTest, PlainTextPasses) {
  const std::string text = "a\tb\nÄ € 😀 \u00A0\u00BF end\n";
  EXPECT_EQ(shown(text), text);
}

TEST(VisibleOutputTest, ControlCharactersAreShown) {
  EXPECT_EQ(shown("\x1b[31mred\r\x07\x7f"), "\\x1b[31mred\\x0d\\x07\\x7f");
  EXPECT_EQ(shown(std::string("a\0b", 3)), "a\\x00b");
  EXPECT_EQ(shown("\u009B31m"), "\\xc2\\x9b31m");
  EXPECT_EQ(shown("\xC2\xC2\x80x"), "\xC2\\xc2\\x80x");
}

TEST(VisibleOutputTest, ATargetThatFailsIsNoticed) {
  std::stringbuf readOnly(std::ios::in);
  VisibleOutput visible(readOnly);
  std::ostream out(&visible);
  out << "x";
  EXPECT_FALSE(out.good());
}

}  // namespace
}  // namespace tarnel::ctl
