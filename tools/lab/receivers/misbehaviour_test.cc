#include "tools/lab/receivers/misbehaviour.h"

#include <gmock/gmock.h>

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;

std::string problem(const NameValues& query) {
  const Result<Misbehaviour> misbehaviour = misbehaviourFromQuery(query);
  return misbehaviour ? "" : misbehaviour.error().localizedDescription();
}

HttpAnswer changed(const NameValues& query) {
  HttpAnswer answer;
  answer.body = "good";
  answer.headers = {{"Last-Modified", "then"}};
  misbehaviourFromQuery(query)->applyTo(answer);
  return answer;
}

TEST(MisbehaviourQuery, EachParameterDoesItsWork) {
  EXPECT_EQ(changed({{"status", "503"}}).status, 503);
  EXPECT_EQ(changed({{"status", "503"}}).body, "good");
  EXPECT_EQ(changed({{"delay", "250"}}).delay, std::chrono::milliseconds(250));
  EXPECT_EQ(changed({{"hang", "1"}}).delay, std::chrono::minutes(10));
  EXPECT_EQ(changed({{"empty", "1"}}).body, "");
  EXPECT_EQ(changed({{"body", "{}"}}).body, "{}");
  EXPECT_TRUE(changed({{"endless", "1"}}).endless);
  EXPECT_EQ(changed({{"reset", "1"}}).resetAfter, 0U);
  EXPECT_EQ(changed({{"reset-after", "12"}}).resetAfter, 12U);
  EXPECT_TRUE(misbehaviourFromQuery({{"break-signature", "1"}})->breakSignature);
  const NameValues replaced = {{"last-modified", "now"}, {"X-More", "a b"}};
  EXPECT_EQ(changed({{"header", "last-modified: now"}, {"header", "X-More:a b"}}).headers, replaced);
}

TEST(MisbehaviourQuery, WhatItDoesNotTakeIsNamed) {
  EXPECT_THAT(problem({}), HasSubstr("say what to do"));
  EXPECT_THAT(problem({{"count", "3"}}), HasSubstr("say what to do"));
  EXPECT_EQ(problem({{"status", "199"}}), "status=199: status takes a number from 200 to 999");
  EXPECT_EQ(problem({{"delay", "600001"}}), "delay=600001: delay takes a number from 0 to 600000");
  EXPECT_EQ(problem({{"empty", "yes"}}), "empty=yes: empty takes 1 or 0");
  EXPECT_EQ(problem({{"for", "me"}, {"empty", "1"}}),
            "for=me: for takes storebags, events, uploads, log-data, datagrams or all");
  EXPECT_THAT(problem({{"reset-after", "-1"}}), HasSubstr("reset-after takes a number"));
  EXPECT_THAT(problem({{"header", "no colon"}}), HasSubstr("header takes NAME:VALUE"));
  EXPECT_THAT(problem({{"header", "A: b\r\nC: d"}}), HasSubstr("header takes NAME:VALUE"));
  EXPECT_THAT(problem({{"statsu", "503"}}),
              HasSubstr("unknown parameter statsu; there are: for, count, status"));
  EXPECT_THAT(problem({{"break-signature", "1"}, {"for", "events"}}), HasSubstr("only storebags are signed"));
  EXPECT_THAT(problem({{"refuse", "1"}, {"for", "log-data"}}),
              HasSubstr("only uploads are taken or refused: add for=uploads"));
  EXPECT_THAT(problem({{"body", std::string(65537, 'x')}, {"for", "all"}}), HasSubstr("at most 65536"));
}

TEST(MisbehaviourList, CountsDownForTheKindThatIsMeant) {
  Misbehaviours list;
  ASSERT_FALSE(list.add(*misbehaviourFromQuery({{"status", "500"}, {"for", "storebags"}})));
  ASSERT_FALSE(list.add(*misbehaviourFromQuery({{"status", "599"}, {"for", "events"}, {"count", "2"}})));
  EXPECT_EQ(list.take(RequestKind::post)->status, 599);
  EXPECT_EQ(list.take(RequestKind::storebag)->status, 500);
  EXPECT_FALSE(list.take(RequestKind::storebag));
  EXPECT_EQ(list.take(RequestKind::post)->status, 599);
  EXPECT_FALSE(list.take(RequestKind::post));
}

TEST(MisbehaviourList, EveryKindCanBeMeantByItself) {
  for (const auto& [name, meant] :
       std::vector<std::pair<std::string, RequestKind>>{{"storebags", RequestKind::storebag},
                                                        {"events", RequestKind::post},
                                                        {"uploads", RequestKind::upload},
                                                        {"log-data", RequestKind::logData}}) {
    Misbehaviours list;
    ASSERT_FALSE(list.add(*misbehaviourFromQuery({{"empty", "1"}, {"for", name}, {"count", "0"}})));
    EXPECT_EQ(*findString(*list.description()[0].dictionary(), "for"), name);
    for (const RequestKind kind :
         {RequestKind::storebag, RequestKind::post, RequestKind::upload, RequestKind::logData}) {
      EXPECT_EQ(list.take(kind).has_value(), kind == meant) << name;
      EXPECT_TRUE(misbehaviourFromQuery({{"empty", "1"}, {"for", "all"}})->isFor(kind));
    }
  }
}

TEST(MisbehaviourList, TheFirstThatFitsActsAndZeroCountsStayUntilCleared) {
  Misbehaviours list;
  ASSERT_FALSE(list.add(*misbehaviourFromQuery({{"status", "500"}})));
  ASSERT_FALSE(list.add(*misbehaviourFromQuery({{"empty", "1"}, {"count", "0"}})));
  EXPECT_EQ(list.description(),
            (Array{Dictionary{{"for", "all"}, {"what", "status 500"}, {"left", 1}},
                   Dictionary{{"for", "all"}, {"what", "empty body"}, {"left", "until cleared"}}}));
  EXPECT_EQ(list.take(RequestKind::post)->status, 500);
  for (int i = 0; i < 5; ++i) EXPECT_TRUE(list.take(RequestKind::storebag)->empty);
  list.clear();
  EXPECT_FALSE(list.take(RequestKind::storebag));
  EXPECT_TRUE(list.description().empty());
}

TEST(MisbehaviourList, IsBounded) {
  Misbehaviours list;
  const Misbehaviour one = *misbehaviourFromQuery({{"empty", "1"}});
  for (size_t i = 0; i < Misbehaviours::kLimit; ++i) ASSERT_FALSE(list.add(one));
  const MaybeError error = list.add(one);
  ASSERT_TRUE(error);
  EXPECT_THAT(error->localizedDescription(), HasSubstr("clear=1"));
}

}  // namespace
}  // namespace tarnel::lab
