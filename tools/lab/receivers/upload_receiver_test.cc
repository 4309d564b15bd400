#include "tools/lab/receivers/upload_receiver.h"

#include <gmock/gmock.h>

#include <filesystem>

#include "formats/document.h"
#include "tools/lab/receivers/storing_receiver_test_fixture.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;

class UploadReceiverTest : public StoringReceiverTest {
 protected:
  // The folder's name holds the word by which an upload counts as taken.
  UploadReceiverTest() : StoringReceiverTest("tarnel_success_") {}

  UploadArrival receive(const HttpRequest& request) {
    answer_ = receiver_.receive(request);
    return store_.lastUploads(1).at(0);
  }
  bool isTaken() const { return answer_.body.find("success") != std::string::npos; }
  size_t filesInFolder() const {
    return static_cast<size_t>(std::distance(std::filesystem::directory_iterator(folder_), {}));
  }

  static constexpr uint64_t kMaxBytes = 1U << 20U;
  UploadReceiver receiver_{files_, kMaxBytes, store_, misbehaviours_, clock_};
  HttpAnswer answer_;
};

TEST_F(UploadReceiverTest, AFileIsUnpackedAndKeptWithWhatIsKnownAboutIt) {
  const std::string text(100'000, 'x');
  const UploadArrival arrival = receive(goodUpload("a%20b.log.gz", text));
  EXPECT_THAT(arrival.problems, IsEmpty());
  EXPECT_EQ(arrival.file, folder_ + "/20231114-221320-0001-a_b.log");
  EXPECT_EQ(*readFile(arrival.file, kMaxBytes), text);
  EXPECT_EQ(arrival.query.filename, "a b.log.gz");
  EXPECT_EQ(arrival.plainBytes, text.size());
  EXPECT_EQ(arrival.wireBytes, gzipped(text).size());
  EXPECT_EQ(answer_.status, 200);
  EXPECT_EQ(answer_.body,
            "{\"result\":\"success\",\"file\":\"20231114-221320-0001-a_b.log\",\"bytes\":100000,"
            "\"problems\":[]}\n");
  const Dictionary beside = *parseDocument(*readFile(arrival.file + ".json", kMaxBytes))->dictionary();
  EXPECT_EQ(*findString(beside, "filename"), "a b.log.gz");
  EXPECT_EQ(*findString(beside, "sequence"), "77");
  EXPECT_EQ(*findString(beside, "uuid"), "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(*findString(beside, "description"), "Lumora AFRC log (Uploaded by QMX)");
  EXPECT_EQ(*findString(*findDictionary(beside, "headers"), "Content-Encoding"), "gzip");
  EXPECT_EQ(*findString(beside, "file"), arrival.file);
  EXPECT_EQ(beside.find("answered"), nullptr) << "not settled when it is written";
}

TEST_F(UploadReceiverTest, ProblemsAreToldAndDoNotRefuse) {
  HttpRequest request = goodUpload("x.gz", "text");
  request.rawQuery = "filename=..%2F..%2Fx";
  const UploadArrival arrival = receive(request);
  EXPECT_THAT(
      arrival.problems,
      ElementsAre("query: uuid: missing", "query: sequence: missing", "query: description: missing",
                  "query: filename: \"../../x\" names a folder",
                  "query: filename: \"../../x\" must be a name that ends in .gz", "query: raw: missing"));
  EXPECT_TRUE(isTaken());
  EXPECT_EQ(arrival.file, folder_ + "/20231114-221320-0001-.._.._x");
  EXPECT_THAT(receive(goodUpload("x.gz", "")).problems,
              ElementsAre("body: an empty file, which the service does not send"));
}

TEST_F(UploadReceiverTest, ARefusalNeverReadsAsTaken) {
  HttpRequest damaged = goodUpload("success.gz", "text");
  damaged.body.resize(damaged.body.size() / 2);
  UploadArrival arrival = receive(damaged);
  EXPECT_EQ(answer_.status, 400);
  EXPECT_FALSE(isTaken());
  EXPECT_THAT(answer_.body, HasSubstr("\"body: gzip: ends before its end: it was cut off\""));
  EXPECT_EQ(arrival.file, "");
  // The path of the folder stands in this reason.
  std::filesystem::remove_all(folder_);
  arrival = receive(goodUpload("success.gz", "text"));
  EXPECT_THAT(arrival.problems, ElementsAre(StartsWith("cannot write " + folder_)));
  EXPECT_EQ(answer_.status, 500);
  EXPECT_EQ(answer_.body, "{\"result\":\"refused\"}\n");
}

TEST_F(UploadReceiverTest, WhatCannotBeUnpackedLeavesNothingBehind) {
  HttpRequest request = goodUpload("x.gz", "text");
  request.body = "no gzip";
  EXPECT_THAT(receive(request).problems, ElementsAre("body: gzip: incorrect header check"));
  request = goodUpload("x.gz", "text");
  request.body += "after it";
  EXPECT_THAT(receive(request).problems, ElementsAre(StartsWith("body: gzip: ")));
  EXPECT_THAT(receive(goodUpload("x.gz", std::string(kMaxBytes + 1, 'x'))).problems,
              ElementsAre("body: gzip: unpacks to more than 1048576 bytes"));
  EXPECT_EQ(answer_.status, 400);
  EXPECT_EQ(filesInFolder(), 0U);
  EXPECT_EQ(receive(goodUpload("x.gz", std::string(kMaxBytes, 'x'))).plainBytes, kMaxBytes);
}

TEST_F(UploadReceiverTest, BodiesThatDidNotComeWholeAreRefused) {
  HttpRequest request = goodUpload("x.gz", "text");
  request.bodyState = BodyState::tooLarge;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: larger than 1.0 MB"));
  EXPECT_EQ(answer_.status, 413);
  request.bodyState = BodyState::cutOff;
  EXPECT_THAT(receive(request).problems, ElementsAre("body: the connection ended within it"));
  EXPECT_EQ(answer_.status, 400);
}

TEST_F(UploadReceiverTest, OnlyGzipIsUnpacked) {
  HttpRequest request = goodUpload("x.gz", "text");
  setHeader(request, "Content-Encoding", "br");
  EXPECT_THAT(receive(request).problems, ElementsAre("header Content-Encoding: must be gzip, but is \"br\""));
  EXPECT_EQ(answer_.status, 415);
  setHeader(request, "Content-Encoding", "");
  EXPECT_THAT(receive(request).problems,
              ElementsAre("header Content-Encoding: must be gzip, but is missing"));
  EXPECT_FALSE(isTaken());
}

TEST_F(UploadReceiverTest, RefusesOnPurpose) {
  ASSERT_FALSE(misbehaviours_.add(*misbehaviourFromQuery({{"for", "uploads"}, {"refuse", "1"}})));
  const UploadArrival arrival = receive(goodUpload("x.gz", "text"));
  EXPECT_EQ(answer_.body, "{\"result\":\"refused\",\"problems\":[\"on purpose\"]}\n");
  EXPECT_EQ(arrival.answered, "refused");
  EXPECT_EQ(*readFile(arrival.file, 100), "text") << "what came is there for a look";
  receive(goodUpload("x.gz", "text"));
  EXPECT_TRUE(isTaken());
  ASSERT_FALSE(misbehaviours_.add(*misbehaviourFromQuery({{"for", "uploads"}, {"status", "503"}})));
  receive(goodUpload("x.gz", "text"));
  EXPECT_EQ(answer_.status, 503);
  EXPECT_TRUE(isTaken()) << "the service looks at the text alone";
}

TEST_F(UploadReceiverTest, WhatStrangersSendIsFitForPrinting) {
  EXPECT_EQ(receive(goodUpload("%1B[2J%FF.gz", "text")).query.filename, "?[2J?.gz");
  const std::string longest(255, 'x');
  EXPECT_EQ(receive(goodUpload(longest, "text")).query.filename, longest)
      << "what may be a name is kept whole";
}

}  // namespace
}  // namespace tarnel::lab
