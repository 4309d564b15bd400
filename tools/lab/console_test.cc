#include "tools/lab/console.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <unistd.h>

#include <array>
#include <memory>

#include "base/unique_fd.h"
#include "formats/document.h"
#include "platform/fake/fake_clock.h"
#include "tools/files/file_io.h"
#include "tools/lab/summary.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class ConsoleTest : public ::testing::Test {
 protected:
  using Stream = std::unique_ptr<std::FILE, decltype(&std::fclose)>;

  Console console(ConsoleStyle style, bool colour = false) {
    return {output_.get(), errors_.get(), style, colour, clock_};
  }
  static std::string read(const Stream& stream) {
    std::rewind(stream.get());
    std::string text(65536, '\0');
    text.resize(std::fread(text.data(), 1, text.size(), stream.get()));
    return text;
  }
  static Arrival arrival() {
    Arrival arrival;
    arrival.number = 1;
    arrival.path = "/v1/events";
    arrival.headers = goodRequest(Dictionary{}).headers;
    arrival.events = {goodEvent(1, 2), goodEvent(2, 2), goodEvent(3, 14)};
    arrival.gzip = true;
    arrival.wireBytes = 797;
    arrival.plainBytes = 17'200;
    arrival.answered = "200";
    return arrival;
  }

  Stream output_{std::tmpfile(), std::fclose};
  Stream errors_{std::tmpfile(), std::fclose};
  fake::FakeClock clock_;
};

TEST_F(ConsoleTest, AnArrivalIsOneLine) {
  console(ConsoleStyle::text).arrived(arrival());
  EXPECT_THAT(read(output_),
              HasSubstr("  POST /v1/events  OW  Meetwell / video-call  3 events (method 2 x2, 14)  "
                        "797 B gzip of 17.2 kB  ok\n"));
}

TEST_F(ConsoleTest, ProblemsStandBelowIt) {
  Arrival bad = arrival();
  bad.problems = {"event 1: _status: missing"};
  bad.answered = "400";
  console(ConsoleStyle::text).arrived(bad);
  EXPECT_THAT(read(output_),
              HasSubstr("  1 problem  answered: 400\n              ! event 1: _status: missing\n"));
}

TEST_F(ConsoleTest, ColourOnlyWhenAskedFor) {
  console(ConsoleStyle::text, false).arrived(arrival());
  EXPECT_THAT(read(output_), Not(HasSubstr("\033")));
  console(ConsoleStyle::text, true).arrived(arrival());
  EXPECT_THAT(read(output_), HasSubstr("\033[32mok\033[0m"));
}

TEST_F(ConsoleTest, WhatIsMissingOrHostileIsStillOneLine) {
  Arrival strange;
  strange.path = "/";
  strange.headers = {{"X-TRN-Sender", "\033[2J\nOW"}};
  EXPECT_EQ(summaryOf(strange), "?[2J?OW  0 events  0 B");
  strange.headers.clear();
  EXPECT_EQ(summaryOf(strange), "unknown sender  0 events  0 B");
  for (int method = 0; method < 20; ++method) strange.events.append(goodEvent(1, method));
  EXPECT_THAT(summaryOf(strange), HasSubstr("(method 0, 1, 2, 3, 4, 5, 6, 7, ...)"));
}

TEST_F(ConsoleTest, FilesAndLogDataAreOneLineEach) {
  UploadArrival upload;
  upload.path = "/v1/uploads";
  upload.query.filename = "a b.log.gz";
  upload.query.sequence = "77";
  upload.file = "/lab/uploads/20261120-142501-0001-a_b.log";
  upload.gzip = true;
  upload.wireBytes = 797;
  upload.plainBytes = 17'200;
  upload.answered = "refused";
  LogDataArrival logData;
  logData.path = "/v1/log-data";
  logData.records = {Dictionary(), Dictionary()};
  logData.wireBytes = 340;
  logData.archiveFile = "/lab/log-data/20261120-142501-0002-records.archive";
  logData.problems = {"record 2: must be a dictionary"};
  logData.answered = "200";
  Console text = console(ConsoleStyle::text);
  text.uploadArrived(upload);
  text.logDataArrived(logData);
  text.flush();
  const std::string printed = read(output_);
  EXPECT_THAT(printed,
              HasSubstr("  POST /v1/uploads  file \"a b.log.gz\"  session 77  797 B gzip of 17.2 kB  "
                        "in 20261120-142501-0001-a_b.log  ok  answered: refused\n"));
  EXPECT_THAT(printed, HasSubstr("  POST /v1/log-data  log data  2 records  340 B  "
                                 "in 20261120-142501-0002-records.archive  1 problem\n"
                                 "              ! record 2: must be a dictionary\n"));
  EXPECT_EQ(summaryOf(UploadArrival()), "file without a name  0 B");
}

TEST_F(ConsoleTest, DatagramsAreOneLineEach) {
  DatagramArrival datagram;
  datagram.sender = "127.0.0.1:5";
  datagram.size = 68;
  datagram.content = DashboardDatagram{
      .clientType = 12, .sessionID = 7, .method = 1, .status = 8, .event = 3, .text = " a=1 b=\033[2J"};
  datagram.answer = DatagramAnswer::acknowledged;
  Console text = console(ConsoleStyle::text);
  text.datagramArrived(datagram);
  datagram.repetition = 3;
  datagram.answer = DatagramAnswer::dropped;
  text.datagramArrived(datagram);
  datagram.content.reset();
  datagram.problems = {"no datagram: has 68 bytes, but names 70"};
  datagram.answer = DatagramAnswer::nothing;
  text.datagramArrived(datagram);
  text.flush();
  const std::string printed = read(output_);
  EXPECT_THAT(printed, HasSubstr("  UDP  127.0.0.1:5  client type 12  session 7  event 3  method 1  status 8"
                                 "  a=1 b=?[2J  ok  acknowledged\n"));
  EXPECT_THAT(printed, HasSubstr("?[2J  again (3)  ok  dropped\n"));
  EXPECT_THAT(printed, HasSubstr("  UDP  127.0.0.1:5  68 B  1 problem\n"
                                 "              ! no datagram: has 68 bytes, but names 70\n"));
}

TEST_F(ConsoleTest, JsonIsOneObjectALine) {
  Console json = console(ConsoleStyle::json);
  json.started("text", {{"url", "https://127.0.0.1:7"}});
  json.arrived(arrival());
  json.storebagServed({.time = 1, .sender = "s", .name = "a\xff", .version = "1", .status = 200, .bytes = 5});
  json.uploadArrived({});
  json.logDataArrived({});
  json.datagramArrived({});
  json.warning("careful");
  json.ended("bye");
  json.flush();
  std::string text = read(output_);
  std::vector<std::string> kinds;
  for (size_t end = text.find('\n'); end != std::string::npos; end = text.find('\n')) {
    const Result<Value> line = parseDocument(text.substr(0, end));
    ASSERT_TRUE(line) << text.substr(0, end);
    kinds.push_back(*findString(*line->dictionary(), "kind"));
    text.erase(0, end + 1);
  }
  EXPECT_THAT(kinds, ::testing::ElementsAre("started", "post", "storebag", "upload", "logData", "datagram",
                                            "warning", "ended"));
  EXPECT_EQ(read(errors_), "");
}

TEST_F(ConsoleTest, LinesThatTheOutputDoesNotTakeAreCounted) {
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const UniqueFd reader(ends[0]);
  const Stream pipe(::fdopen(ends[1], "w"), std::fclose);
  size_t left = 0;
  const auto readSome = [&reader, &left](size_t most) {
    std::vector<char> bytes(most);
    const ssize_t count = ::read(reader.get(), bytes.data(), bytes.size());
    ASSERT_GT(count, 0);
    left -= static_cast<size_t>(count);
  };
  Console text(pipe.get(), errors_.get(), ConsoleStyle::text, false, clock_);
  const std::string large(1U << 20U, 'x');
  text.started(large, {});
  readSome(1);
  const std::string largest(PrintQueue::kMaxWaitingBytes, 'x');
  text.started(largest, {});
  for (int i = 0; i < 1200; ++i) text.ended("lost");
  for (left = large.size() - 1 + largest.size(); left > 0;) readSome(65536);
  text.flush();
  EXPECT_THAT(read(errors_), HasSubstr("  warning  lines that the output did not take, and that are lost: "
                                       "1,200; what arrived is in the files\n"));
}

TEST_F(ConsoleTest, QuietSaysWarningsOnly) {
  Console quiet = console(ConsoleStyle::quiet);
  quiet.started("text", {});
  quiet.arrived(arrival());
  quiet.uploadArrived({});
  quiet.logDataArrived({});
  quiet.datagramArrived({});
  quiet.storebagServed({});
  quiet.ended("bye");
  quiet.warning("careful");
  quiet.flush();
  EXPECT_EQ(read(output_), "");
  EXPECT_THAT(read(errors_), HasSubstr("  warning  careful\n"));
}

TEST_F(ConsoleTest, ServedStorebags) {
  Console text = console(ConsoleStyle::text);
  text.storebagServed({.name = "brevan", .version = "1.2", .status = 200, .bytes = 8300});
  text.storebagServed({.name = "brevan", .version = "1.2", .status = 304});
  text.storebagServed({.name = "none", .status = 404, .remark = "no such file"});
  text.flush();
  const std::string printed = read(output_);
  EXPECT_THAT(printed, HasSubstr("  GET  storebag brevan  version 1.2  8.3 kB\n"));
  EXPECT_THAT(printed, HasSubstr("  GET  storebag brevan  version 1.2  not modified\n"));
  EXPECT_THAT(printed, HasSubstr("  GET  storebag none  404  no such file\n"));
}

}  // namespace
}  // namespace tarnel::lab
