#include "tools/lab/storebag_source.h"

#include <fcntl.h>
#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>

#include "formats/document.h"
#include "platform/fake/fake_clock.h"
#include "tools/lab/service.h"
#include "tools/receiving/test_post.h"
#include "tools/receiving/text.h"
#include "tools/storebag/signed_storebag.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

constexpr int64_t kStarted = 1'700'000'000;

class StorebagSourceTest : public ::testing::Test {
 protected:
  StorebagSourceTest() { std::filesystem::create_directories(folder_); }
  ~StorebagSourceTest() override { std::filesystem::remove_all(folder_); }

  static const StorebagKey& key() {
    static const StorebagKey kKey = *StorebagKey::generate(2048);
    return kKey;
  }
  // As an editor does it: a new file takes the old one's place. written: seconds since 1970.
  void put(const std::string& name, const std::string& text, int64_t written = kStarted - 10) {
    const std::string path = folder_ + "/" + name + ".json";
    std::ofstream(path + ".new") << text;
    const struct timespec times[2] = {{.tv_sec = written, .tv_nsec = 0}, {.tv_sec = written, .tv_nsec = 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, (path + ".new").c_str(), times, 0), 0);
    std::filesystem::rename(path + ".new", path);
  }
  Result<Value> innerOf(const std::string& outer) {
    return verifySignedStorebag(outer, *RsaPublicKey::fromDer(key().publicKeyDer()));
  }

  const std::string folder_ = ::testing::TempDir() + "tarnel_storebags_" +
                              ::testing::UnitTest::GetInstance()->current_test_info()->name();
  StorebagSource source_{folder_, key(), {.url = "https://127.0.0.1:7", .datagramPort = 9}, kStarted};
};

TEST_F(StorebagSourceTest, SignsTheDocumentWithTheLabsAddress) {
  put("a", "{\"version\": \"1\", \"url\": \"{{LAB_URL}}/x\", \"again\": \"{{LAB_URL}}\"}");
  const StorebagSource::Lookup lookup = source_.find("a");
  ASSERT_TRUE(lookup.storebag) << lookup.error;
  EXPECT_TRUE(lookup.fresh);
  EXPECT_EQ(*innerOf(lookup.storebag->outer),
            Value(Dictionary{
                {"version", "1"}, {"url", "https://127.0.0.1:7/x"}, {"again", "https://127.0.0.1:7"}}));
  EXPECT_EQ(lookup.storebag->version, "1");
  EXPECT_FALSE(source_.find("a").fresh);
}

TEST_F(StorebagSourceTest, ThePortForDatagramsIsANumber) {
  put("a", "{\"port\": {{LAB_DATAGRAM_PORT}}, \"again\": {{LAB_DATAGRAM_PORT}}}");
  const StorebagSource::Lookup lookup = source_.find("a");
  ASSERT_TRUE(lookup.storebag) << lookup.error;
  EXPECT_EQ(*innerOf(lookup.storebag->outer), Value(Dictionary{{"port", 9}, {"again", 9}}));
}

TEST_F(StorebagSourceTest, TheExamplesAreSoundAsTheyAreServed) {
  for (const char* name : {"brevan", "moldaro", "quintar"}) {
    std::filesystem::copy_file(std::string(TARNEL_EXAMPLES_DIRECTORY "/storebags/") + name + ".json",
                               folder_ + "/" + name + ".json");
    const StorebagSource::Lookup lookup = source_.find(name);
    ASSERT_TRUE(lookup.storebag) << lookup.error;
    EXPECT_THAT(lookup.storebag->findings, IsEmpty()) << name;
  }
}

TEST_F(StorebagSourceTest, TheBrokenOneFailsAtItsSignatureOnly) {
  put("a", "{\"version\": \"1\"}");
  const Result<Value> inner = innerOf(source_.find("a").storebag->brokenOuter);
  ASSERT_FALSE(inner);
  EXPECT_THAT(inner.error().localizedDescription(), HasSubstr("signature: does not verify"));
}

TEST_F(StorebagSourceTest, SignsAgainAfterAChangeAndDatesItLater) {
  put("a", "{\"version\": \"1\"}");
  const int64_t first = source_.find("a").storebag->lastModified;
  EXPECT_EQ(first, kStarted) << "another run may have served other content from this file";
  put("a", "{\"version\": \"2\"}");
  const StorebagSource::Lookup second = source_.find("a");
  EXPECT_EQ(second.storebag->version, "2");
  EXPECT_EQ(second.storebag->lastModified, first + 1) << "even within one second";
  put("a", "{\"version\": \"3\"}", kStarted + 500);
  EXPECT_EQ(source_.find("a").storebag->lastModified, kStarted + 500);
}

TEST_F(StorebagSourceTest, TheSameContentWrittenAgainIsNoChange) {
  put("a", "{\"version\": \"1\"}");
  const int64_t first = source_.find("a").storebag->lastModified;
  put("a", "{\"version\": \"1\"}", kStarted + 500);
  EXPECT_EQ(source_.find("a").storebag->lastModified, first);
}

TEST_F(StorebagSourceTest, ADamagedDocumentIsNamedWithItsLineAndServedAgainOnceMended) {
  put("a", "{\"version\": \"1\"}");
  source_.find("a");
  put("a", "{\n\"version\": \"1\",\n]");
  const StorebagSource::Lookup damaged = source_.find("a");
  EXPECT_FALSE(damaged.storebag);
  EXPECT_FALSE(damaged.missing);
  EXPECT_TRUE(damaged.fresh);
  EXPECT_THAT(damaged.error, HasSubstr(folder_ + "/a.json:3: "));
  EXPECT_THAT(damaged.error, HasSubstr("correct the file"));
  EXPECT_FALSE(source_.find("a").fresh) << "told once";
  put("a", "{\"version\": \"1\"}");
  EXPECT_TRUE(source_.find("a").storebag);
}

TEST_F(StorebagSourceTest, NamesCannotLeaveTheFolder) {
  for (const char* name : {"", ".", "..", "../a", "a/b", ".hidden", "a b", "a\n", "é"}) {
    EXPECT_FALSE(isStorebagName(name)) << name;
    EXPECT_TRUE(source_.find(name).missing) << name;
  }
  EXPECT_FALSE(isStorebagName(std::string(65, 'a')));
  EXPECT_TRUE(isStorebagName("Brevan-2_x.1"));
  EXPECT_THAT(source_.find("none").error, HasSubstr("put its inner document into " + folder_));
}

TEST_F(StorebagSourceTest, ListsWhatIsThere) {
  EXPECT_THAT(source_.names(), IsEmpty());
  put("moldaro", "{}");
  put("brevan", "{}");
  std::ofstream(folder_ + "/notes.txt") << "x";
  EXPECT_THAT(source_.names(), ElementsAre("brevan", "moldaro"));
}

TEST_F(StorebagSourceTest, FindingsComeWithTheStorebag) {
  put("a", "{\"refresh_cycle\": 5}");
  const StorebagSource::Lookup lookup = source_.find("a");
  ASSERT_TRUE(lookup.storebag) << "what the daemon refuses can be served, to try it";
  EXPECT_THAT(lookup.storebag->findings.at(0).description(), HasSubstr("version: missing"));
}

TEST(ConditionalGet, EqualOrLaterIsNotModified) {
  const std::string same = httpDate(1000);
  const std::string later = httpDate(1001);
  const std::string earlier = httpDate(999);
  const std::string nonsense = "yesterday";
  EXPECT_TRUE(isNotModified(&same, 1000));
  EXPECT_TRUE(isNotModified(&later, 1000));
  EXPECT_FALSE(isNotModified(&earlier, 1000));
  EXPECT_FALSE(isNotModified(&nonsense, 1000));
  EXPECT_FALSE(isNotModified(nullptr, 1000));
}

TEST(StorebagPaths, AllThreeFoldersWithOneName) {
  EXPECT_EQ(storebagNameInPath("/storebags/brevan"), "brevan");
  EXPECT_EQ(storebagNameInPath("/bags/alder/brevan"), "brevan");
  EXPECT_EQ(storebagNameInPath("/storebags/alder/brevan"), "brevan");
  for (const char* path :
       {"/", "/storebags", "/storebags/", "/storebags/a/b", "/bags/brevan", "/other/brevan"}) {
    EXPECT_EQ(storebagNameInPath(path), "") << path;
  }
}

class ServiceTest : public StorebagSourceTest, public Notices {
 protected:
  void storebagServed(const ServedStorebag& served) override { served_.push_back(served); }
  void warning(const std::string& text) override { warnings_.push_back(text); }
  HttpAnswer get(const std::string& path, const NameValues& headers = {}) {
    HttpRequest request;
    request.method = "GET";
    request.path = path;
    request.headers = headers;
    return service_.answer(request);
  }
  static std::string header(const HttpAnswer& answer, const char* name) {
    const std::string* value = findHeader(answer.headers, name);
    return value == nullptr ? "" : *value;
  }

  std::vector<ServedStorebag> served_;
  std::vector<std::string> warnings_;
  ArrivalStore store_{10};
  Misbehaviours misbehaviours_;
  fake::FakeClock clock_;
  PostReceiver posts_{store_, misbehaviours_, clock_};
  StoredFiles files_{folder_, *this, {}};
  UploadReceiver uploads_{files_, 50U << 20U, store_, misbehaviours_, clock_};
  LogDataReceiver logData_{files_, "http://127.0.0.1:8/log-data", store_, misbehaviours_, clock_};
  Service service_{{.storebags = source_,
                    .posts = posts_,
                    .uploads = uploads_,
                    .logData = logData_,
                    .misbehaviours = misbehaviours_,
                    .notices = *this,
                    .clock = clock_},
                   60};
};

TEST_F(ServiceTest, ConditionalRequestsAreAnsweredWithAnEmptyBodyAndTheDate) {
  put("a", "{\"version\": \"1\"}");
  const HttpAnswer full = get("/storebags/a");
  EXPECT_EQ(full.status, 200);
  EXPECT_EQ(header(full, "Cache-Control"), "max-age=60");
  EXPECT_EQ(header(full, "Last-Modified"), httpDate(kStarted));
  EXPECT_TRUE(innerOf(full.body));
  const HttpAnswer same = get("/storebags/a", {{"If-Modified-Since", header(full, "Last-Modified")}});
  EXPECT_EQ(same.status, 304);
  EXPECT_EQ(same.body, "");
  EXPECT_EQ(header(same, "Last-Modified"), httpDate(kStarted));
  EXPECT_EQ(header(same, "Cache-Control"), "max-age=60");
  put("a", "{\"version\": \"2\"}");
  EXPECT_EQ(get("/storebags/a", {{"If-Modified-Since", header(full, "Last-Modified")}}).status, 200);
  EXPECT_EQ(service_.storebagsServed(), 3U);
}

TEST_F(ServiceTest, MisbehaviourComesBeforeNotModified) {
  put("a", "{\"version\": \"1\"}");
  const std::string date = header(get("/storebags/a"), "Last-Modified");
  ASSERT_FALSE(misbehaviours_.add(*misbehaviourFromQuery({{"break-signature", "1"}})));
  EXPECT_FALSE(innerOf(get("/storebags/a", {{"If-Modified-Since", date}}).body));
  EXPECT_EQ(served_.back().remark, "on purpose: broken signature");
  EXPECT_EQ(get("/storebags/a", {{"If-Modified-Since", date}}).status, 304);
}

TEST_F(ServiceTest, AMissingOrDamagedDocumentIsAnsweredInWords) {
  EXPECT_EQ(get("/storebags/none").status, 404);
  put("a", "nonsense");
  const HttpAnswer answer = get("/storebags/a");
  EXPECT_EQ(answer.status, 500);
  EXPECT_THAT(answer.body, HasSubstr(folder_ + "/a.json:1: "));
  get("/storebags/a");
  EXPECT_THAT(warnings_, ElementsAre(HasSubstr("/a.json:1: "))) << "told once";
}

TEST_F(ServiceTest, FindingsAreToldOncePerChange) {
  put("a", "{\"refresh_cycle\": 5, \"release\": {}}");
  get("/storebags/a");
  get("/storebags/a");
  EXPECT_THAT(warnings_,
              ElementsAre(HasSubstr("storebags/a.json: version: missing"), HasSubstr("release: empty")));
}

TEST_F(ServiceTest, OtherRequests) {
  EXPECT_EQ(get("/").status, 200);
  EXPECT_EQ(get("/favicon.ico").status, 404);
}

TEST_F(ServiceTest, WhatIsPostedIsToldByItsHeadersWhateverThePath) {
  HttpRequest request = goodRequest(goodMessage({goodEvent(1)}), true);
  EXPECT_EQ(kindOfPost(request), PostKind::events);
  EXPECT_EQ(service_.maxBodyBytes(request), 16U << 20U);
  service_.answer(request);
  EXPECT_EQ(store_.counts().posts, 1U);

  request = goodUpload("x.gz", "text");
  EXPECT_EQ(kindOfPost(request), PostKind::file);
  EXPECT_EQ(service_.maxBodyBytes(request), 50U << 20U);
  service_.answer(request);
  EXPECT_EQ(store_.counts().uploads, 1U);
  setHeader(request, "Content-Encoding", "");
  EXPECT_EQ(kindOfPost(request), PostKind::logData);
  request.query = {{"filename", "x.gz"}};
  EXPECT_EQ(kindOfPost(request), PostKind::file) << "a file that is not packed is told as that";

  request.query.clear();
  service_.answer(request);
  EXPECT_EQ(service_.maxBodyBytes(request), 16U << 20U);
  EXPECT_EQ(store_.counts().logArchives, 1U);
  EXPECT_EQ(store_.counts().posts, 1U);
}

}  // namespace
}  // namespace tarnel::lab
