#include "tools/storebag/storebag_template.h"

#include <gmock/gmock.h>

#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/storebag/storebag_validation.h"

namespace tarnel {
namespace {

TEST(StorebagTemplateTest, PassesTheChecksWithoutAFinding) {
  const std::vector<StorebagFinding> findings = validateStorebag(newStorebagTemplate());
  EXPECT_TRUE(findings.empty()) << findings.front().description();
  EXPECT_EQ(*parseDocument(writeTextDocument(newStorebagTemplate(), true)), Value(newStorebagTemplate()));
}

TEST(StorebagTemplateTest, TakesWhatItIsGiven) {
  const Dictionary bag = newStorebagTemplate({.version = "3.1",
                                              .client = "A,B",
                                              .service = "call",
                                              .baseURL = "https://reports.tarnel.example",
                                              .countries = {"SE"}});
  EXPECT_EQ(*findString(bag, "version"), "3.1");
  for (const char* section : {"seed", "release"}) {
    const Dictionary& profile = *findDictionary(*findDictionary(bag, section), "httppost");
    EXPECT_EQ(*findString(profile, "display_url"), "https://reports.tarnel.example/");
    const Dictionary& entry = *(*findArray(profile, "clients"))[0].dictionary();
    EXPECT_EQ(*findString(entry, "client"), "A,B");
    EXPECT_EQ(*findString(entry, "service"), "call");
    EXPECT_EQ(*findString(entry, "post_url"), "https://reports.tarnel.example/v1/events");
    EXPECT_EQ(*findString(entry, "realtime_post_url"), "https://reports.tarnel.example/v1/realtime");
    EXPECT_EQ(*findArray(entry, "locale_whitelist"), (Array{"SE"}));
  }
}

}  // namespace
}  // namespace tarnel
