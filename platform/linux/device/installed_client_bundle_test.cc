#include "platform/linux/device/installed_client_bundle.h"

#include <gtest/gtest.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <memory>

#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

std::string publicKeyDer() {
  const std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> key(EVP_RSA_gen(2048), EVP_PKEY_free);
  unsigned char* bytes = nullptr;
  const int size = i2d_PUBKEY(key.get(), &bytes);
  const std::string der(reinterpret_cast<const char*>(bytes), static_cast<size_t>(size));
  OPENSSL_free(bytes);
  return der;
}

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

TEST(InstalledClientBundle, ItsProblemsAreNamedWithTheRemedy) {
  const TemporaryFolder folder;
  const std::string other = "or name the folder of another bundle with TARNEL_BUNDLE";
  const std::string keyRemedy =
      ", so no storebag can be verified; put the public key there that belongs to your signing key "
      "(tarnelctl storebag keygen makes one), " +
      other;
  InstalledClientBundle bundle(folder.path("bundle"));
  EXPECT_EQ(
      bundle.problems(),
      (std::vector<std::string>{
          folder.path("bundle/publicKey.der") + ": cannot be opened: No such file or directory" + keyRemedy,
          folder.path("bundle/version") +
              ": holds no version, so storebags are asked for as by 8.0; install libtarnel, " + other}));
  folder.write("bundle/version", "8.2");
  folder.write("bundle/publicKey.der", "no key");
  EXPECT_EQ(bundle.problems(),
            (std::vector<std::string>{folder.path("bundle/publicKey.der") +
                                      ": holds no RSA public key in DER form" + keyRemedy}));
  folder.write("bundle/publicKey.der", publicKeyDer());
  EXPECT_TRUE(bundle.problems().empty());
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
