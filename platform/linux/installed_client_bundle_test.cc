#include "platform/linux/installed_client_bundle.h"

#include <gtest/gtest.h>

#include "platform/linux/linux_test_support.h"

namespace tarnel {
namespace {

TEST(InstalledClientBundle, HasAVersionAndResources) {
  const TemporaryFolder folder;
  folder.write("bundle/version", " 8.2\nmore\n");
  folder.write("bundle/publicKey.der", std::string("\x30\x00\xFF", 3));
  InstalledClientBundle bundle(folder.path("bundle"));
  EXPECT_EQ(bundle.version(), "8.2");
  EXPECT_EQ(bundle.resource("publicKey", "der"), (Data{0x30, 0x00, 0xFF}));
}

TEST(InstalledClientBundle, WhatIsMissingIsAbsent) {
  const TemporaryFolder folder;
  InstalledClientBundle bundle(folder.path("none"));
  EXPECT_FALSE(bundle.version());
  EXPECT_FALSE(bundle.resource("publicKey", "der"));
}

TEST(InstalledClientBundle, AVersionThatIsNoTextIsAbsent) {
  const TemporaryFolder folder;
  InstalledClientBundle bundle(folder.path());
  for (const char* text : {"", "\n", "\xFF\n"}) {
    folder.write("version", text);
    EXPECT_FALSE(bundle.version());
  }
}

TEST(InstalledClientBundle, NothingOutsideOfItIsAResource) {
  const TemporaryFolder folder;
  folder.write("secret.der", "x");
  folder.makeDirectory("bundle");
  InstalledClientBundle bundle(folder.path("bundle"));
  EXPECT_FALSE(bundle.resource("../secret", "der"));
  EXPECT_FALSE(bundle.resource("secret", "/der"));
}

TEST(InstalledClientBundle, TheVariableNamesTheFolder) {
  EXPECT_EQ(InstalledClientBundle::folder("/tmp/bundle"), "/tmp/bundle");
  for (const char* variable : {static_cast<const char*>(nullptr), "", "relative"}) {
    EXPECT_TRUE(InstalledClientBundle::folder(variable).ends_with("/share/tarnel/bundle"));
  }
}

}  // namespace
}  // namespace tarnel
