#include "util/storebag.h"

#include <gtest/gtest.h>

#include <map>
#include <vector>

#include "platform/fake/fake_world.h"
#include "testing/test_storebag.h"

namespace tarnel {
namespace {

using fake::FakeHttpClient;
using fake::StorebagSigner;

constexpr int32_t kUntouched = -77;

class StorebagTest : public testing::Test {
 protected:
  void SetUp() override {
    world_.clientBundle.resources["publicKey.der"] = StorebagSigner::shared().publicKeyDer();
  }

  static Dictionary section(const char* backend) {
    return Dictionary{{backend, Dictionary{{"active", true}}}};
  }
  static Dictionary storebag() {
    return {{"version", "7"},
            {"development", section("dev")},
            {"orvane_internal", section("int")},
            {"seed", section("seed")},
            {"release", section("rel")}};
  }
  static Dictionary storebagWith(const char* key, Value value) {
    Dictionary result = storebag();
    result.set(key, std::move(value));
    return result;
  }
  static Dictionary storebagWithout(const char* key) {
    Dictionary result = storebag();
    result.remove(key);
    return result;
  }
  void serve(const Dictionary& inner) {
    world_.http.setAnswer(FakeHttpClient::status(200, StorebagSigner::shared().signedStorebag(inner)));
  }
  void setEnvironment(int type) { world_.settings.setObject("com.orvane.tarnel", "environmentType", type); }
  std::optional<Dictionary> fetch(int32_t clientType = 7) {
    return fetchStorebagForEnvironmentAndClientType(world_.dependencies, clientType,
                                                    {maxAge_, version_, notModified_, nullptr});
  }
  bool logged(LogLevel level, const std::string& text) {
    return world_.log.contains(level, "fetchStorebagForEnvironmentAndClientType: " + text);
  }
  // Levels 3 and 4 of the routine under test.
  std::vector<std::string> complaints() {
    std::vector<std::string> found;
    for (const auto& line : world_.log.lines()) {
      if (line.level <= LogLevel::warning) found.push_back(line.text);
    }
    return found;
  }

  fake::FakeWorld world_;
  int32_t maxAge_ = kUntouched;
  MaybeString version_;
  bool notModified_ = false;
};

TEST_F(StorebagTest, NamesByClientType) {
  const std::map<int32_t, std::string> names = {
      {5, "plexor"},   {6, "vandor"},    {7, "calvisto"}, {8, "brevan"},    {9, "moldaro"},
      {10, "quintar"}, {11, "calvisto"}, {12, "pelmora"}, {13, "calvisto"}, {14, "vandor"},
      {15, "vandor"},  {16, "ostrik"},   {17, "frandel"}};
  for (int32_t type = -3; type <= 25; ++type) {
    const auto found = names.find(type);
    EXPECT_EQ(storebagNameForClientType(type),
              found == names.end() ? MaybeString() : MaybeString(found->second))
        << type;
  }
  EXPECT_EQ(storebagNameForClientType(INT32_MIN), std::nullopt);
  EXPECT_EQ(storebagNameForClientType(INT32_MAX), std::nullopt);
}

TEST_F(StorebagTest, ServerByBuildAndSetting) {
  EXPECT_EQ(storebagServerURL(world_.dependencies), "https://" TEST_PUBLIC_STOREBAG_HOST "/bags/alder");
  fake::FakeWorld internal;
  internal.deviceInformation.answers["ReleaseType"] = "Internal";
  EXPECT_EQ(storebagServerURL(internal.dependencies),
            "https://" TEST_INTERNAL_STOREBAG_HOST "/storebags/alder");
  fake::FakeWorld overridden;
  overridden.settings.setObject("com.orvane.tarnel", "tarnel_storebag_url", "https://bags.example:8443/x");
  EXPECT_EQ(storebagServerURL(overridden.dependencies), "https://bags.example:8443/x");
}

TEST_F(StorebagTest, ClientTypeZeroFailsBeforeAnyRequest) {
  EXPECT_EQ(fetch(0), std::nullopt);
  EXPECT_TRUE(world_.http.requests().empty());
  EXPECT_EQ(
      world_.log.lines(),
      (std::vector<fake::FakeLog::Line>{{LogLevel::error,
                                         "fetchStorebagForEnvironmentAndClientType: Could not find storebag "
                                         "name for client type 0"}}));
}

TEST_F(StorebagTest, OtherTypesWithoutANameAreAskedForAllTheSame) {
  serve(storebag());
  for (const int32_t type : {2, -1, 18}) {
    EXPECT_EQ(fetch(type), section("seed"));
    EXPECT_TRUE(world_.http.requests().back().url.ends_with("/bags/alder/(null)?version=3.2"));
  }
}

TEST_F(StorebagTest, TypesOfOneNameFetchOneURL) {
  serve(storebag());
  for (const int32_t type : {7, 11, 13}) {
    EXPECT_TRUE(fetch(type));
    EXPECT_TRUE(world_.http.requests().back().url.ends_with("/calvisto?version=3.2"));
  }
}

TEST_F(StorebagTest, FailedFetchNamesTheClientType) {
  world_.http.setAnswer(FakeHttpClient::failure("connection refused"));
  EXPECT_EQ(fetch(8), std::nullopt);
  EXPECT_TRUE(logged(LogLevel::error, "Could not fetch storebag for client type 8"));
  EXPECT_EQ(maxAge_, kUntouched);
  EXPECT_EQ(version_, std::nullopt);
}

TEST_F(StorebagTest, NotModifiedIsSilent) {
  world_.http.setAnswer(FakeHttpClient::status(304, "", {{"Last-Modified", "now"}}));
  MaybeString lastModified = "then";
  EXPECT_EQ(fetchStorebagForEnvironmentAndClientType(world_.dependencies, 7,
                                                     {maxAge_, version_, notModified_, &lastModified}),
            std::nullopt);
  EXPECT_TRUE(notModified_);
  EXPECT_TRUE(complaints().empty());
}

TEST_F(StorebagTest, EachEnvironmentHasItsSection) {
  const std::vector<std::pair<int, const char*>> rows = {{1, "dev"}, {2, "int"}, {3, "seed"}, {4, "rel"}};
  for (const auto& [type, backend] : rows) {
    fake::FakeWorld world;
    world.clientBundle.resources = world_.clientBundle.resources;
    world.settings.setObject("com.orvane.tarnel", "environmentType", type);
    world.http.setAnswer(FakeHttpClient::status(200, StorebagSigner::shared().signedStorebag(storebag())));
    EXPECT_EQ(fetchStorebagForEnvironmentAndClientType(world.dependencies, 7,
                                                       {maxAge_, version_, notModified_, nullptr}),
              section(backend))
        << type;
  }
}

TEST_F(StorebagTest, EnvironmentZeroHasNoSection) {
  setEnvironment(0);
  serve(storebag());
  EXPECT_EQ(fetch(7), std::nullopt);
  EXPECT_TRUE(logged(LogLevel::error, "Could not find storebag for client type 7 with (null) environment"));
  EXPECT_EQ(version_, std::nullopt);
}

TEST_F(StorebagTest, MissingSectionIsNamed) {
  setEnvironment(1);
  serve(storebagWithout("development"));
  EXPECT_EQ(fetch(9), std::nullopt);
  EXPECT_EQ(complaints(),
            (std::vector<std::string>{"fetchStorebagForEnvironmentAndClientType: Could not find "
                                      "storebag for client type 9 with development environment"}));
}

TEST_F(StorebagTest, MissingSeedSectionFallsBackToRelease) {
  serve(storebagWithout("seed"));
  EXPECT_EQ(fetch(), section("rel"));
  EXPECT_TRUE(logged(LogLevel::warning, "Seed section is missing in the storebag."));
}

TEST_F(StorebagTest, NeitherSeedNorRelease) {
  auto inner = storebagWithout("seed");
  inner.remove("release");
  serve(inner);
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_EQ(complaints(),
            (std::vector<std::string>{
                "fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.",
                "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type 7 "
                "with seed environment"}));
}

TEST_F(StorebagTest, OnlySeedFallsBack) {
  setEnvironment(2);
  serve(storebagWithout("orvane_internal"));
  EXPECT_EQ(fetch(), std::nullopt);
  EXPECT_TRUE(
      logged(LogLevel::error, "Could not find storebag for client type 7 with orvane_internal environment"));
}

TEST_F(StorebagTest, SectionOfAnotherKindCountsAsAbsent) {
  serve(storebagWith("seed", "text"));
  EXPECT_EQ(fetch(), section("rel"));
  EXPECT_EQ(complaints(),
            (std::vector<std::string>{
                "fetchStorebagForEnvironmentAndClientType: ignoring 'seed': expected a dictionary",
                "fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag."}));
}

TEST_F(StorebagTest, EmptySectionIsASection) {
  serve(storebagWith("seed", Dictionary{}));
  EXPECT_EQ(fetch(), Dictionary{});
}

TEST_F(StorebagTest, VersionIsHandedOut) {
  version_ = "old";
  serve(storebagWith("version", "8.1-b"));
  EXPECT_TRUE(fetch());
  EXPECT_EQ(version_, "8.1-b");
}

TEST_F(StorebagTest, MissingVersionIsAnInvalidArgument) {
  version_ = "old";
  auto inner = storebagWithout("version");
  inner.set("refresh_cycle", 600);
  serve(inner);
  EXPECT_THROW(fetch(), InvalidArgument);
  EXPECT_EQ(version_, "old");
  EXPECT_EQ(maxAge_, 86400) << "the version comes before the refresh cycle";
  EXPECT_TRUE(complaints().empty());
}

TEST_F(StorebagTest, VersionOfAnotherKindIsAnInvalidArgument) {
  serve(storebagWith("version", 8));
  EXPECT_THROW(fetch(), InvalidArgument);
  EXPECT_TRUE(logged(LogLevel::warning, "ignoring 'version': expected a string"));
}

TEST_F(StorebagTest, MissingSectionWinsOverMissingVersion) {
  setEnvironment(0);
  serve(storebagWithout("version"));
  EXPECT_EQ(fetch(), std::nullopt);
}

TEST_F(StorebagTest, RefreshCycleSetsTheMaximumAge) {
  const std::vector<std::pair<Value, int32_t>> rows = {{100000, 86400},
                                                       {86401, 86400},
                                                       {86400, 86400},
                                                       {86399, 86399},
                                                       {0, 0},
                                                       {-5, -5},
                                                       {600.9, 600},
                                                       {true, 1},
                                                       {int64_t{1} << 40, 86400},
                                                       {-(int64_t{1} << 40), INT32_MIN},
                                                       {UINT64_MAX, 86400}};
  for (const auto& [value, seconds] : rows) {
    world_.log.clear();
    serve(storebagWith("refresh_cycle", value));
    EXPECT_TRUE(fetch());
    EXPECT_EQ(maxAge_, seconds) << value.description();
    EXPECT_TRUE(logged(LogLevel::information, "Store bag override MaxAge=" + std::to_string(seconds)));
  }
}

TEST_F(StorebagTest, WithoutRefreshCycleTheResponseDecides) {
  world_.http.setAnswer(FakeHttpClient::status(200, StorebagSigner::shared().signedStorebag(storebag()),
                                               {{"Cache-Control", "max-age=90000"}}));
  EXPECT_TRUE(fetch());
  EXPECT_EQ(maxAge_, 90000) << "the bound holds for refresh_cycle only";
  EXPECT_TRUE(complaints().empty());
}

TEST_F(StorebagTest, RefreshCycleOfAnotherKindCountsAsAbsent) {
  for (const Value& value : {Value("600"), Value(Array{}), Value(Dictionary{}), Value()}) {
    world_.log.clear();
    serve(storebagWith("refresh_cycle", value));
    EXPECT_TRUE(fetch());
    EXPECT_EQ(maxAge_, 86400);
    EXPECT_EQ(complaints(), (std::vector<std::string>{"fetchStorebagForEnvironmentAndClientType: ignoring "
                                                      "'refresh_cycle': expected a number"}));
  }
}

TEST_F(StorebagTest, BuiltInStorebagServesEveryEnvironmentButZero) {
  for (const int type : {1, 2, 3, 4}) {
    fake::FakeWorld world;
    world.settings.setObject("com.orvane.tarnel", "environmentType", type);
    world.http.setAnswer(FakeHttpClient::failure("no route"));
    int32_t maxAge = kUntouched;
    MaybeString version;
    bool notModified = false;
    MaybeString lastModified = "then";
    EXPECT_EQ(fetchStorebagForEnvironmentAndClientType(world.dependencies, 11,
                                                       {maxAge, version, notModified, &lastModified}),
              section("dravik"));
    EXPECT_EQ(version, "1.0.0-Calvisto-Fallback");
    EXPECT_EQ(maxAge, 3600);
    EXPECT_FALSE(notModified);
    EXPECT_EQ(lastModified, "then");
    EXPECT_EQ(world.log.contains(LogLevel::warning,
                                 "fetchStorebagForEnvironmentAndClientType: Seed section is "
                                 "missing in the storebag."),
              type == 3);
  }
  setEnvironment(0);
  world_.http.setAnswer(FakeHttpClient::failure("no route"));
  EXPECT_EQ(fetch(11), std::nullopt);
}

}  // namespace
}  // namespace tarnel
