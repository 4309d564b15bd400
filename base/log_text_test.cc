#include "base/log_text.h"

#include <gtest/gtest.h>

namespace tarnel {
namespace {

TEST(LogText, TextIsKeptAndWhatIsNoneIsEscaped) {
  EXPECT_EQ(escapedForLog("Grüße € 𝄞"), "Grüße € 𝄞");
  EXPECT_EQ(escapedForLog("a\xFF\xC3"), "a\\xff\\xc3");
  EXPECT_EQ(escapedForLog("csi \xC2\x9B end"), "csi \\xc2\\x9b end");
  EXPECT_EQ(escapedForLog("end\n"), "end");
  EXPECT_EQ(escapedForLog("end\n\n"), "end\\n");
  EXPECT_EQ(escapedForLog(std::string(16384 + 7, 'x')), std::string(16384, 'x') + " [7 bytes more]");
  EXPECT_EQ(escapedForLog(std::string(16383, 'x') + "\xE2\x82\xAC"),
            std::string(16383, 'x') + " [3 bytes more]");
}

}  // namespace
}  // namespace tarnel
