#include "tools/receiving/event_check.h"

#include <gmock/gmock.h>

#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

std::vector<std::string> eventProblems(const Value& event) {
  Problems problems;
  checkEvent(event, 3, problems);
  return problems.take();
}

std::vector<std::string> eventProblemsWith(const std::string& key, const Value& value) {
  Dictionary event = goodEvent(1);
  event.set(key, value);
  if (key == "_clientTS") event.set("eventTime", value);
  return eventProblems(event);
}

std::vector<std::string> messageProblems(const Value& document) {
  Problems problems;
  readMessage(document, problems);
  return problems.take();
}

std::vector<std::string> headerProblems(const HttpRequest& request, const Array& events, size_t plain = 0) {
  Problems problems;
  checkHeaders(request.headers, {.clientId = "x", .postTime = 1.0, .events = events},
               {.wireBytes = request.body.size(),
                .plainBytes = plain,
                .gzip = findHeader(request.headers, "Content-Encoding") != nullptr},
               problems);
  return problems.take();
}

std::vector<std::string> headerProblemsWith(const std::string& name, const std::string& value) {
  const Array events = {goodEvent(1, 2, 10)};
  HttpRequest request = goodRequest(goodMessage(events));
  setHeader(request, name, value);
  return headerProblems(request, events);
}

TEST(EventCheck, AGoodEventHasNoProblem) {
  EXPECT_THAT(eventProblems(goodEvent(1)), IsEmpty());
}

TEST(EventCheck, RequiredFieldsMustBeThere) {
  for (const char* key :
       {"_startTS", "_sender", "_clientVersion", "_eventNumber", "_method", "_status", "_clientTS",
        "eventTime", "_productFamily", "_productModel", "_internal", "_reportVers", "_timezoneOffset"}) {
    Dictionary event = goodEvent(1);
    event.remove(key);
    EXPECT_THAT(eventProblems(event), ElementsAre("event 3: " + std::string(key) + ": missing"));
  }
  for (const char* key : {"_sessionID", "_osVersion", "_build"}) {
    Dictionary event = goodEvent(1);
    event.remove(key);
    EXPECT_THAT(eventProblems(event), IsEmpty()) << key;
  }
}

TEST(EventCheck, FieldsHaveTheirTypesAndRanges) {
  EXPECT_THAT(eventProblemsWith("_startTS", 1795176601),
              ElementsAre(HasSubstr("whole seconds of a whole minute")));
  EXPECT_THAT(eventProblemsWith("_startTS", 1795176600.5), SizeIs(1));
  for (const char* key : {"_sender", "_productFamily", "_productModel", "_osVersion", "_build"}) {
    EXPECT_THAT(eventProblemsWith(key, 1), ElementsAre("event 3: " + std::string(key) + ": must be a text"));
  }
  for (const char* key : {"_clientVersion", "_eventNumber", "_method", "_status"}) {
    EXPECT_THAT(eventProblemsWith(key, 65535), IsEmpty());
    EXPECT_THAT(eventProblemsWith(key, 65536),
                ElementsAre(HasSubstr(std::string(key) + ": must be a whole number")));
    EXPECT_THAT(eventProblemsWith(key, -1), SizeIs(1));
    EXPECT_THAT(eventProblemsWith(key, true), SizeIs(1));
    EXPECT_THAT(eventProblemsWith(key, 1.5), SizeIs(1));
  }
  EXPECT_THAT(eventProblemsWith("_sessionID", 4294967295), IsEmpty());
  EXPECT_THAT(eventProblemsWith("_sessionID", 4294967296), SizeIs(1));
  EXPECT_THAT(eventProblemsWith("_internal", 3), IsEmpty());
  EXPECT_THAT(eventProblemsWith("_internal", 1), ElementsAre("event 3: _internal: must be 2 or 3"));
  EXPECT_THAT(eventProblemsWith("_clientTS", -1), IsEmpty());
  EXPECT_THAT(eventProblemsWith("_clientTS", "1"), Contains(HasSubstr("_clientTS: must be a number")));
  EXPECT_THAT(eventProblemsWith("_reportVers", "255.0"), IsEmpty());
  EXPECT_THAT(eventProblemsWith("_reportVers", "256.0"), SizeIs(1));
  EXPECT_THAT(eventProblemsWith("_reportVers", "8"), SizeIs(1));
  EXPECT_THAT(eventProblemsWith("_timezoneOffset", 100'000), SizeIs(1));
  EXPECT_THAT(eventProblemsWith("eventTime", 1.0), ElementsAre("event 3: eventTime: differs from _clientTS"));
}

TEST(EventCheck, OnlyTextsAndNumbersMayStand) {
  EXPECT_THAT(eventProblemsWith("list", Array{}),
              ElementsAre("event 3: list: holds a list, where only texts and numbers may stand"));
  EXPECT_THAT(eventProblemsWith("map", Dictionary{}), ElementsAre(HasSubstr("map: holds a dictionary")));
  EXPECT_THAT(eventProblemsWith("none", Value()), ElementsAre(HasSubstr("none: holds null")));
  EXPECT_THAT(eventProblemsWith("date", Date{1}), ElementsAre(HasSubstr("date: holds a date")));
  EXPECT_THAT(eventProblemsWith("data", Data{1}), ElementsAre(HasSubstr("data: holds data")));
  EXPECT_THAT(eventProblems(7), ElementsAre("event 3: must be an object"));
}

TEST(EventCheck, TheMessageHasItsThreeMembers) {
  EXPECT_THAT(messageProblems(goodMessage({goodEvent(1)})), IsEmpty());
  EXPECT_THAT(messageProblems(Array{}), ElementsAre(HasSubstr("message: must be an object")));
  EXPECT_THAT(messageProblems(Dictionary{}),
              ElementsAre("postTime: missing", "clientId: missing", "events: missing"));
  EXPECT_THAT(messageProblems(Dictionary{{"postTime", "1"}, {"clientId", 1}, {"events", 1}, {"more", 1}}),
              ElementsAre("postTime: must be a number", "clientId: must be a text", "events: must be a list",
                          "\"more\": unknown in a message"));
  EXPECT_THAT(messageProblems(goodMessage({})), ElementsAre("events: empty"));
}

TEST(EventCheck, AMessageThatStopsAtTheMissingIdentifierIsRecognised) {
  EXPECT_THAT(messageProblems(Dictionary{{"postTime", 1.5}}),
              ElementsAre("the message holds postTime only: its sender had no client identifier"));
}

TEST(EventCheck, HeadersAreAsTheServiceSendsThem) {
  const Array events = {goodEvent(1)};
  EXPECT_THAT(headerProblems(goodRequest(goodMessage(events)), events), IsEmpty());
  for (const char* name :
       {"User-Agent", "X-TRN-Client-Version", "X-TRN-Sender", "Accept", "Content-Type", "Content-Length"}) {
    EXPECT_THAT(headerProblemsWith(name, ""), ElementsAre("header " + std::string(name) + ": missing"));
  }
  for (const char* name : {"X-TRN-Client-Name", "X-TRN-Service-Name"}) {
    EXPECT_THAT(headerProblemsWith(name, ""), IsEmpty()) << "both are sent when known";
  }
  for (const char* agent : {"curl/7", "Tarnel/8 (a; b)", "Tarnel/8.0 (a b)", "Tarnel/8.0 (a; b"}) {
    EXPECT_THAT(headerProblemsWith("User-Agent", agent),
                ElementsAre(HasSubstr("header User-Agent: must read")));
  }
  EXPECT_THAT(headerProblemsWith("Accept", "*/*"),
              ElementsAre(HasSubstr("must be application/json, but is")));
  EXPECT_THAT(headerProblemsWith("X-TRN-Client-Version", "x"),
              ElementsAre(HasSubstr("must be a whole number")));
  EXPECT_THAT(headerProblemsWith("X-TRN-Client-Version", "4"),
              ElementsAre("header X-TRN-Client-Version: differs from event 1's _clientVersion"));
  EXPECT_THAT(headerProblemsWith("X-TRN-Sender", "FE"),
              ElementsAre("header X-TRN-Sender: differs from event 1's _sender"));
  EXPECT_THAT(headerProblemsWith("X-TRN-Internal-Build", "1"), IsEmpty());
  EXPECT_THAT(headerProblemsWith("X-TRN-Internal-Build", "0"), SizeIs(1));
  EXPECT_THAT(headerProblemsWith("Content-Length", "3"),
              ElementsAre(HasSubstr("header Content-Length: says 3, but")));
}

TEST(EventCheck, TheEventMapNamesTheOneEvent) {
  EXPECT_THAT(headerProblemsWith("X-TRN-Event-Map", "2 10"), IsEmpty());
  EXPECT_THAT(headerProblemsWith("X-TRN-Event-Map", "2 11"),
              ElementsAre(HasSubstr("is for a post of one event")));
  EXPECT_THAT(headerProblemsWith("X-TRN-Event-Map", "2"),
              ElementsAre(HasSubstr("must be two whole numbers")));
  const Array two = {goodEvent(1), goodEvent(2)};
  HttpRequest request = goodRequest(goodMessage(two));
  setHeader(request, "X-TRN-Event-Map", "2 10");
  EXPECT_THAT(headerProblems(request, two), ElementsAre(HasSubstr("is for a post of one event")));
}

TEST(EventCheck, GzipMustHaveMadeItShorter) {
  const Array events = {goodEvent(1)};
  const HttpRequest request = goodRequest(goodMessage(events), true);
  EXPECT_THAT(headerProblems(request, events, request.body.size() + 1), IsEmpty());
  EXPECT_THAT(headerProblems(request, events, request.body.size()),
              ElementsAre(HasSubstr("gzip made it no shorter")));
}

TEST(EventCheck, ProblemsAreBounded) {
  Problems problems;
  for (int i = 0; i < 100; ++i) problems.add("p");
  const std::vector<std::string> list = problems.take();
  EXPECT_THAT(list, SizeIs(Problems::kLimit));
  EXPECT_EQ(list.back(), "and 81 more");
}

}  // namespace
}  // namespace tarnel::lab
