#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/eventfd.h>

#include <cstring>
#include <string>
#include <string_view>

#include "client/src/mailbox.h"
#include "client/src/options.h"
#include "client/src/request.h"
#include "tarnel/keys.h"
#include "tarnel/tarnel_c.h"

// The pieces of the library on their own.

namespace tarnel::core {
namespace {

using ::testing::HasSubstr;

// The C names stand for the same texts.
static_assert(std::string_view(TARNEL_SESSION_INFO_SESSION_ID) == kTarnelSessionInfoSessionID);
static_assert(std::string_view(TARNEL_SESSION_INFO_CLIENT_TYPE) == kTarnelSessionInfoClientType);
static_assert(std::string_view(TARNEL_SESSION_INFO_CLIENT_VERSION) == kTarnelSessionInfoClientVersion);
static_assert(std::string_view(TARNEL_SESSION_INFO_REQUIRE_USER_INFO) == kTarnelSessionInfoRequireUserInfo);
static_assert(std::string_view(TARNEL_SESSION_INFO_BATCH_EVENT) == kTarnelSessionInfoBatchEvent);
static_assert(std::string_view(TARNEL_USER_INFO_CLIENT_NAME) == kTarnelUserInfoClientName);
static_assert(std::string_view(TARNEL_USER_INFO_SERVICE_NAME) == kTarnelUserInfoServiceName);
static_assert(std::string_view(TARNEL_MESSAGE_PARAMETERS_CATEGORY) == kTarnelMessageParametersCategory);
static_assert(std::string_view(TARNEL_MESSAGE_PARAMETERS_TYPE) == kTarnelMessageParametersType);
static_assert(std::string_view(TARNEL_MESSAGE_PARAMETERS_PAYLOAD) == kTarnelMessageParametersPayload);
static_assert(std::string_view(TARNEL_MESSAGE_PARAMETERS_FLAG) == kTarnelMessageParametersFlag);
static_assert(std::string_view(TARNEL_BACKEND_HTTP_POST) == kTarnelBackendHTTPPost);
static_assert(std::string_view(TARNEL_BACKEND_HTTP_POST2) == kTarnelBackendHTTPPost2);
static_assert(std::string_view(TARNEL_BACKEND_DASHBOARD) == kTarnelBackendDashboard);
static_assert(std::string_view(TARNEL_BACKEND_UPLOAD_SERVER) == kTarnelBackendUploadServer);
static_assert(std::string_view(TARNEL_BACKEND_DRAVIK) == kTarnelBackendDravik);
static_assert(std::string_view(TARNEL_BACKEND_VESMER) == kTarnelBackendVesmer);
static_assert(std::string_view(TARNEL_ERROR_DOMAIN) == kTarnelErrorDomain);

Request message(Dictionary payload) {
  Request request;
  request.dictionary = std::move(payload);
  return request;
}

std::string problemOf(Dictionary payload) {
  auto request = message(std::move(payload));
  return measure(request).message;
}

Dictionary nested(int levels) {
  Dictionary inner{{"leaf", 1}};
  for (int i = 1; i < levels; ++i) inner = Dictionary{{"d", Value(inner)}};
  return inner;
}

TEST(Measure, NamesTheKeyOfWhatCannotBeSent) {
  EXPECT_EQ(problemOf({{"ok", 1}, {"outer", Dictionary{{"inner", "\xFF"}}}}),
            "this cannot be sent: at key \"outer\", key \"inner\": the text is not UTF-8");
  EXPECT_EQ(problemOf({{"a", Array{1, std::string("x\0y", 3)}}}),
            "this cannot be sent: at key \"a\", element 1: the text holds a NUL byte");
  EXPECT_EQ(problemOf({{"\xC0\x80", 1}}), "this cannot be sent: at key \"?\": the text is not UTF-8");
  EXPECT_EQ(problemOf({{"n", "\uFFFE"}}),
            "this cannot be sent: at key \"n\": the text holds a code point that is no character");
  EXPECT_NE(problemOf({{"n", "\uFDD0"}}), "");
  EXPECT_NE(problemOf({{"n", "\U0010FFFF"}}), "");
  EXPECT_EQ(problemOf({{"n", "\uFFFD \uFDCF \uFDF0 \U0010FFFD 日本"}}), "");
}

TEST(Measure, NestsAsDeepAsTheDaemonTakes) {
  EXPECT_EQ(problemOf(nested(32)), "");
  EXPECT_THAT(problemOf(nested(33)), HasSubstr("nest deeper than 32 levels"));
}

TEST(Measure, CountsWhatTheWireTakes) {
  auto empty = message({});
  ASSERT_TRUE(measure(empty).ok());
  auto one = message({{"key", "value"}});
  ASSERT_TRUE(measure(one).ok());
  // Key: 4 length, 3 text, 1 NUL; variant: 3 signature, padding to 12, 4 length, 5 text, 1 NUL.
  EXPECT_EQ(one.bytes - empty.bytes, 22U);
}

class MailboxTest : public ::testing::Test {
 protected:
  Mailbox mailbox_{UniqueFd(eventfd(0, EFD_NONBLOCK)), Options()};

  void put(Request::Kind kind, size_t bytes = 100) {
    Request request;
    request.kind = kind;
    request.bytes = bytes;
    ASSERT_TRUE(mailbox_.put(std::move(request)).ok());
  }
};

TEST_F(MailboxTest, TakesMessagesTogetherAndEverythingElseAlone) {
  using Kind = Request::Kind;
  for (const Kind kind : {Kind::startConfig, Kind::sendMessage, Kind::sendMessage, Kind::flush, Kind::flush})
    put(kind);
  EXPECT_EQ(mailbox_.take(100).size(), 1U);
  EXPECT_EQ(mailbox_.take(100).size(), 2U);
  EXPECT_EQ(mailbox_.take(100).size(), 1U);
  EXPECT_EQ(mailbox_.take(100).size(), 1U);
  EXPECT_TRUE(mailbox_.take(100).empty());
}

TEST_F(MailboxTest, TakesNoMoreThanThereIsRoomFor) {
  for (int i = 0; i < 5; ++i) put(Request::Kind::sendMessage);
  EXPECT_EQ(mailbox_.take(2).size(), 2U);
  EXPECT_EQ(mailbox_.take(9).size(), 3U);
}

TEST_F(MailboxTest, ALargeMessageIsTakenAlone) {
  put(Request::Kind::sendMessage, 900'000);
  put(Request::Kind::sendMessage, 900'000);
  EXPECT_EQ(mailbox_.take(9).size(), 1U);
}

TEST_F(MailboxTest, WakesTheThreadOnlyWhenItCouldSend) {
  const auto isAwake = [this] {
    uint64_t count = 0;
    return ::read(mailbox_.wakeDescriptor(), &count, sizeof count) > 0;
  };
  EXPECT_TRUE(mailbox_.mayWait(false));
  put(Request::Kind::flush);
  EXPECT_FALSE(isAwake());
  EXPECT_FALSE(mailbox_.mayWait(true));
  EXPECT_EQ(mailbox_.take(1).size(), 1U);
  EXPECT_TRUE(mailbox_.mayWait(true));
  put(Request::Kind::flush);
  EXPECT_TRUE(isAwake());
}

TEST_F(MailboxTest, AfterClosingNothingIsTaken) {
  mailbox_.close({});
  EXPECT_EQ(mailbox_.put({}).status, TARNEL_ERROR_CLOSED);
  EXPECT_EQ(mailbox_.reconnect().status, TARNEL_ERROR_CLOSED);
  EXPECT_EQ(mailbox_.state(), State::closed);
}

TEST(OptionsTest, EachRangeIsHeld) {
  EXPECT_TRUE(check({}).ok());
  const auto wrong = [](auto change) {
    Options options;
    change(options);
    return check(options).message;
  };
  using std::chrono::milliseconds;
  EXPECT_THAT(wrong([](Options& o) { o.maxQueuedCalls = 1'000'001; }), HasSubstr("max_queued_calls"));
  EXPECT_THAT(wrong([](Options& o) { o.maxQueuedBytes = 1023; }), HasSubstr("max_queued_bytes"));
  EXPECT_THAT(wrong([](Options& o) { o.maxUnanswered = 65'537; }), HasSubstr("max_unanswered"));
  EXPECT_THAT(wrong([](Options& o) { o.connectTimeout = milliseconds(0); }), HasSubstr("connect_timeout_ms"));
  EXPECT_THAT(wrong([](Options& o) { o.replyTimeout = milliseconds(86'400'001); }),
              HasSubstr("reply_timeout_ms"));
  EXPECT_THAT(wrong([](Options& o) { o.linger = milliseconds(60'001); }), HasSubstr("linger_ms"));
  EXPECT_THAT(wrong([](Options& o) { o.socketPath = "relative"; }), HasSubstr("not absolute"));
  EXPECT_THAT(wrong([](Options& o) { o.socketPath = "/" + std::string(107, 'x'); }),
              HasSubstr("108 bytes long"));
}

TEST(OptionsTest, TheInstalledSocketIsTheDefault) {
  ::unsetenv("TARNEL_SOCKET");
  EXPECT_EQ(resolveSocketPath(""), "/run/tarneld/com.orvane.tarneld");
}

TEST(CInterface, AShorterStructKeepsItsDefaults) {
  tarnel_options options;
  std::memset(&options, 0xFF, sizeof options);
  options.size = offsetof(tarnel_options, max_unanswered);
  options.socket_path = "/nowhere";
  options.max_queued_calls = 10;
  options.max_queued_bytes = 4096;
  tarnel_session* session = nullptr;
  EXPECT_EQ(tarnel_session_create(&options, &session), TARNEL_OK) << tarnel_last_error();
  tarnel_session_destroy(session);
}

TEST(CInterface, ALongerStructIsFilledWithNothing) {
  struct Later {
    tarnel_options options;
    uint64_t more;
  } later;
  std::memset(static_cast<void*>(&later), 0xFF, sizeof later);
  tarnel_options_init(&later.options, sizeof later);
  EXPECT_EQ(later.options.size, sizeof later);
  EXPECT_EQ(later.options.max_unanswered, 256U);
  EXPECT_EQ(later.more, 0U);
}

TEST(CInterface, MissingArgumentsAreErrors) {
  EXPECT_EQ(tarnel_session_create(nullptr, nullptr), TARNEL_ERROR_INVALID_ARGUMENT);
  tarnel_options unset{};
  tarnel_session* session = nullptr;
  EXPECT_EQ(tarnel_session_create(&unset, &session), TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_STREQ(tarnel_last_error(), "the options' size is not set: begin with tarnel_options_init");
  EXPECT_EQ(tarnel_session_flush(nullptr, nullptr, nullptr), TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(tarnel_session_get_state(nullptr), TARNEL_STATE_CLOSED);
  tarnel_session_destroy(nullptr);
  tarnel_reply_destroy(nullptr);
  EXPECT_EQ(tarnel_dictionary_set_bool(nullptr, "k", true), TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(tarnel_dictionary_find(nullptr, "k"), nullptr);
  EXPECT_EQ(tarnel_value_string(nullptr, nullptr), nullptr);
}

TEST(CInterface, StatusesHaveNames) {
  EXPECT_STREQ(tarnel_status_name(TARNEL_OK), "TARNEL_OK");
  EXPECT_STREQ(tarnel_status_name(TARNEL_ERROR_FORKED), "TARNEL_ERROR_FORKED");
  EXPECT_STREQ(tarnel_status_name(99), "unknown");
}

}  // namespace
}  // namespace tarnel::core
