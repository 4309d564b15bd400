#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>

#include "formats/document.h"
#include "testing/private_instance.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Verified storebags whose values are of every wrong kind. Such a value counts as absent, one warning names
// it, and the daemon goes on.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;

struct Kind {
  const char* name;
  Value value;
};

std::vector<Kind> kinds() {
  return {{"null", Value()},
          {"boolean", true},
          {"integer", -3},
          {"huge", UINT64_MAX},
          {"real", 1e308},
          {"text", "text"},
          {"data", Data{1, 2, 3}},
          {"date", Date{1.7e9}},
          {"array", Array{1, "x", Array{2, 3}, Dictionary{{"a", 1}}, Value()}},
          {"dictionary", Dictionary{{"key", 1}}}};
}

const std::set<std::string> kNumbers{"boolean", "integer", "huge", "real"};
const std::set<std::string> kTexts{"text"};
const std::set<std::string> kArrays{"array"};
const std::set<std::string> kAny{"boolean", "integer", "huge",  "real",      "text",
                                 "data",    "date",    "array", "dictionary"};

struct Key {
  const char* name;
  const std::set<std::string>* right;
};
const Key kKeys[] = {{"client", &kTexts},
                     {"service", &kTexts},
                     {"expedite", &kNumbers},
                     {"hierarchy", &kNumbers},
                     {"override_dnu", &kNumbers},
                     {"locale_whitelist", &kArrays},
                     {"device_whitelist", &kArrays},
                     {"device_blacklist", &kArrays},
                     {"filters", &kArrays},
                     {"sampling_threshold", &kNumbers},
                     {"per_country_sampling_thresholds", &kArrays},
                     {"override_sampling", &kNumbers},
                     {"custom_clientId", &kAny},
                     {"event_threshold", &kNumbers},
                     {"extras_on_internal", &kNumbers},
                     {"post_url", &kTexts},
                     {"realtime_post_url", &kTexts}};

class StorebagValuesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    server.connect(instance);
    instance.setConsent(true);
    instance.setLogLevel("warning");
    ASSERT_TRUE(instance.start());
  }

  // Serves the document, runs one session under it, and gives what the daemon warned of.
  std::string warningsOf(const Dictionary& backends) {
    const auto inner = with(storebag("1", backends), "refresh_cycle", 0);
    server.serve("brevan", inner);
    const size_t before = instance.logSize();
    {
      TestSession session(instance, {.batch = true});
      EXPECT_TRUE(session.started.ok()) << session.started.status.message;
      EXPECT_TRUE(session.send(3, 4, client::Dictionary().set("k", "v"), client::Flag::important).ok());
      EXPECT_TRUE(session.session.flushAndWait(kDeadline).ok());
    }
    return instance.log().substr(before);
  }

  // Nobody listens there: what is posted is lost.
  const Dictionary entry = clientEntry("http://127.0.0.1:1/", "http://127.0.0.1:1/");
  StorebagServer server;
  PrivateInstance instance;
};

TEST_F(StorebagValuesTest, EveryKeyOfAClientEntry) {
  for (const Key& key : kKeys) {
    for (const Kind& kind : kinds()) {
      SCOPED_TRACE(std::string(key.name) + " is of kind " + kind.name);
      Dictionary changed = entry;
      // Only a session that the main threshold does not admit looks at the other one.
      if (std::string_view(key.name) == "override_sampling") changed.set("sampling_threshold", 0);
      changed.set(key.name, kind.value);
      const std::string warnings = warningsOf({{"httppost", profile({changed})}});
      const std::string line = std::string("httppost: clients[0].") + key.name + " is not ";
      if (key.right->contains(kind.name)) {
        EXPECT_EQ(countOf(line, warnings), 0U) << warnings;
      } else {
        EXPECT_THAT(warnings, HasSubstr("<4>tarneld["));
        EXPECT_THAT(warnings, HasSubstr(line));
        // An absent name would let everybody in; one that nobody can read lets nobody in.
        const bool isName = std::string_view(key.name) == "client" || std::string_view(key.name) == "service";
        EXPECT_THAT(warnings, HasSubstr(isName ? " and matches nobody" : " and counts as absent"));
      }
      if (HasFailure()) return;
    }
  }
  instance.expectAlive();
}

TEST_F(StorebagValuesTest, EveryKeyOfASection) {
  for (const Kind& kind : kinds()) {
    SCOPED_TRACE(kind.name);
    warningsOf({{"httppost", with(profile({entry}), "clients", kind.value)}});
    warningsOf({{"httppost", with(profile({entry}), "display_url", kind.value)}});
    warningsOf({{"httppost", kind.value}, {"httppost2", profile({entry})}});
    for (const char* backend : {"dashboard", "uploadserver", "dravik", "vesmer"}) {
      warningsOf({{backend, kind.value}});
      warningsOf({{backend, Dictionary{{"post_url", kind.value},
                                       {"display_url", kind.value},
                                       {"port", kind.value},
                                       {"reliable", kind.value},
                                       {"active", kind.value}}}});
    }
    ASSERT_FALSE(HasFailure());
  }
  instance.expectAlive();
}

TEST_F(StorebagValuesTest, EveryKeyOfAFilterAndOfACountry) {
  const auto warnings = [this](const char* list, const Value& item) {
    return warningsOf({{"httppost", profile({with(entry, list, Array{item})})}});
  };
  for (const Kind& kind : kinds()) {
    SCOPED_TRACE(kind.name);
    for (const char* list : {"filters", "per_country_sampling_thresholds", "device_blacklist"}) {
      warnings(list, kind.value);
    }
    for (const char* key : {"method", "status", "key", "action"}) {
      Dictionary filter{{"method", 3}, {"status", 4}, {"key", "k"}, {"action", "sha256"}};
      filter.set(key, kind.value);
      const std::string said = warnings("filters", filter);
      const bool text = std::string_view(key) == "key" || std::string_view(key) == "action";
      if (!(text ? kTexts : kNumbers).contains(kind.name)) {
        EXPECT_THAT(said, HasSubstr(std::string("clients[0].filters[0].") + key + " is not "));
      }
    }
    for (const char* key : {"country", "threshold"}) {
      Dictionary item{{"country", Array{"DE"}}, {"threshold", 1}};
      item.set(key, kind.value);
      warnings("per_country_sampling_thresholds", item);
    }
    ASSERT_FALSE(HasFailure());
  }
  instance.expectAlive();
}

TEST_F(StorebagValuesTest, FiltersOnValuesOfEveryKind) {
  const Array filters{Dictionary{{"key", "hashed"}, {"action", "sha256"}},
                      Dictionary{{"key", "_method"}, {"action", "sha256"}},
                      Dictionary{{"key", "_status"}, {"action", "remove"}}};
  server.serve("brevan", storebag("1", {{"httppost", profile({with(entry, "filters", filters)})}}));
  TestSession session(instance, {});
  const auto send = [&session](const auto& value) {
    EXPECT_TRUE(session.send(3, 4, client::Dictionary().set("hashed", value)).ok());
  };
  send(1);
  send(true);
  send(0.5);
  send(client::Date{1.7e9});
  send(std::vector<uint8_t>{1, 2});
  send(client::Array().append(1));
  send(client::Dictionary().set("a", 1));
  send("x\xF0\x9F\x98\x80");
  instance.expectAlive();
}

}  // namespace
}  // namespace tarnel::test
