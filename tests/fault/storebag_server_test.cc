#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "formats/document.h"
#include "testing/private_instance.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_certificates.h"
#include "testing/test_session.h"

// Storebag servers that answer anything but well. A client is told that there is no storebag, or served with
// the rest of a document that verifies; the daemon goes on.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

struct Source {
  int clientType;
  const char* name;
};
// A failure holds for 900 seconds, so each case takes a name of its own.
constexpr std::array<Source, 8> kSources{{{5, "plexor"},
                                          {6, "vandor"},
                                          {8, "brevan"},
                                          {9, "moldaro"},
                                          {10, "quintar"},
                                          {12, "pelmora"},
                                          {16, "ostrik"},
                                          {17, "frandel"}}};
constexpr Source kGoodSource{11, "calvisto"};

constexpr char kTransport[] = "fetchStorebagWithName: Error resolving with lookup server ";
constexpr char kNoSignature[] = "fetchStorebagWithName: Signature is missing";
constexpr char kUnverified[] = "fetchStorebagWithName: Signature can not be verified, 0x";
constexpr char kNoDocument[] = "fetchStorebagWithName: documentWithData error ";
constexpr char kNotFetched[] =
    "fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type ";

enum class Outcome { none, error, works };

struct Case {
  std::string what;
  StorebagServer::Behaviour behaviour;
  std::string logged;
  Outcome outcome = Outcome::none;
};

StorebagServer::Behaviour saying(std::string bytes) {
  return [bytes = std::move(bytes)](RawConnection& connection, const std::string&) {
    connection.write(bytes);
    return false;
  };
}

StorebagServer::Behaviour resetting(std::string bytes) {
  return [bytes = std::move(bytes)](RawConnection& connection, const std::string&) {
    connection.write(bytes);
    connection.reset();
    return false;
  };
}

StorebagServer::Behaviour answering(const std::string& body, const std::string& headerLines = "",
                                    const std::string& status = "200 OK") {
  return saying(httpAnswer(status, body, headerLines));
}

// Goes on as long as somebody listens.
StorebagServer::Behaviour endless(std::string start, std::string more) {
  return [start = std::move(start), more = std::move(more)](RawConnection& connection, const std::string&) {
    if (!connection.write(start)) return false;
    while (connection.write(more)) {
    }
    return false;
  };
}

std::string nested(int depth) {
  return std::string(static_cast<size_t>(depth), '[') + std::string(static_cast<size_t>(depth), ']');
}

class StorebagServerTest : public ::testing::Test {
 protected:
  Dictionary goodStorebag() const {
    const Dictionary entry = clientEntry("http://127.0.0.1:1/", "http://127.0.0.1:1/");
    return storebag("1", {{"httppost", profile({entry})}});
  }

  // As many at once as there are names, then a new daemon.
  void run(const std::vector<Case>& cases, StorebagServer& server, const std::string& trust = "") {
    for (size_t first = 0; first < cases.size(); first += kSources.size()) {
      PrivateInstance instance;
      server.connect(instance);
      if (!trust.empty()) instance.trust(trust);
      instance.setConsent(true);
      server.serve(kGoodSource.name, goodStorebag());
      ASSERT_TRUE(instance.start());
      for (size_t i = first; i < std::min(first + kSources.size(), cases.size()); ++i) {
        SCOPED_TRACE(cases[i].what);
        runOne(cases[i], kSources[i - first], server, instance);
        if (HasFailure()) return;
      }
      EXPECT_THAT(TestSession(instance, {.clientType = kGoodSource.clientType}).backends(),
                  ElementsAre("httppost"));
      instance.expectAlive();
    }
  }

 private:
  static void runOne(const Case& one, const Source& source, StorebagServer& server,
                     const PrivateInstance& instance) {
    server.behave(source.name, one.behaviour);
    const int requests = server.requests(source.name);
    const size_t before = instance.logSize();
    TestSession session(instance, {.clientType = source.clientType});
    EXPECT_EQ(session.started.ok(), one.outcome != Outcome::error) << session.started.status.message;
    EXPECT_EQ(session.started.names.has_value(), one.outcome == Outcome::works);
    EXPECT_TRUE(session.send(1, 2).ok());
    if (!one.logged.empty()) instance.waitForLog(one.logged, before);
    EXPECT_EQ(server.requests(source.name), requests + 1);
  }
};

TEST_F(StorebagServerTest, AnyStatusGoesThroughTheSignature) {
  StorebagServer server;
  std::vector<Case> cases;
  for (const char* status : {"201 Created", "300 Multiple Choices", "301 Moved Permanently",
                             "400 Bad Request", "401 Unauthorized", "404 Not Found", "418 Teapot",
                             "500 Internal Server Error", "503 Service Unavailable", "599 Whatever"}) {
    cases.push_back({status, answering("<html>" + std::string(status), "", status), kNoSignature});
  }
  cases.push_back({"204", saying("HTTP/1.1 204 No Content\r\n\r\n"), kNoSignature});
  cases.push_back({"304 that nobody asked for", saying("HTTP/1.1 304 Not Modified\r\n\r\n"), kNoSignature});
  // The status is never looked at: what verifies is taken.
  cases.push_back(
      {"500 with a good document",
       answering(StorebagServer::sign(writeTextDocument(goodStorebag())), "", "500 Internal Server Error"),
       "", Outcome::works});
  run(cases, server);
}

TEST_F(StorebagServerTest, ConnectionsThatBreak) {
  StorebagServer server;
  const std::string head = "HTTP/1.1 200 OK\r\nContent-Length: 1000\r\n";
  const std::string chunked = "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n";
  std::vector<Case> cases{
      {"closed at once", saying(""), kTransport},
      {"reset at once", resetting(""), kTransport},
      {"reset after one byte", resetting("H"), kTransport},
      {"closed in the status line", saying("HTTP/1.1 2"), kTransport},
      {"reset in the headers", resetting(head), kTransport},
      {"closed in the headers", saying(head), kTransport},
      {"reset in the body", resetting(head + "\r\n{\"signature\":"), kTransport},
      {"closed in the body", saying(head + "\r\n{\"signature\":"), kTransport},
      {"no HTTP", saying("220 mail.example ESMTP\r\n"), kTransport},
      {"bytes of anything", saying(std::string("\x16\x03\x01\x00\xff\x00\x01\n\r\n\r\n", 11)), kTransport},
      {"a chunk of no size", saying(chunked + "zz\r\n"), kTransport},
      {"a chunk of a negative size", saying(chunked + "-1\r\n"), kTransport},
      {"a chunk beyond all size", saying(chunked + "ffffffffffffffffff\r\n"), kTransport},
      {"a length that lies", saying("HTTP/1.1 200 OK\r\nContent-Length: 99999999999999\r\n\r\n{}"),
       kTransport},
      {"a negative length", saying("HTTP/1.1 200 OK\r\nContent-Length: -5\r\n\r\n{}"), ""},
      {"a body without end", endless("HTTP/1.1 200 OK\r\n\r\n", std::string(65536, '{')), kTransport},
      {"headers without end", endless("HTTP/1.1 200 OK\r\n", "X-More: " + std::string(1000, 'x') + "\r\n"),
       kTransport},
      {"a header line without end", endless("HTTP/1.1 200 OK\r\nX-More: ", std::string(65536, 'x')),
       kTransport},
      {"interim answers without end", endless("", "HTTP/1.1 100 Continue\r\n\r\n"), kTransport},
  };
  run(cases, server);
}

TEST_F(StorebagServerTest, BodiesThatAreNoStorebag) {
  StorebagServer server;
  const std::string good = StorebagServer::sign(writeTextDocument(goodStorebag()));
  const std::string date = "Last-Modified: Fri, 20 Nov 2026 11:29:54 GMT\r\n";
  std::string altered = good;
  altered.replace(altered.find("\"bag\"") + 12, 4, "AAAA");
  const std::string foreign =
      StorebagServer::sign(writeTextDocument(goodStorebag()), StorebagServer::foreignKey());
  std::vector<Case> cases{
      {"nothing", answering(""), kNoSignature},
      {"nothing, with a date", answering("", date), kNoSignature},
      {"garbage", answering("garbage"), kNoDocument},
      {"binary garbage", answering("\xbf\xff\x9f\x61"), kNoDocument},
      {"cut off", answering(good.substr(0, good.size() / 2)), kNoDocument},
      {"too deep", answering(nested(5000)), kNoDocument},
      {"an array", answering("[]"), kNoSignature},
      {"a number", answering("42"), kNoSignature},
      {"null", answering("null"), kNoSignature},
      {"empty", answering("{}"), kNoSignature},
      {"a signature that is a number", answering(R"({"signature":1,"bag":"e30="})"), kNoSignature},
      {"a signature that is data", answering(R"({"signature":{"$data":"AAAA"},"bag":"e30="})"), kNoSignature},
      {"no bag", answering(R"({"signature":"AAAA"})"), kNotFetched},
      {"a bag that is an array", answering(R"({"signature":"AAAA","bag":[]})"), kNotFetched},
      {"a signature of nothing", answering(R"({"signature":"!!!!","bag":"e30="})"), kNotFetched},
      {"a short signature", answering(R"({"signature":"AAAA","bag":"e30="})"), kUnverified},
      {"another key's", answering(foreign), kUnverified},
      {"altered", answering(altered), kUnverified},
      {"dates of another line", answering(good, "Last-Modified: a\x01b\r\n"), "", Outcome::works},
      {"a strange cache time", answering(good, "Cache-Control: max-age=99999999999999999999, max-age=\r\n"),
       "", Outcome::works},
  };
  run(cases, server);
}

TEST_F(StorebagServerTest, VerifiedDocumentsOfTheWrongShape) {
  StorebagServer server;
  const auto inner = [](const std::string& text) { return answering(StorebagServer::sign(text)); };
  const auto document = [&](const Dictionary& dictionary) { return inner(writeTextDocument(dictionary)); };
  const Dictionary good = goodStorebag();
  const std::string ignoring = "fetchStorebagForEnvironmentAndClientType: ignoring ";
  std::vector<Case> cases{
      {"garbage", inner("garbage"), kNotFetched},
      {"nothing", inner(""), kNotFetched},
      {"an array", inner("[]"), kNotFetched},
      {"too deep", inner(nested(33)), kNotFetched},
      {"no section", document(without(good, "release")),
       "Could not find storebag for client type 10 with seed environment"},
      {"a section that is a text", document(with(good, "release", "x")), ignoring + "'release'"},
      {"one that is a text beside a good one", document(with(good, "seed", "x")), ignoring + "'seed'",
       Outcome::works},
      {"no version", document(without(good, "version")), "the storebag has no version", Outcome::error},
      {"a version that is a number", document(with(good, "version", 3)), ignoring + "'version'",
       Outcome::error},
      {"a cycle that is a text", document(with(good, "refresh_cycle", "1")), ignoring + "'refresh_cycle'",
       Outcome::works},
      {"a cycle beyond all time", document(with(good, "refresh_cycle", UINT64_MAX)), "MaxAge=86400",
       Outcome::works},
      // A configuration, but none whose backends could be made.
      {"a backend that is a text", document(with(good, "release", Dictionary{{"httppost", "x"}})),
       "createBackendsWithStorebag: Creating backends"},
      {"clients that are a text",
       document(with(good, "release", Dictionary{{"httppost", Dictionary{{"clients", "x"}}}})),
       "HTTPSPostBackend(initWithName): can't find the client list."},
      {"a thousand backends nobody knows",
       document(with(good, "release",
                     [] {
                       Dictionary many;
                       for (int i = 0; i < 1000; ++i) many.set("backend" + std::to_string(i), i);
                       return many;
                     }())),
       "createBackends: 1000 keys of the storebag are no backends, of which only the first 256 are named"},
  };
  run(cases, server);
}

TEST_F(StorebagServerTest, RedirectsAreFollowedToHttpAndHttpsAndNeverBackToHttp) {
  const TestAuthority authority("storebag tests");
  StorebagServer secure(authority.issue());
  StorebagServer plain;
  const std::string good = StorebagServer::sign(writeTextDocument(goodStorebag()));
  secure.answer("good", good);
  plain.answer("good", good);
  const auto redirect = [](const std::string& to, const std::string& status = "302 Found") {
    return answering("", "Location: " + to + "\r\n", status);
  };
  run({{"https to https", redirect(secure.url() + "/good"), "", Outcome::works},
       {"https to http", redirect(plain.url() + "/good"), "which is not encrypted"},
       {"to a file", redirect("file:///etc/passwd"), "only http and https are supported"},
       {"to another protocol", redirect("gopher://127.0.0.1/x"), "only http and https are supported"},
       {"to nowhere", redirect(""), ""},
       {"to nonsense", redirect("https://[::1"), ""}},
      secure, authority.certificatePem());
  EXPECT_EQ(plain.requests("good"), 0);
  run({{"http to https", redirect(secure.url() + "/good"), "", Outcome::works},
       {"http to http", redirect(plain.url() + "/good", "307 Temporary Redirect"), "", Outcome::works}},
      plain, authority.certificatePem());
  plain.behave("loop", redirect(plain.url() + "/loop"));
  run({{"for ever", redirect(plain.url() + "/loop"), "more than 10 redirects"}}, plain);
  EXPECT_EQ(plain.requests("loop"), 10);
}

TEST_F(StorebagServerTest, CertificatesThatDoNotVerifyAreNotTalkedTo) {
  const TestAuthority authority("storebag tests");
  const TestAuthority stranger("somebody else");
  const std::chrono::hours hour(1);
  const std::string good = StorebagServer::sign(writeTextDocument(goodStorebag()));
  StorebagServer trusted(authority.issue());
  std::vector<std::unique_ptr<StorebagServer>> servers;
  std::vector<Case> cases;
  const auto redirectTo = [](const std::string& url) {
    return answering("", "Location: " + url + "\r\n", "302 Found");
  };
  const auto add = [&](const std::string& what, TlsIdentity identity) {
    servers.push_back(std::make_unique<StorebagServer>(std::move(identity)));
    servers.back()->answer("good", good);
    cases.push_back({what, redirectTo(servers.back()->url() + "/good"), kTransport});
  };
  add("of an unknown authority", stranger.issue());
  add("of another name", authority.issue("DNS:elsewhere.example"));
  add("expired", authority.issue("IP:127.0.0.1", {.from = -2 * hour, .until = -hour}));
  add("not yet valid", authority.issue("IP:127.0.0.1", {.from = hour, .until = 2 * hour}));
  const RawHttpServer plain([](RawConnection& connection) { connection.write(httpAnswer("200 OK", "{}")); });
  cases.push_back({"no TLS at all", redirectTo("https" + plain.url("/good").substr(4)), kTransport});
  run(cases, trusted, authority.certificatePem());
  for (const auto& server : servers) EXPECT_EQ(server->requests("good"), 0);
}

TEST_F(StorebagServerTest, AServerThatNeverAnswersIsGivenUp) {
  StorebagServer server;
  server.serve(kGoodSource.name, goodStorebag());
  server.behave("brevan", [](RawConnection& connection, const std::string&) {
    connection.waitForClose();
    return false;
  });
  PrivateInstance instance;
  server.connect(instance);
  instance.setConsent(true);
  ASSERT_TRUE(instance.start());
  TestSession hung(instance, {.clientType = 8});
  ASSERT_TRUE(hung.started.ok()) << hung.started.status.message;
  EXPECT_FALSE(hung.started.names);
  instance.waitForLog(kTransport);
  EXPECT_THAT(TestSession(instance, {.clientType = kGoodSource.clientType}).backends(),
              ElementsAre("httppost"));
}

}  // namespace
}  // namespace tarnel::test
