#include "tools/storebag/storebag_validation.h"

#include <gmock/gmock.h>

#include <cmath>

#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/storebag/storebag_template.h"

namespace tarnel {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::SizeIs;

std::vector<std::string> texts(const std::vector<StorebagFinding>& findings) {
  std::vector<std::string> list;
  for (const StorebagFinding& finding : findings) {
    list.push_back((finding.severity == FindingSeverity::error ? "error " : "warning ") +
                   finding.description());
  }
  return list;
}

std::vector<std::string> findings(const Value& document) {
  return texts(validateStorebag(document));
}

// The template with one section, its client entry changed.
std::vector<std::string> findingsWithEntry(const std::function<void(Dictionary&)>& change) {
  Dictionary bag = newStorebagTemplate();
  Dictionary entry =
      *(*findArray(*findDictionary(*findDictionary(bag, "seed"), "httppost"), "clients"))[0].dictionary();
  change(entry);
  bag.remove("seed");
  bag.set("release", Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}});
  return findings(bag);
}

std::vector<std::string> findingsWithout(const std::string& key) {
  return findingsWithEntry([&key](Dictionary& entry) { entry.remove(key); });
}
std::vector<std::string> findingsWith(const std::string& key, const Value& value) {
  return findingsWithEntry([&key, &value](Dictionary& entry) { entry.set(key, value); });
}

constexpr char kEntry[] = "release.httppost.clients[0].";

std::vector<std::string> findingsOfSection(const Dictionary& section) {
  return findings(Dictionary{{"version", "1"}, {"release", section}});
}

TEST(StorebagValidation, TheExamplesPass) {
  for (const char* name : {"brevan", "moldaro"}) {
    const Result<std::string> text =
        readFile(std::string(TARNEL_EXAMPLES_DIRECTORY) + "/storebags/" + name + ".json", 1U << 20U);
    ASSERT_TRUE(text) << text.error().description();
    const Result<Value> document = parseDocument(*text);
    ASSERT_TRUE(document) << document.error().description();
    EXPECT_THAT(findings(*document), IsEmpty()) << name;
  }
}

TEST(StorebagValidation, TopLevelMustBeADictionary) {
  EXPECT_THAT(findings(Array{}),
              ElementsAre("error the document's top level must be a dictionary, but is a list"));
}

TEST(StorebagValidation, VersionIsRequiredText) {
  Dictionary bag = newStorebagTemplate();
  bag.remove("version");
  EXPECT_THAT(findings(bag),
              ElementsAre("error version: missing: the daemon refuses a storebag without a version"));
  bag.set("version", 12);
  EXPECT_THAT(findings(bag), ElementsAre("error version: must be a text, but is a number: the daemon takes "
                                         "it for absent"));
}

TEST(StorebagValidation, RefreshCycleIsANumberOfAtMostADay) {
  Dictionary bag = newStorebagTemplate();
  bag.set("refresh_cycle", 86400);
  EXPECT_THAT(findings(bag), IsEmpty());
  bag.set("refresh_cycle", 86401);
  EXPECT_THAT(findings(bag), ElementsAre("warning refresh_cycle: counts as 86400: a day is the longest"));
  bag.set("refresh_cycle", 0);
  EXPECT_THAT(findings(bag), ElementsAre(HasSubstr("warning refresh_cycle: every session fetches")));
  bag.set("refresh_cycle", UINT64_MAX);
  EXPECT_THAT(findings(bag), ElementsAre("warning refresh_cycle: counts as 86400: a day is the longest"));
  bag.set("refresh_cycle", 0.5);
  EXPECT_THAT(findings(bag), ElementsAre(HasSubstr("warning refresh_cycle: every session fetches")));
  bag.set("refresh_cycle", 86400.5);
  EXPECT_THAT(findings(bag),
              ElementsAre(HasSubstr("counts as 86400: what stands behind the point is cut off")));
  bag.set("refresh_cycle", "3600");
  EXPECT_THAT(findings(bag), ElementsAre(HasSubstr("error refresh_cycle: must be a number, but is a text")));
}

TEST(StorebagValidation, SectionsAreKnownAndOneIsForCustomers) {
  EXPECT_THAT(findings(Dictionary{{"version", "1"}, {"development", Dictionary{{"dravik", Dictionary{}}}}}),
              ElementsAre("error release: missing, and \"seed\" too: devices of customers find no section"));
  EXPECT_THAT(findings(Dictionary{{"version", "1"}, {"seed", Dictionary{{"dravik", Dictionary{}}}}}),
              ElementsAre(HasSubstr("warning release: missing")));
  Dictionary bag = newStorebagTemplate();
  bag.set("relaese", Dictionary{});
  bag.set("unrelated", 1);
  EXPECT_THAT(findings(bag),
              ElementsAre("warning relaese: unknown key: nothing reads it; did you mean \"release\"?",
                          "warning unrelated: unknown key: nothing reads it"));
  EXPECT_THAT(findings(Dictionary{{"version", "1"}, {"release", Array{}}}),
              Contains("error release: must be a dictionary, but is a list: the daemon takes it for absent"));
}

TEST(StorebagValidation, ASignedDocumentIsRecognised) {
  EXPECT_THAT(findings(Dictionary{{"signature", ""}, {"bag", ""}}),
              Contains(HasSubstr("give the inner one")));
}

TEST(StorebagValidation, BackendNamesAreThoseTheDaemonKnows) {
  const Dictionary entryless = {{"clients", Array{}}};
  EXPECT_THAT(findingsOfSection({{"httppost", entryless},
                                 {"httppost2", entryless},
                                 {"dashboard", Dictionary{{"ip", "127.0.0.1"}, {"port", 9}}},
                                 {"uploadserver", Dictionary{{"post_url", "https://a.example/"}}},
                                 {"dravik", Dictionary{{"active", true}}},
                                 {"vesmer", Dictionary{}}}),
              Not(Contains(HasSubstr("error"))));
  EXPECT_THAT(findingsOfSection({{"httpPost", Dictionary{}}}),
              ElementsAre("error release.httpPost: unknown backend: the daemon makes none; did you mean "
                          "\"httppost\"?"));
  EXPECT_THAT(findingsOfSection({{"carrier-pigeon", Dictionary{}}}),
              ElementsAre(HasSubstr("unknown backend: the daemon makes none; known are httppost,")));
  EXPECT_THAT(findingsOfSection({{"dravik", true}}),
              ElementsAre("error release.dravik: must be a dictionary, but is a boolean"));
}

TEST(StorebagValidation, HTTPPostNeedsItsClients) {
  EXPECT_THAT(findingsOfSection({{"httppost", Dictionary{}}}),
              ElementsAre("error release.httppost.clients: missing: the daemon makes no backend without a "
                          "client list"));
  EXPECT_THAT(findingsOfSection({{"httppost", Dictionary{{"clients", Array{}}}}}),
              ElementsAre("warning release.httppost.clients: empty: no client reports here"));
  EXPECT_THAT(findingsOfSection({{"httppost", Dictionary{{"clients", Array{1}}}}}),
              ElementsAre("error release.httppost.clients[0]: must be a dictionary, but is a number"));
}

TEST(StorebagValidation, DashboardNeedsAddressAndPort) {
  EXPECT_THAT(
      findingsOfSection({{"dashboard", Dictionary{}}}),
      ElementsAre(HasSubstr("release.dashboard.ip: missing"), HasSubstr("release.dashboard.port: missing")));
  EXPECT_THAT(findingsOfSection(
                  {{"dashboard", Dictionary{{"ip", "localhost"}, {"port", 70000}, {"reliable", false}}}}),
              ElementsAre(HasSubstr("ip: must be an IPv4 address in dotted form, but is \"localhost\""),
                          HasSubstr("port: must be a number from 1 to 65535"),
                          HasSubstr("warning release.dashboard.reliable: any value turns")));
  EXPECT_THAT(
      findingsOfSection({{"dashboard", Dictionary{{"ip", "255.255.255.255"}, {"port", 9}}}}),
      ElementsAre("error release.dashboard.ip: the daemon makes no backend for the broadcast address"));
}

TEST(StorebagValidation, DashboardNumbersAreThoseTheDaemonReads) {
  const auto with = [](const Value& port, const Value& reliable) {
    return findingsOfSection(
        {{"dashboard", Dictionary{{"ip", "127.0.0.1"}, {"port", port}, {"reliable", reliable}}}});
  };
  EXPECT_THAT(with(1, 1), IsEmpty());
  EXPECT_THAT(with(65535, 3600000), IsEmpty());
  EXPECT_THAT(
      with("9", "500 ms"),
      ElementsAre("warning release.dashboard.port: is a text and counts as 9: write it as a number",
                  "warning release.dashboard.reliable: is a text and counts as 500: write it as a number"));
  for (const Value& none : {Value("nine"), Value(), Value(Array{9}), Value(Dictionary{{"9", 9}})}) {
    EXPECT_THAT(with(none, none),
                ElementsAre("error release.dashboard.port: must be a number from 1 to 65535",
                            AllOf(HasSubstr("warning release.dashboard.reliable: any value turns"),
                                  HasSubstr("without a number, which gets a period of 500 milliseconds"))));
  }
  EXPECT_THAT(
      with(9.5, 20.5),
      ElementsAre("warning release.dashboard.port: counts as 9: what stands behind the point is cut off",
                  "warning release.dashboard.reliable: counts as 20: what stands behind the point is cut "
                  "off"));
  EXPECT_THAT(
      with(UINT64_MAX, 3600001),
      ElementsAre("error release.dashboard.port: must be a number from 1 to 65535",
                  "warning release.dashboard.reliable: counts as 3600000: an hour is the longest period"));
}

TEST(StorebagValidation, UploadServerNeedsItsAddress) {
  EXPECT_THAT(findingsOfSection({{"uploadserver", Dictionary{}}}),
              ElementsAre(HasSubstr("release.uploadserver.post_url: missing")));
}

TEST(StorebagValidation, WhatKeepsAClientEntryDisabled) {
  const std::string entry = kEntry;
  EXPECT_THAT(findingsWithout("filters"),
              ElementsAre("error " + entry + "filters: missing: the backend will stay disabled"));
  EXPECT_THAT(findingsWith("filters", Array{}), IsEmpty());
  EXPECT_THAT(findingsWithout("locale_whitelist"),
              ElementsAre(HasSubstr("error " + entry + "locale_whitelist: missing: the backend will stay")));
  EXPECT_THAT(findingsWith("locale_whitelist", Array{}), ElementsAre(HasSubstr("locale_whitelist: empty")));
  EXPECT_THAT(
      findingsWithout("sampling_threshold"),
      ElementsAre(HasSubstr("error " + entry + "sampling_threshold: missing: the backend will stay")));
  EXPECT_THAT(findingsWithout("post_url"), ElementsAre(HasSubstr("error " + entry + "post_url: missing")));
  EXPECT_THAT(findingsWithout("event_threshold"),
              ElementsAre(HasSubstr("warning " + entry + "event_threshold: missing: counts as 0")));
  EXPECT_THAT(findingsWithout("realtime_post_url"), IsEmpty());
  EXPECT_THAT(findingsWithout("client"), IsEmpty());
}

TEST(StorebagValidation, NamesThatAreNoTextMatchNobody) {
  for (const std::string key : {"client", "service"}) {
    EXPECT_THAT(findingsWith(key, 5), ElementsAre("error " + std::string(kEntry) + key +
                                                  ": must be a text, but is a number: the daemon takes it "
                                                  "for matching nobody"));
  }
  EXPECT_THAT(findingsWith("post_url", 5),
              Contains(HasSubstr("must be a text, but is a number: the daemon takes it for absent")));
}

TEST(StorebagValidation, EveryEntryKeyHasItsType) {
  for (const char* key : {"client", "service", "post_url", "realtime_post_url"}) {
    EXPECT_THAT(findingsWith(key, 5), Contains(HasSubstr(std::string(key) + ": must be a text, but is")))
        << key;
  }
  for (const char* key : {"expedite", "hierarchy", "override_dnu", "sampling_threshold", "override_sampling",
                          "event_threshold", "extras_on_internal"}) {
    EXPECT_THAT(findingsWith(key, "1"), Contains(HasSubstr(std::string(key) + ": must be a number"))) << key;
  }
  for (const char* key : {"locale_whitelist", "device_whitelist", "device_blacklist"}) {
    EXPECT_THAT(findingsWith(key, "DE"), Contains(HasSubstr(std::string(key) + ": must be a list of texts")));
    EXPECT_THAT(findingsWith(key, Array{"DE", 1}), Contains(HasSubstr("a list that holds other things")))
        << key;
  }
  for (const char* key : {"filters", "per_country_sampling_thresholds"}) {
    EXPECT_THAT(findingsWith(key, Dictionary{}), Contains(HasSubstr(std::string(key) + ": must be a list")))
        << key;
  }
  EXPECT_THAT(findingsWith("expedite", true), IsEmpty()) << "a boolean counts as a number";
  EXPECT_THAT(findingsWith("custom_clientId", Dictionary{}), IsEmpty()) << "any value will do";
  EXPECT_THAT(findingsWith("postUrl", ""), ElementsAre(HasSubstr("did you mean \"post_url\"?")));
}

TEST(StorebagValidation, ValuesThatAreProbablyNotMeant) {
  EXPECT_THAT(findingsWith("client", "A, B"), ElementsAre(HasSubstr("client: blanks beside a comma")));
  EXPECT_THAT(findingsWith("service", ""), ElementsAre(HasSubstr("service: empty: matches nothing")));
  EXPECT_THAT(findingsWith("override_dnu", 2), ElementsAre(HasSubstr("only 1 overrides")));
  EXPECT_THAT(findingsWith("sampling_threshold", 25), ElementsAre(HasSubstr("share from 0 to 1")));
  EXPECT_THAT(findingsWith("override_sampling", 0.5), ElementsAre(HasSubstr("below \"sampling_threshold\"")));
  EXPECT_THAT(findingsWith("event_threshold", -1), ElementsAre(HasSubstr("event_threshold: below 0")));
  EXPECT_THAT(findingsWith("locale_whitelist", Array{"DE", "de"}),
              ElementsAre(HasSubstr("locale_whitelist[1]: \"de\" is no country code")));
  EXPECT_THAT(findingsWith("device_blacklist", Array{""}),
              ElementsAre(HasSubstr("device_blacklist[0]: an empty")));
  EXPECT_THAT(findingsWith("post_url", "ftp://a.example/"),
              ElementsAre(HasSubstr("post_url: must be an http or https address")));
  EXPECT_THAT(findingsWith("post_url", "http://a.example/"), ElementsAre(HasSubstr("warning")));
  EXPECT_THAT(findingsWith("post_url", "https://a.example/x y"), ElementsAre(HasSubstr("holds no blanks")));
}

// Reads every number as the daemon does, so that the findings name what it will read.
TEST(StorebagValidation, NumbersThatTheDaemonReadsOtherwise) {
  const std::string range = ": only numbers from -2147483648 to 2147483647 are read as they stand";
  for (const char* key : {"expedite", "hierarchy", "extras_on_internal", "event_threshold", "override_dnu"}) {
    const std::string warning = "warning " + std::string(kEntry) + key + ": counts as ";
    EXPECT_THAT(findingsWith(key, 1), IsEmpty()) << key;
    EXPECT_THAT(findingsWith(key, (int64_t{1} << 32) + 1), Contains(warning + "2147483647" + range)) << key;
    EXPECT_THAT(findingsWith(key, 1.5), ElementsAre(warning + "1: what stands behind the point is cut off"))
        << key;
    EXPECT_THAT(findingsWith(key, 0.5), ElementsAre(warning + "0: what stands behind the point is cut off"))
        << key;
    EXPECT_THAT(findingsWith(key, std::nan("")), ElementsAre(warning + "0" + range)) << key;
  }
  const std::string entry = std::string("warning ") + kEntry;
  EXPECT_THAT(findingsWith("event_threshold", int64_t{1} << 31),
              ElementsAre(entry + "event_threshold: counts as 2147483647" + range));
  EXPECT_THAT(findingsWith("event_threshold", UINT64_MAX),
              ElementsAre(entry + "event_threshold: counts as 2147483647" + range));
  EXPECT_THAT(findingsWith("event_threshold", INT64_MIN),
              ElementsAre(entry + "event_threshold: counts as -2147483648" + range, HasSubstr("below 0")));
  EXPECT_THAT(findingsWith("hierarchy", -1), ElementsAre(HasSubstr("hierarchy: levels begin at 0")));
  EXPECT_THAT(findingsWith("sampling_threshold", std::nan("")),
              ElementsAre(entry + "sampling_threshold: is not a number: no session comes to lie below it"));
  const Dictionary filter{
      {"key", "a"}, {"action", "keep"}, {"method", (int64_t{1} << 32) + 7}, {"status", 1.5}};
  EXPECT_THAT(findingsWith("filters", Array{filter}),
              ElementsAre(entry + "filters[0].method: counts as 2147483647" + range,
                          entry + "filters[0].method: no event has one above 65535: the filter never acts",
                          entry + "filters[0].status: counts as 1: what stands behind the point is cut off"));
}

TEST(StorebagValidation, ListsOfMixedKindsLoseWhatIsNoText) {
  EXPECT_THAT(findingsWith("device_blacklist", Array{"a", 1}),
              ElementsAre(HasSubstr("but is a list that holds other things: the daemon leaves those out")));
}

TEST(StorebagValidation, FiltersAreCheckedOneByOne) {
  const Array filters = {Dictionary{{"key", "a"}, {"action", "remove"}, {"method", 1}, {"status", 2}},
                         Dictionary{{"action", "sha256"}},
                         Dictionary{{"key", "a"}},
                         Dictionary{{"key", "a"}, {"action", "Remove"}},
                         Dictionary{{"key", "a"}, {"action", "keep"}, {"method", 65536}, {"status", -1}},
                         "remove"};
  EXPECT_THAT(findingsWith("filters", filters),
              ElementsAre(HasSubstr("filters[1].key: missing"), HasSubstr("filters[2].action: missing"),
                          HasSubstr("filters[3].action: \"Remove\" keeps the field"),
                          HasSubstr("filters[4].method: no event has one above 65535"),
                          HasSubstr("filters[4].status: below 0 counts as any"),
                          HasSubstr("filters[5]: must be a dictionary, but is a text")));
}

TEST(StorebagValidation, CountryThresholdsAreCheckedOneByOne) {
  const Array list = {Dictionary{{"country", Array{"DE"}}, {"threshold", 0.5}}, Dictionary{{"threshold", 2}},
                      Dictionary{{"country", Array{"d"}}}, 7};
  EXPECT_THAT(findingsWith("per_country_sampling_thresholds", list),
              ElementsAre(HasSubstr("[1].threshold: is a share"), HasSubstr("[1].country: missing"),
                          HasSubstr("[2].country[0]: \"d\" is no country"),
                          HasSubstr("[2].threshold: missing"), HasSubstr("[3]: must be a dictionary")));
}

TEST(StorebagValidation, TheListOfFindingsIsBounded) {
  Array filters;
  for (int i = 0; i < 1000; ++i) filters.append(1);
  const Dictionary entry = {{"filters", filters}};
  const auto list = validateStorebag(Dictionary{
      {"version", "1"}, {"release", Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}}});
  EXPECT_THAT(list, SizeIs(kMaxStorebagFindings));
  EXPECT_EQ(list.back().text, "more is wrong than is listed here");
  EXPECT_TRUE(hasErrors(list));
}

}  // namespace
}  // namespace tarnel
