#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <mutex>

#include "testing/private_instance.h"
#include "testing/raw_http_server.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_certificates.h"
#include "testing/test_session.h"

// Reporting servers that answer anything but well. Only 500 to 599 switch a session's backend off; nothing
// harms the daemon or another session.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

// What a post is answered with; the connection ends when it returns false.
using Answer = std::function<bool(RawConnection&)>;

enum class Outcome { accepted, failed, disabled };

struct Case {
  std::string what;
  Answer answer;
  Outcome outcome = Outcome::accepted;
  std::string error;  // part of what the client is told
};

Answer saying(std::string bytes, bool goesOn = false) {
  return [bytes = std::move(bytes), goesOn](RawConnection& connection) {
    return connection.write(bytes) && goesOn;
  };
}

Answer resetting(std::string bytes) {
  return [bytes = std::move(bytes)](RawConnection& connection) {
    connection.write(bytes);
    connection.reset();
    return false;
  };
}

// Answers the posts to /0, /1, ... with the cases of these numbers.
class CasesServer {
 public:
  explicit CasesServer(std::vector<Case> cases, std::optional<TlsIdentity> identity = std::nullopt)
      : cases_(std::move(cases)),
        server_([this](RawConnection& connection) { serve(connection); }, std::move(identity)) {}

  const std::vector<Case>& cases() const { return cases_; }
  std::string url(size_t number) const { return server_.url("/" + std::to_string(number)); }
  int posts(size_t number) const {
    const std::lock_guard lock(mutex_);
    const auto found = posts_.find(number);
    return found == posts_.end() ? 0 : found->second;
  }

 private:
  void serve(RawConnection& connection) {
    while (const auto request = connection.readRequest()) {
      const size_t number = std::stoul(request->substr(request->find('/') + 1));
      {
        const std::lock_guard lock(mutex_);
        ++posts_[number];
      }
      if (!cases_.at(number).answer(connection)) return;
    }
  }

  const std::vector<Case> cases_;
  mutable std::mutex mutex_;
  std::map<size_t, int> posts_;  // guarded by mutex_
  RawHttpServer server_;
};

class ReportingServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    storebags.connect(instance);
    instance.setConsent(true);
    instance.setConfiguration("[locale]\ncountry = \"DE\"\n[http]\nno_progress_seconds = 1\n");
  }

  // One client entry for each case: "Case0", "Case1", ...; a client "Good" beside them.
  void start(const CasesServer& server) {
    const std::string goodURL = good.url("/good");
    Array entries{with(clientEntry(goodURL, goodURL), "client", "Good")};
    for (size_t i = 0; i < server.cases().size(); ++i) {
      entries.append(with(clientEntry(server.url(i), server.url(i)), "client", "Case" + std::to_string(i)));
    }
    storebags.serve("brevan", storebag("1", {{"httppost", profile(entries)}}));
    ASSERT_TRUE(instance.start());
    bystander = std::make_unique<TestSession>(instance, SessionSetup{.batch = true, .client = "Good"});
  }

  static client::Reply post(TestSession& session) {
    EXPECT_TRUE(session.send(3, 4).ok());
    auto reply = session.session.flushAndWait(kDeadline);
    EXPECT_TRUE(reply.ok()) << reply.status.message;
    return reply;
  }

  void run(const CasesServer& server) {
    start(server);
    for (size_t i = 0; i < server.cases().size() && !HasFailure(); ++i) {
      const Case& one = server.cases()[i];
      SCOPED_TRACE(one.what);
      TestSession session(instance, {.batch = true, .client = "Case" + std::to_string(i)});
      const auto first = post(session);
      EXPECT_EQ(first.error.has_value(), one.outcome != Outcome::accepted);
      EXPECT_THAT(first.error ? first.error->description : "", HasSubstr(one.error));
      // A post that failed harms none that follow; those are slow to fail again.
      const auto second = one.outcome == Outcome::failed ? first : post(session);
      if (one.outcome == Outcome::disabled) {
        EXPECT_EQ(first.error ? first.error->code : 0, std::stoi(one.what));
        EXPECT_EQ(second.error ? second.error->description : "", "Nothing to flush");
        EXPECT_EQ(server.posts(i), 1);
        // Until its state is decided anew.
        const auto again = session.session.fetchStatesAndWait(userInfo("Good", "video-call"), kDeadline);
        EXPECT_THAT(again.names.value_or(std::vector<std::string>()), ElementsAre("httppost"));
      } else if (one.outcome == Outcome::accepted) {
        EXPECT_FALSE(second.error) << second.error->description;
      }
      EXPECT_FALSE(post(*bystander).error);
    }
    instance.expectAlive();
  }

  StorebagServer storebags;
  RawHttpServer good{RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK", "{}"); })};
  PrivateInstance instance;
  std::unique_ptr<TestSession> bystander;
};

TEST_F(ReportingServerTest, OnlyServerErrorsSwitchABackendOff) {
  std::vector<Case> cases;
  for (const int status : {200, 201, 204, 300, 301, 304, 400, 401, 404, 413, 429, 499, 600, 999}) {
    cases.push_back({std::to_string(status), saying(httpAnswer(std::to_string(status) + " X"), true)});
  }
  for (const int status : {500, 502, 503, 599}) {
    const std::string text = std::to_string(status);
    cases.push_back({text, saying(httpAnswer(text + " X", "sorry"), true), Outcome::disabled,
                     "backend httppost disabled by server " + text + " return code"});
  }
  const CasesServer server(std::move(cases));
  run(server);
  instance.waitForLog("postJSONMessage: backend httppost disabled by server 503 return code");
}

TEST_F(ReportingServerTest, BrokenAnswersAreToldAndForgotten) {
  const std::string head = "HTTP/1.1 200 OK\r\nContent-Length: 1000\r\n";
  const Outcome failed = Outcome::failed;
  const CasesServer server({
      {"closed at once", saying(""), failed},
      {"reset at once", resetting(""), failed},
      {"reset after one byte", resetting("H"), failed},
      {"reset in the headers", resetting(head), failed},
      {"closed in the body", saying(head + "\r\nxxx")},
      {"no HTTP", saying("SSH-2.0-x\r\n"), failed},
      {"garbage in the body", saying(httpAnswer("200 OK", std::string(1000, '\xff')), true)},
      {"silence",
       [](RawConnection& connection) {
         connection.waitForClose();
         return false;
       },
       failed},
      {"a body without end",
       [](RawConnection& connection) {
         if (!connection.write("HTTP/1.1 200 OK\r\n\r\n")) return false;
         while (connection.write(std::string(65536, 'x'))) {
         }
         return false;
       }},
  });
  run(server);
  instance.waitForLog("HTTPSPostBackend(postJsonMessage): post error: ");
}

// The status decides as soon as it is there, whatever becomes of the body.
TEST_F(ReportingServerTest, AServerErrorWhoseBodyNeverComesSwitchesABackendOffAtOnce) {
  instance.setConfiguration("[locale]\ncountry = \"DE\"\n[http]\nno_progress_seconds = 600\n");
  const std::string head = "HTTP/1.1 503 X\r\nContent-Length: 1000\r\n\r\nxxx";
  const auto disabled = [](Answer answer) {
    return Case{"503", std::move(answer), Outcome::disabled,
                "backend httppost disabled by server 503 return code"};
  };
  const CasesServer server({
      disabled(saying(head)),
      disabled([head](RawConnection& connection) {
        connection.write(head);
        connection.waitForClose();
        return false;
      }),
      disabled([](RawConnection& connection) {
        if (!connection.write("HTTP/1.1 503 X\r\n\r\n")) return false;
        while (connection.write(std::string(65536, 'x'))) {
        }
        return false;
      }),
  });
  run(server);
}

TEST_F(ReportingServerTest, ACollectorThatEndsAKeptConnectionGetsEachPostOnce) {
  const auto answered = std::make_shared<std::atomic<int>>(0);
  const CasesServer server({{"the third ends the connection", [answered](RawConnection& connection) {
                               if (++*answered == 3) return false;
                               return connection.write(httpAnswer("200 OK"));
                             }}});
  start(server);
  TestSession session(instance, {.batch = true, .client = "Case0"});
  EXPECT_FALSE(post(session).error);
  EXPECT_FALSE(post(session).error);
  const auto third = post(session);
  ASSERT_TRUE(third.error);
  EXPECT_THAT(third.error->description, HasSubstr("may have arrived and is not sent again"));
  EXPECT_EQ(server.posts(0), 3);
  EXPECT_FALSE(post(session).error) << "the next has another connection";
  EXPECT_EQ(server.posts(0), 4);
  instance.waitForLog("HTTPSPostBackend(postJsonMessage): post error: ");
}

TEST_F(ReportingServerTest, RedirectsAndCertificates) {
  const TestAuthority authority("reporting tests");
  const TestAuthority stranger("somebody else");
  instance.trust(authority.certificatePem());
  const CasesServer secureEnd({{"end", saying(httpAnswer("200 OK"), true)}}, authority.issue());
  const CasesServer plainEnd({{"end", saying(httpAnswer("200 OK"), true)}});
  const CasesServer strangerEnd({{"end", saying(httpAnswer("200 OK"), true)}}, stranger.issue());
  const auto to = [](const std::string& url) {
    return saying(httpAnswer("307 Temporary Redirect", "", "Location: " + url + "\r\n"), true);
  };
  const CasesServer server(
      {
          {"https to https", to(secureEnd.url(0))},
          {"https to http", to(plainEnd.url(0)), Outcome::failed, "which is not encrypted"},
          {"to a stranger", to(strangerEnd.url(0)), Outcome::failed},
          {"to a file", to("file:///etc/passwd"), Outcome::failed, "only http and https are supported"},
      },
      authority.issue());
  run(server);
  EXPECT_GE(secureEnd.posts(0), 2);  // and the end of the session, if it was in time
  EXPECT_EQ(plainEnd.posts(0), 0);
  EXPECT_EQ(strangerEnd.posts(0), 0);
}

TEST_F(ReportingServerTest, FromHttpARedirectMayLeadToHttps) {
  const TestAuthority authority("reporting tests");
  instance.trust(authority.certificatePem());
  const CasesServer secureEnd({{"end", saying(httpAnswer("200 OK"), true)}}, authority.issue());
  const CasesServer server(
      {{"http to https",
        saying(httpAnswer("308 Permanent Redirect", "", "Location: " + secureEnd.url(0) + "\r\n"), true)}});
  run(server);
  EXPECT_GE(secureEnd.posts(0), 2);
}

TEST_F(ReportingServerTest, ServersThatDoNotAnswerDelayNeitherClientsNorTheEnd) {
  const CasesServer server({{"silence", [](RawConnection& connection) {
                               connection.waitForClose();
                               return false;
                             }}});
  instance.setConfiguration("[locale]\ncountry = \"DE\"\n[http]\nno_progress_seconds = 600\n");
  start(server);
  {
    TestSession session(instance, {.client = "Case0"});
    for (int i = 0; i < 100; ++i) ASSERT_TRUE(session.send(3, 4, {}, client::Flag::realtime).ok());
    EXPECT_FALSE(post(*bystander).error);
  }
  bystander.reset();
  // The last posts get their time, then they are given up.
  instance.stop();
  EXPECT_THAT(instance.log(), HasSubstr("requests had not ended after 5 seconds and are given up"));
}

}  // namespace
}  // namespace tarnel::test
