#include "tools/storebag/signed_storebag.h"

#include <gmock/gmock.h>

#include "formats/document.h"

namespace tarnel {
namespace {

using ::testing::StartsWith;

constexpr char kInner[] = "{ \"version\" : \"1.0\",\n  \"refresh_cycle\":60 }\n";

class SignedStorebag : public ::testing::TestWithParam<DocumentForm> {
 protected:
  static const StorebagKey& key() {
    static const StorebagKey kKey = *StorebagKey::generate(2048);
    return kKey;
  }
  static std::shared_ptr<const RsaPublicKey> publicKey() {
    return RsaPublicKey::fromDer(key().publicKeyDer());
  }

  static std::string failure(const Dictionary& outer) {
    const std::string bytes =
        GetParam() == DocumentForm::text ? writeTextDocument(outer) : writeBinaryDocument(outer);
    const Result<Value> inner = verifySignedStorebag(bytes, *publicKey());
    return inner ? "" : inner.error().localizedDescription();
  }
  static Dictionary outer(std::string_view inner = kInner) {
    return *parseDocument(*makeSignedStorebag(inner, key(), GetParam()))->dictionary();
  }
};

TEST_P(SignedStorebag, HoldsTheVeryBytesThatWereSigned) {
  const std::string bytes = *makeSignedStorebag(kInner, key(), GetParam());
  EXPECT_EQ(bytes.front() == '{', GetParam() == DocumentForm::text);
  const Result<OpenedStorebag> opened = openSignedStorebag(bytes, *publicKey());
  ASSERT_TRUE(opened) << opened.error().description();
  EXPECT_EQ(opened->innerBytes, kInner);
  EXPECT_EQ(opened->inner, Value(Dictionary{{"version", "1.0"}, {"refresh_cycle", 60}}));
}

TEST_P(SignedStorebag, EachFailureNamesItsStep) {
  EXPECT_THAT(verifySignedStorebag("", *publicKey()).error().localizedDescription(),
              StartsWith("outer document: "));
  EXPECT_THAT(verifySignedStorebag("[1]", *publicKey()).error().localizedDescription(),
              StartsWith("outer document: its top level"));
  Dictionary changed = outer();
  changed.remove("signature");
  EXPECT_THAT(failure(changed), StartsWith("signature: missing"));
  changed.set("signature", 5);
  EXPECT_THAT(failure(changed), StartsWith("signature: not a text"));
  changed.set("signature", "A");
  EXPECT_THAT(failure(changed), StartsWith("signature: not base-64"));
  changed.set("signature", "AAAA");
  EXPECT_THAT(failure(changed), StartsWith("signature: does not verify"));
  changed = outer();
  changed.remove("bag");
  EXPECT_THAT(failure(changed), StartsWith("bag: missing"));
  changed.set("bag", "A");
  EXPECT_THAT(failure(changed), StartsWith("bag: not base-64"));
  EXPECT_THAT(failure(outer("{ not a document")), StartsWith("inner document: "));
}

TEST_P(SignedStorebag, ABagChangedAfterSigningDoesNotVerify) {
  Dictionary changed = outer();
  changed.set("bag", *findString(outer("{\"version\":\"2.0\"}"), "bag"));
  EXPECT_THAT(failure(changed), StartsWith("signature: does not verify"));
}

TEST_P(SignedStorebag, AnotherKeyDoesNotVerify) {
  const StorebagKey other = *StorebagKey::generate(2048);
  const std::string bytes = *makeSignedStorebag(kInner, other, GetParam());
  EXPECT_THAT(verifySignedStorebag(bytes, *publicKey()).error().localizedDescription(),
              StartsWith("signature: does not verify"));
}

INSTANTIATE_TEST_SUITE_P(Forms, SignedStorebag, ::testing::Values(DocumentForm::text, DocumentForm::binary));

}  // namespace
}  // namespace tarnel
