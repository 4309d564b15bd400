#include "formats/cryptography.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

std::span<const uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

template <class Digest>
std::string hexOf(const Digest& digest) {
  return Value(Data(digest.begin(), digest.end())).description();
}

struct Key {
  explicit Key(EVP_PKEY* made) : key(made, EVP_PKEY_free) {}
  Data publicKeyInfo() const {
    Data der(static_cast<size_t>(i2d_PUBKEY(key.get(), nullptr)));
    uint8_t* end = der.data();
    i2d_PUBKEY(key.get(), &end);
    return der;
  }
  Data publicKey() const {
    Data der(static_cast<size_t>(i2d_PublicKey(key.get(), nullptr)));
    uint8_t* end = der.data();
    i2d_PublicKey(key.get(), &end);
    return der;
  }
  Data sign(const Sha1Digest& digest, const EVP_MD* named = EVP_sha1(),
            int padding = RSA_PKCS1_PADDING) const {
    const std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> context(
        EVP_PKEY_CTX_new(key.get(), nullptr), EVP_PKEY_CTX_free);
    EVP_PKEY_sign_init(context.get());
    EVP_PKEY_CTX_set_rsa_padding(context.get(), padding);
    if (named != nullptr) EVP_PKEY_CTX_set_signature_md(context.get(), named);
    Data signature(static_cast<size_t>(EVP_PKEY_get_size(key.get())));
    size_t length = signature.size();
    EXPECT_EQ(EVP_PKEY_sign(context.get(), signature.data(), &length, digest.data(), digest.size()), 1);
    signature.resize(length);
    return signature;
  }
  std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> key;
};

const Key& testKey() {
  static const Key key(EVP_RSA_gen(2048));
  return key;
}

TEST(DigestTest, givesThePublishedDigests) {
  EXPECT_EQ(hexOf(sha1(bytesOf(""))), "<da39a3ee5e6b4b0d3255bfef95601890afd80709>");
  EXPECT_EQ(hexOf(sha1(bytesOf("abc"))), "<a9993e364706816aba3e25717850c26c9cd0d89d>");
  EXPECT_EQ(hexOf(sha256(bytesOf(""))), "<e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855>");
  EXPECT_EQ(hexOf(sha256(bytesOf("abc"))),
            "<ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad>");
  EXPECT_EQ(hexOf(sha256(bytesOf(std::string(1000000, 'a')))),
            "<cdc76e5c9914fb9281a1c7e284d73e67f1809a48a497200e046d39ccc7112cd0>");
}

TEST(DigestTest, isTheSameOnEveryThread) {
  const auto expected = sha256(bytesOf("abc"));
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&expected] {
      for (int i = 0; i < 500; ++i) {
        EXPECT_EQ(sha256(bytesOf("abc")), expected);
        EXPECT_EQ(sha1(bytesOf("abc"))[0], 0xA9);
      }
    });
  }
  for (auto& thread : threads) thread.join();
}

TEST(RsaPublicKeyTest, verifiesASignatureWithEitherFormOfTheKey) {
  const auto digest = sha1(bytesOf("bag"));
  const Data signature = testKey().sign(digest);
  for (const Data& der : {testKey().publicKeyInfo(), testKey().publicKey()}) {
    const auto key = RsaPublicKey::fromDer(der);
    ASSERT_NE(key, nullptr);
    EXPECT_TRUE(key->verifyPkcs1Sha1(digest, signature));
    EXPECT_FALSE(key->verifyPkcs1Sha1(sha1(bytesOf("another bag")), signature));
  }
}

TEST(RsaPublicKeyTest, refusesEverySignatureButTheRightOne) {
  const auto key = RsaPublicKey::fromDer(testKey().publicKeyInfo());
  ASSERT_NE(key, nullptr);
  const auto digest = sha1(bytesOf("bag"));
  const Data good = testKey().sign(digest);
  for (size_t i = 0; i < good.size(); i += 17) {
    Data bent = good;
    bent[i] ^= 1;
    EXPECT_FALSE(key->verifyPkcs1Sha1(digest, bent));
  }
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, {}));
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, Data(good.begin(), good.end() - 1)));
  Data longer = good;
  longer.push_back(0);
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, longer));
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, Data(good.size(), 0)));
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, Data(good.size(), 0xFF)));
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, Key(EVP_RSA_gen(2048)).sign(digest)));
}

TEST(RsaPublicKeyTest, checksTheEncodingOfTheDigestInsideThePadding) {
  const auto key = RsaPublicKey::fromDer(testKey().publicKeyInfo());
  const auto digest = sha1(bytesOf("bag"));
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, testKey().sign(digest, nullptr))) << "the bare digest";
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, testKey().sign(digest, EVP_ripemd160())))
      << "another digest's name";
  EXPECT_FALSE(key->verifyPkcs1Sha1(digest, testKey().sign(digest, EVP_sha1(), RSA_PKCS1_PSS_PADDING)));
}

TEST(RsaPublicKeyTest, verifiesOnManyThreadsAtOnce) {
  const auto key = RsaPublicKey::fromDer(testKey().publicKeyInfo());
  const auto digest = sha1(bytesOf("bag"));
  const Data signature = testKey().sign(digest);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&key, &digest, &signature] {
      for (int i = 0; i < 20; ++i) EXPECT_TRUE(key->verifyPkcs1Sha1(digest, signature));
    });
  }
  for (auto& thread : threads) thread.join();
}

TEST(RsaPublicKeyTest, takesKeysOfAcceptedSizesOnly) {
  EXPECT_EQ(RsaPublicKey::fromDer(Key(EVP_RSA_gen(1023)).publicKeyInfo()), nullptr);
  EXPECT_EQ(RsaPublicKey::fromDer(Key(EVP_RSA_gen(512)).publicKeyInfo()), nullptr);
  EXPECT_NE(RsaPublicKey::fromDer(Key(EVP_RSA_gen(1024)).publicKeyInfo()), nullptr);
}

TEST(RsaPublicKeyTest, refusesWhatIsNoRsaKey) {
  EXPECT_EQ(RsaPublicKey::fromDer({}), nullptr);
  EXPECT_EQ(RsaPublicKey::fromDer(bytesOf("no key at all")), nullptr);
  EXPECT_EQ(RsaPublicKey::fromDer(Key(EVP_EC_gen("P-256")).publicKeyInfo()), nullptr);
  EXPECT_EQ(RsaPublicKey::fromDer(Key(EVP_PKEY_Q_keygen(nullptr, nullptr, "ED25519")).publicKeyInfo()),
            nullptr);
  Data cut = testKey().publicKeyInfo();
  cut.pop_back();
  EXPECT_EQ(RsaPublicKey::fromDer(cut), nullptr);
  Data followed = testKey().publicKeyInfo();
  followed.push_back(0);
  EXPECT_EQ(RsaPublicKey::fromDer(followed), nullptr);
  EXPECT_EQ(RsaPublicKey::fromDer(Data(100000, 0x30)), nullptr);
}

}  // namespace
}  // namespace tarnel
