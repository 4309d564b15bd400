#include <gtest/gtest.h>

#include <vector>

#include "platform/fake/fake_world.h"
#include "testing/test_storebag.h"
#include "util/storebag_internal.h"

namespace tarnel {
namespace {

using fake::DocumentForm;
using fake::FakeHttpClient;
using fake::StorebagSigner;

constexpr int32_t kUntouched = -77;
const std::string kModified = "Tue, 14 Nov 2023 22:13:20 GMT";

class StorebagFetchTest : public testing::Test {
 protected:
  void SetUp() override {
    world_.clientBundle.resources["publicKey.der"] = StorebagSigner::shared().publicKeyDer();
    world_.settings.setObject("com.orvane.tarnel", "tarnel_storebag_url", "https://bags.example/alder");
  }
  static Dictionary inner() { return {{"version", "7"}, {"release", Dictionary{}}}; }
  static std::string validBody() { return StorebagSigner::shared().signedStorebag(inner()); }
  void serve(std::string body, std::vector<HttpHeader> headers = {}, int status = 200) {
    world_.http.setAnswer(FakeHttpClient::status(status, std::move(body), std::move(headers)));
  }
  std::optional<Dictionary> fetch(const MaybeString& name = "vandor") {
    return detail::fetchStorebagWithName(world_.dependencies, name, {maxAge_, notModified_, &lastModified_});
  }
  bool logged(LogLevel level, const std::string& text) {
    return world_.log.contains(level, "fetchStorebagWithName: " + text);
  }
  std::vector<std::string> errors() {
    std::vector<std::string> found;
    for (const auto& line : world_.log.lines()) {
      if (line.level <= LogLevel::warning) found.push_back(line.text);
    }
    return found;
  }
  HttpRequest lastRequest() { return world_.http.requests().at(0); }

  fake::FakeWorld world_;
  int32_t maxAge_ = kUntouched;
  bool notModified_ = false;
  MaybeString lastModified_;
};

TEST_F(StorebagFetchTest, AsksForNameAndClientVersion) {
  serve(validBody());
  EXPECT_EQ(fetch(), inner());
  EXPECT_EQ(lastRequest().method, "GET");
  EXPECT_EQ(lastRequest().url, "https://bags.example/alder/vandor?version=3.2");
  EXPECT_EQ(lastRequest().timeout, std::chrono::seconds(15));
  EXPECT_EQ(lastRequest().body, nullptr);
  EXPECT_TRUE(lastRequest().headers.empty());
  EXPECT_TRUE(logged(LogLevel::debug, "Storebag Server URL: https://bags.example/alder/vandor?version=3.2"));
}

TEST_F(StorebagFetchTest, ClientVersionIsEightWithoutOne) {
  world_.clientBundle.versionText.reset();
  serve(validBody());
  EXPECT_TRUE(fetch());
  EXPECT_EQ(lastRequest().url, "https://bags.example/alder/vandor?version=8.0");
}

TEST_F(StorebagFetchTest, MissingNameStandsAsItsText) {
  serve(validBody());
  EXPECT_TRUE(fetch(std::nullopt));
  EXPECT_EQ(lastRequest().url, "https://bags.example/alder/(null)?version=3.2");
  EXPECT_TRUE(logged(LogLevel::debug, "Storebag Server URL: https://bags.example/alder/(null)?version=3.2"));
}

TEST_F(StorebagFetchTest, BytesThatNoURLHoldsAreEncodedInTheRequestOnly) {
  world_.clientBundle.versionText = "8 \xc3\xa9\"<>\\^`{|}\x7f%20~";
  serve(validBody());
  EXPECT_TRUE(fetch());
  EXPECT_EQ(lastRequest().url,
            "https://bags.example/alder/vandor?version=8%20%C3%A9%22%3C%3E%5C%5E%60%7B%7C%7D%7F%20~");
  EXPECT_TRUE(logged(LogLevel::debug, "Storebag Server URL: https://bags.example/alder/vandor?version=" +
                                          *world_.clientBundle.versionText));
}

TEST_F(StorebagFetchTest, LegalCharactersStayAsTheyAre) {
  const std::string legal = "https://user@[::1]:8443/a-b._~!$&'()*+,;=:@/x?y=%41#z";
  EXPECT_EQ(detail::urlForRequest(legal), legal);
}

TEST_F(StorebagFetchTest, StoredLastModifiedMakesTheRequestConditional) {
  lastModified_ = kModified;
  serve(validBody());
  EXPECT_TRUE(fetch());
  ASSERT_EQ(lastRequest().headers.size(), 1U);
  EXPECT_EQ(lastRequest().headers[0].name, "If-Modified-Since");
  EXPECT_EQ(lastRequest().headers[0].value, kModified);
  EXPECT_TRUE(logged(LogLevel::debug, "Adding 'Last-Modified: " + kModified + "' to the header"));
}

TEST_F(StorebagFetchTest, WithoutASlotNothingIsConditional) {
  serve("", {{"Last-Modified", kModified}});
  EXPECT_EQ(detail::fetchStorebagWithName(world_.dependencies, "vandor", {maxAge_, notModified_, nullptr}),
            std::nullopt);
  EXPECT_TRUE(lastRequest().headers.empty());
  EXPECT_FALSE(notModified_);
  EXPECT_TRUE(logged(LogLevel::error, "Signature is missing"));
}

TEST_F(StorebagFetchTest, SlotThatNoHeaderCanHoldIsNotSent) {
  for (const std::string& bad :
       {std::string("a\r\nX-Evil: 1"), std::string("a\0b", 3), std::string(1025, 'a')}) {
    lastModified_ = bad;
    serve(validBody());
    EXPECT_TRUE(fetch());
    EXPECT_TRUE(world_.http.requests().back().headers.empty());
  }
}

TEST_F(StorebagFetchTest, NewLastModifiedIsTaken) {
  serve(validBody(), {{"last-modified", kModified}});
  EXPECT_TRUE(fetch());
  EXPECT_EQ(lastModified_, kModified);
  EXPECT_FALSE(notModified_);
  EXPECT_TRUE(logged(LogLevel::debug, "New 'Last-Modified: " + kModified + "' received"));
}

TEST_F(StorebagFetchTest, LastModifiedIsTakenEvenWhenTheDocumentFails) {
  lastModified_ = "then";
  serve("garbage", {{"Last-Modified", kModified}});
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_EQ(lastModified_, kModified);
}

TEST_F(StorebagFetchTest, LastModifiedThatNoRequestCouldRepeatIsIgnored) {
  lastModified_ = "then";
  serve(validBody(), {{"Last-Modified", "a\nb"}});
  EXPECT_TRUE(fetch());
  EXPECT_EQ(lastModified_, "then");
  EXPECT_TRUE(logged(LogLevel::warning, "ignoring 'Last-Modified': no valid header value"));
}

TEST_F(StorebagFetchTest, EmptyBodyWithLastModifiedIsNotModified) {
  lastModified_ = "then";
  serve("", {{"Last-Modified", kModified}, {"Cache-Control", "max-age=60"}}, 304);
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_TRUE(notModified_);
  EXPECT_EQ(lastModified_, "then");
  EXPECT_EQ(maxAge_, 60);
  EXPECT_TRUE(logged(LogLevel::debug, "storebag content has not changed. using its cached version"));
  EXPECT_TRUE(errors().empty());
}

TEST_F(StorebagFetchTest, EmptyBodyWithoutLastModifiedIsAParseFailure) {
  lastModified_ = "then";
  serve("", {}, 304);
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_FALSE(notModified_);
  const auto lines = errors();
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_TRUE(lines[0].starts_with("fetchStorebagWithName: documentWithData error "));
  EXPECT_EQ(lines[1], "fetchStorebagWithName: Signature is missing");
}

TEST_F(StorebagFetchTest, EmptyBodyWithAnEmptySlotIsNoNotModified) {
  serve("", {{"Last-Modified", kModified}});
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_FALSE(notModified_);
  EXPECT_EQ(lastModified_, kModified);
  EXPECT_TRUE(logged(LogLevel::error, "Signature is missing"));
}

TEST_F(StorebagFetchTest, MaximumAgeByCacheControl) {
  const std::vector<std::pair<std::string, int32_t>> rows = {
      {"no-cache, max-age=600", 600},
      {"max-age=600", 600},
      {"max-age=600, public", 600},
      {"max-age 600", 600},
      {"public,max-age=600", 86400},  // split at "=" and blanks alone
      {"max-age", 86400},
      {"public max-age", 86400},
      {"max-age=", 0},
      {"max-age= 600", 0},
      {"max-age=abc", 0},
      {"max-age=-5", -5},
      {"max-age=0", 0},
      {"max-age=90000", 90000},
      {"max-age=99999999999", INT32_MAX},
      {"max-age=-99999999999", INT32_MIN},
      {"max-age=99999999999999999999999", INT32_MAX},
      {"max-age=max-age=5", 0},
      {"s-maxage=5, max-age=7", 7},
      {"Max-Age=600", 86400},
      {"", 86400},
      {"no-store", 86400}};
  for (const auto& [value, seconds] : rows) {
    const HttpResponse response{200, {{"cache-control", value}}};
    EXPECT_EQ(detail::maxAgeOfResponse(&response), seconds) << value;
  }
}

TEST_F(StorebagFetchTest, MaximumAgeWithoutCacheControl) {
  const HttpResponse response{200, {}};
  EXPECT_EQ(detail::maxAgeOfResponse(&response), 86400);
  EXPECT_EQ(detail::maxAgeOfResponse(nullptr), 86400);
}

TEST_F(StorebagFetchTest, CacheControlInTwoFieldsIsOneValue) {
  const HttpResponse response{200,
                              {{"Cache-Control", "no-cache"}, {"X", "y"}, {"Cache-Control", "max-age=600"}}};
  EXPECT_EQ(detail::maxAgeOfResponse(&response), 600);
}

TEST_F(StorebagFetchTest, MaximumAgeIsWrittenEvenWhenTheDocumentFails) {
  serve("garbage", {{"Cache-Control", "max-age=61"}});
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_EQ(maxAge_, 61);
}

TEST_F(StorebagFetchTest, StatusIsNeverExamined) {
  serve(validBody(), {}, 500);
  EXPECT_EQ(fetch(), inner());
}

TEST_F(StorebagFetchTest, ErrorStatusWithABodyFailsAtTheSignature) {
  serve("<html>404</html>", {}, 404);
  EXPECT_EQ(fetch("calvisto"), std::nullopt);
  const auto lines = errors();
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_TRUE(lines[0].starts_with("fetchStorebagWithName: documentWithData error "));
  EXPECT_EQ(lines[1], "fetchStorebagWithName: Signature is missing");
  EXPECT_TRUE(world_.log.startingWith("fetchStorebagWithName: Loading").empty());
}

TEST_F(StorebagFetchTest, BothFormsAreAcceptedInsideAndOutside) {
  const auto& signer = StorebagSigner::shared();
  for (const auto outerForm : {DocumentForm::text, DocumentForm::binary}) {
    for (const auto innerForm : {DocumentForm::text, DocumentForm::binary}) {
      serve(signer.signedBag(fake::writeDocument(inner(), innerForm), outerForm));
      EXPECT_EQ(fetch(), inner());
    }
  }
}

TEST_F(StorebagFetchTest, CharactersOutsideTheBase64AlphabetAreIgnored) {
  const auto& signer = StorebagSigner::shared();
  const std::string bag = fake::writeDocument(inner(), DocumentForm::text);
  auto broken = [](const std::string& text) { return text.substr(0, 5) + "\n -!" + text.substr(5); };
  const Dictionary outer{
      {"signature", broken(base64Encode(signer.sign(bag)))},
      {"bag", broken(base64Encode({reinterpret_cast<const uint8_t*>(bag.data()), bag.size()}))}};
  serve(fake::writeDocument(outer, DocumentForm::text));
  EXPECT_EQ(fetch(), inner());
}

TEST_F(StorebagFetchTest, MissingSignature) {
  for (const Value& outer : {Value(Dictionary{{"bag", "AAAA"}}), Value(Array{}), Value(Dictionary{}),
                             Value(Dictionary{{"signature", 5}, {"bag", "AAAA"}})}) {
    world_.log.clear();
    serve(fake::writeDocument(outer, DocumentForm::text));
    EXPECT_EQ(fetch(), std::nullopt);
    EXPECT_EQ(errors(), std::vector<std::string>{"fetchStorebagWithName: Signature is missing"});
  }
}

TEST_F(StorebagFetchTest, RefusedWithoutALine) {
  const std::string good = base64Encode(StorebagSigner::shared().sign("x"));
  const std::vector<Dictionary> outers = {{{"signature", "A"}, {"bag", "AAAA"}},
                                          {{"signature", good}},
                                          {{"signature", good}, {"bag", 5}},
                                          {{"signature", good}, {"bag", "A"}}};
  for (const auto& outer : outers) {
    world_.log.clear();
    serve(fake::writeDocument(outer, DocumentForm::text));
    EXPECT_EQ(fetch(), std::nullopt);
    EXPECT_TRUE(errors().empty()) << description(outer);
  }
}

TEST_F(StorebagFetchTest, KeyThatCannotBeMadeIsRefusedWithoutALine) {
  serve(validBody());
  world_.clientBundle.resources["publicKey.der"] = {1, 2, 3};
  EXPECT_EQ(fetch(), std::nullopt);
  world_.clientBundle.resources.clear();
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_TRUE(errors().empty());
}

void expectUnverified(const std::vector<std::string>& lines) {
  ASSERT_EQ(lines.size(), 1U);
  EXPECT_TRUE(lines[0].starts_with("fetchStorebagWithName: Signature can not be verified, 0x")) << lines[0];
}

TEST_F(StorebagFetchTest, WrongSignatureIsReported) {
  const std::string bag = fake::writeDocument(inner(), DocumentForm::text);
  const auto bagText = base64Encode({reinterpret_cast<const uint8_t*>(bag.data()), bag.size()});
  for (const auto& signature : {base64Encode(StorebagSigner::foreign().sign(bag)),
                                base64Encode(StorebagSigner::shared().sign(bag + " ")), std::string()}) {
    world_.log.clear();
    serve(fake::writeDocument(Dictionary{{"signature", signature}, {"bag", bagText}}, DocumentForm::text));
    EXPECT_EQ(fetch(), std::nullopt);
    expectUnverified(errors());
  }
}

TEST_F(StorebagFetchTest, SignatureCoversExactlyTheDecodedBytes) {
  const auto& signer = StorebagSigner::shared();
  const std::string bag = fake::writeDocument(inner(), DocumentForm::text);
  const auto key = RsaPublicKey::fromDer(signer.publicKeyDer());
  ASSERT_NE(key, nullptr);
  auto bytes = Data(bag.begin(), bag.end());
  auto signature = signer.sign(bag);
  EXPECT_TRUE(verifyStorebagSignature(*key, bytes, signature));
  bytes.push_back('\n');
  EXPECT_FALSE(verifyStorebagSignature(*key, bytes, signature)) << "one byte more";
  bytes.pop_back();
  signature.back() = static_cast<uint8_t>(signature.back() ^ 1U);
  EXPECT_FALSE(verifyStorebagSignature(*key, bytes, signature)) << "one bit of the signature";
  EXPECT_FALSE(verifyStorebagSignature(*key, bytes, {}));
}

TEST_F(StorebagFetchTest, VerifiedBagThatIsNoDictionaryIsRefusedWithoutALine) {
  for (const std::string bag : {"", "[1]", "{", "\"text\""}) {
    serve(StorebagSigner::shared().signedBag(bag));
    EXPECT_EQ(fetch(), std::nullopt);
    EXPECT_TRUE(errors().empty()) << bag;
  }
}

TEST_F(StorebagFetchTest, TransportFailureGivesNothing) {
  world_.http.setAnswer(FakeHttpClient::failure("connection refused"));
  lastModified_ = "then";
  for (const MaybeString& name : {MaybeString("vandor"), MaybeString("Calvisto"), MaybeString()}) {
    EXPECT_EQ(fetch(name), std::nullopt);
  }
  EXPECT_TRUE(logged(LogLevel::information,
                     "Error resolving with lookup server https://bags.example/alder/vandor?version=3.2, "
                     "sendSynchronousRequest error " +
                         Error(kHttpErrorDomain, 7, "connection refused").description()));
  EXPECT_TRUE(world_.log.startingWith("fetchStorebagWithName: Loading").empty());
  EXPECT_EQ(maxAge_, kUntouched);
  EXPECT_FALSE(notModified_);
  EXPECT_EQ(lastModified_, "then");
}

TEST_F(StorebagFetchTest, AnAnswerThatBreaksOffIsATransportFailureWhateverItsHeadersSay) {
  auto result = FakeHttpClient::failure("cut short");
  result.response = HttpResponse{200, {{"Last-Modified", kModified}, {"Cache-Control", "max-age=60"}}};
  world_.http.setAnswer(result);
  lastModified_ = "then";
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_EQ(maxAge_, kUntouched);
  EXPECT_FALSE(notModified_);
  EXPECT_EQ(lastModified_, "then");
  EXPECT_NE(fetch("calvisto"), std::nullopt);
}

TEST_F(StorebagFetchTest, TransportFailureForCalvistoGivesTheBuiltInStorebag) {
  world_.http.setAnswer(FakeHttpClient::failure("connection refused"));
  lastModified_ = "then";
  const Dictionary dravik{{"dravik", Dictionary{{"active", true}}}};
  const Dictionary expected{{"orvane_internal", dravik},
                            {"development", dravik},
                            {"release", dravik},
                            {"version", "1.0.0-Calvisto-Fallback"},
                            {"refresh_cycle", 3600}};
  EXPECT_EQ(fetch("calvisto"), expected);
  EXPECT_TRUE(logged(LogLevel::information, "Loading default storebag 'calvisto'"));
  EXPECT_EQ(maxAge_, kUntouched);
  EXPECT_FALSE(notModified_);
  EXPECT_EQ(lastModified_, "then");
}

// Whatever arrives, the result is the signed document or nothing.
TEST_F(StorebagFetchTest, DamagedBytesNeverChangeWhatIsAccepted) {
  const std::string valid = StorebagSigner::shared().signedStorebag(inner(), DocumentForm::binary);
  for (size_t i = 0; i < valid.size(); i += 7) {
    std::string damaged = valid;
    damaged[i] = static_cast<char>(damaged[i] ^ 0x5A);
    serve(damaged);
    const auto result = fetch();
    EXPECT_TRUE(!result || *result == inner()) << i;
    serve(valid.substr(0, i));
    EXPECT_EQ(fetch(), std::nullopt) << i;
  }
}

}  // namespace
}  // namespace tarnel
