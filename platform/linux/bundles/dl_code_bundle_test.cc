#include "platform/linux/bundles/dl_code_bundle.h"

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <sstream>
#include <thread>

#include "platform/fake/fake_log.h"
#include "platform/linux/bundles/trusted_folder_test_support.h"
#include "platform/linux/sandbox/linux_sandbox.h"
#include "testing/linux_test_support.h"

// The sample adaptor, and others that do something wrong, loaded from real bundles.

namespace tarnel {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::UnorderedElementsAre;
using Line = fake::FakeLog::Line;

constexpr char kPath[] = "/System/Library/QMXPerformance.framework";
constexpr char kSelector[] = "sendMessageWithMethod:respCode:dict:";

class DlCodeBundleTest : public testing::Test {
 protected:
  // Each test has a library file of its own: what was loaded once is never loaded again.
  void install(const std::string& library) const {
    folder.makeDirectory(std::string(kPath).substr(1));
    folder.copy(library, libraryName());
    ::chmod(library_.c_str(), 0755);
  }
  static std::string libraryName() { return std::string(kPath).substr(1) + "/QMXPerformance.so"; }

  std::unique_ptr<BundleInstance> instance(const char* className = "DravikAdaptor") {
    const auto bundle = bundles.bundleWithPath(kPath);
    if (bundle == nullptr || !bundle->load()) return nullptr;
    const auto found = bundle->classNamed(className);
    return found == nullptr ? nullptr : found->newInstance();
  }
  std::vector<std::string> records() const {
    std::ifstream stream(written_);
    std::vector<std::string> lines;
    for (std::string line; std::getline(stream, line);) lines.push_back(line);
    return lines;
  }
  // Only the newest lines count: the number of the instance goes on from test to test.
  static std::string withoutNumber(const std::string& line) { return line.substr(line.find(' ') + 1); }

  void SetUp() override { ::setenv("SAMPLE_ADAPTOR_FILE", written_.c_str(), 1); }
  void TearDown() override { ::unsetenv("SAMPLE_ADAPTOR_FILE"); }

  const TrustedFolder folder;
  const std::string library_ = folder.path(libraryName());
  const std::string written_ = folder.path("written");
  fake::FakeLog log;
  DlCodeBundles bundles{folder.path(), log};
};

TEST(LibraryOfBundle, HasTheBundlesNameWithoutItsEnding) {
  EXPECT_EQ(libraryOfBundle("/a/QMXPerformance.framework"), "/a/QMXPerformance.framework/QMXPerformance.so");
  EXPECT_EQ(libraryOfBundle("/a.b/Name"), "/a.b/Name/Name.so");
  EXPECT_EQ(libraryOfBundle("/a/x.y.bundle"), "/a/x.y.bundle/x.y.so");
}

TEST_F(DlCodeBundleTest, AMissingBundleIsNoneWithoutAMessage) {
  EXPECT_EQ(bundles.bundleWithPath(kPath), nullptr);
  folder.makeDirectory("System");
  EXPECT_EQ(bundles.bundleWithPath(kPath), nullptr);
  std::ofstream(folder.path("System/Library")) << "a file where a folder is expected";
  EXPECT_EQ(bundles.bundleWithPath(kPath), nullptr);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(DlCodeBundleTest, ABundleIsLoadedOnceAndIsOneForAll) {
  install(SAMPLE_ADAPTOR);
  const auto bundle = bundles.bundleWithPath(kPath);
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->isLoaded());
  EXPECT_EQ(bundle->classNamed("DravikAdaptor"), nullptr) << "not loaded yet";
  EXPECT_TRUE(bundle->load());
  EXPECT_TRUE(bundle->isLoaded());
  EXPECT_TRUE(bundle->load());
  EXPECT_EQ(bundles.bundleWithPath(kPath), bundle);
  EXPECT_EQ(bundle->classNamed("Other"), nullptr);
  EXPECT_NE(bundle->classNamed("DravikAdaptor"), nullptr);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(DlCodeBundleTest, TheAdaptorReadsEveryKindOfValue) {
  install(SAMPLE_ADAPTOR);
  const auto adaptor = instance();
  ASSERT_NE(adaptor, nullptr);
  EXPECT_EQ(adaptor->description(), "<DravikAdaptor>");
  const Dictionary payload{{"bool", true},
                           {"integer", INT64_MIN},
                           {"unsigned", UINT64_MAX},
                           {"real", 0.5},
                           {"date", Date{12.25}},
                           {"text", "grüße"},
                           {"data", Data{0, 255}},
                           {"array", Array{1, "two", Array()}},
                           {"dictionary", Dictionary{{"x", Value()}}}};
  adaptor->perform(kSelector, Method{65535}, RespCode{1}, payload);
  adaptor->perform(kSelector, Method{0}, RespCode{65535}, std::nullopt);
  adaptor->perform(kSelector, Method{2}, RespCode{3}, Dictionary());
  const auto lines = records();
  ASSERT_EQ(lines.size(), 3U);
  EXPECT_EQ(
      withoutNumber(lines[0]),
      "65535/1 bool=true integer=-9223372036854775808 unsigned=18446744073709551615 real=0.5 date=@12.250 "
      "text=\"grüße\" data=00ff array=[1,\"two\",[]] dictionary={ x=null }");
  EXPECT_EQ(withoutNumber(lines[1]), "0/65535 no payload");
  EXPECT_EQ(withoutNumber(lines[2]), "2/3");
}

TEST_F(DlCodeBundleTest, OnlyTheMethodsOfTheAdaptorAreCalled) {
  install(SAMPLE_ADAPTOR);
  const auto adaptor = instance();
  ASSERT_NE(adaptor, nullptr);
  EXPECT_TRUE(adaptor->respondsTo(kSelector));
  EXPECT_FALSE(adaptor->respondsTo("sendMessage"));
  adaptor->perform("sendMessage", Method{1}, RespCode{2}, Dictionary());
  EXPECT_THAT(records(), IsEmpty());
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(DlCodeBundleTest, AnInstanceOutlivesWhatItWasFoundThrough) {
  install(SAMPLE_ADAPTOR);
  std::unique_ptr<BundleInstance> adaptor;
  {
    DlCodeBundles others(folder.path(), log);
    const auto bundle = others.bundleWithPath(kPath);
    ASSERT_TRUE(bundle->load());
    adaptor = bundle->classNamed("DravikAdaptor")->newInstance();
  }
  std::filesystem::remove_all(folder.path("System"));
  adaptor->perform(kSelector, Method{1}, RespCode{2}, Dictionary{{"a", 1}});
  ASSERT_EQ(records().size(), 1U);
  EXPECT_EQ(withoutNumber(records()[0]), "1/2 a=1");
  adaptor.reset();
}

TEST_F(DlCodeBundleTest, ALoadedBundleStaysWhenItsFolderGoes) {
  install(SAMPLE_ADAPTOR);
  ASSERT_NE(instance(), nullptr);
  std::filesystem::remove_all(folder.path("System"));
  EXPECT_NE(instance(), nullptr);
}

TEST_F(DlCodeBundleTest, InstancesOfManySessionsWorkAtTheSameTime) {
  install(SAMPLE_ADAPTOR);
  constexpr int kSessions = 6;
  constexpr int kMessages = 200;
  std::vector<std::thread> sessions;
  for (int session = 0; session < kSessions; ++session) {
    sessions.emplace_back([this, session] {
      const auto adaptor = instance();
      if (adaptor == nullptr) return;
      for (int message = 0; message < kMessages; ++message) {
        if (!adaptor->respondsTo(kSelector)) continue;
        adaptor->perform(kSelector, Method{static_cast<uint16_t>(session)},
                         RespCode{static_cast<uint16_t>(message)},
                         Dictionary{{"text", std::string(300, 'x')}});
      }
    });
  }
  for (std::thread& session : sessions) session.join();
  // Every session's messages are there, whole and in their order, from one instance each.
  std::map<std::string, std::vector<std::string>> byInstance;
  for (const std::string& line : records()) byInstance[line.substr(0, line.find(' '))].push_back(line);
  EXPECT_EQ(byInstance.size(), static_cast<size_t>(kSessions));
  for (const auto& [number, lines] : byInstance) {
    ASSERT_EQ(lines.size(), static_cast<size_t>(kMessages));
    const std::string first = withoutNumber(lines[0]);
    const std::string session = first.substr(0, first.find('/'));
    for (int message = 0; message < kMessages; ++message) {
      EXPECT_EQ(lines[static_cast<size_t>(message)], number + " " + session + "/" + std::to_string(message) +
                                                         " text=\"" + std::string(300, 'x') + "\"");
    }
  }
}

TEST_F(DlCodeBundleTest, ABundleThatOthersCanWriteToIsRefusedOncePerReason) {
  install(SAMPLE_ADAPTOR);
  ::chmod(folder.path("System/Library").c_str(), 0775);
  const auto bundle = bundles.bundleWithPath(kPath);
  ASSERT_NE(bundle, nullptr);
  EXPECT_FALSE(bundle->load());
  EXPECT_FALSE(bundle->load());
  EXPECT_THAT(
      log.lines(),
      ElementsAre(Line{LogLevel::error,
                       "loadBundle: " + library_ + ": is not used, because its directory " +
                           folder.path("System/Library") +
                           " can be written by its group or by others; change that with: chmod go-w " +
                           folder.path("System/Library")}));
  log.clear();
  ::chmod(folder.path("System/Library").c_str(), 0755);
  ::chmod(library_.c_str(), 0757);
  EXPECT_FALSE(bundle->load());
  EXPECT_EQ(log.lines().size(), 1U) << "another reason";
  EXPECT_FALSE(bundle->isLoaded());
  ::chmod(library_.c_str(), 0755);
  EXPECT_TRUE(bundle->load()) << "mended without a restart";
}

TEST_F(DlCodeBundleTest, ABundleOfSomebodyElseIsRefused) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file away";
  install(SAMPLE_ADAPTOR);
  ASSERT_EQ(::chown(library_.c_str(), 4711, 0), 0);
  EXPECT_EQ(instance(), nullptr);
  ASSERT_EQ(log.lines().size(), 1U);
  EXPECT_THAT(log.lines()[0].text, HasSubstr("because it belongs to user 4711"));
}

TEST_F(DlCodeBundleTest, SymbolicLinksAreRefused) {
  install(SAMPLE_ADAPTOR);
  const std::string moved = library_ + ".1";
  ASSERT_EQ(::rename(library_.c_str(), moved.c_str()), 0);
  ASSERT_EQ(::symlink(moved.c_str(), library_.c_str()), 0);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_THAT(log.lines().at(0).text, HasSubstr(library_ + " is a symbolic link"));
  ASSERT_EQ(::rename(moved.c_str(), library_.c_str()), 0);
  ASSERT_EQ(::rename(folder.path("System").c_str(), folder.path("Real").c_str()), 0);
  ASSERT_EQ(::symlink("Real", folder.path("System").c_str()), 0);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_THAT(log.lines().at(1).text, HasSubstr(folder.path("System") + " is a symbolic link"));
}

TEST_F(DlCodeBundleTest, ABundleWithoutItsLibraryIsNamed) {
  folder.makeDirectory(std::string(kPath).substr(1));
  EXPECT_EQ(instance(), nullptr);
  EXPECT_EQ(log.lines(),
            (std::vector<Line>{{LogLevel::error, "loadBundle: " + library_ +
                                                     ": cannot be opened: No such file or directory"}}));
}

TEST_F(DlCodeBundleTest, WhatIsNoLibraryIsNamedWithTheLoadersReason) {
  install(SAMPLE_ADAPTOR);
  std::ofstream(library_) << "no library";
  EXPECT_EQ(instance(), nullptr);
  EXPECT_THAT(log.lines().at(0).text,
              testing::StartsWith("loadBundle: " + library_ + ": cannot be loaded: "));
}

TEST_F(DlCodeBundleTest, ALibraryWithoutTheFunctionIsNamed) {
  install(NO_EXPORT_ADAPTOR);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_FALSE(bundles.bundleWithPath(kPath)->isLoaded());
  EXPECT_THAT(log.lines(),
              ElementsAre(Line{LogLevel::error, "loadBundle: " + library_ +
                                                    ": does not export tarnel_adaptor_class_named; see "
                                                    "tarnel_adaptor.h"}));
}

// What it started when it was loaded may still run.
TEST_F(DlCodeBundleTest, ALibraryWithoutTheFunctionIsLoadedOnceAndStays) {
  install(NO_EXPORT_ADAPTOR);
  ::unsetenv("MISBEHAVING_ADAPTOR_LOADS");
  EXPECT_FALSE(bundles.bundleWithPath(kPath)->load());
  EXPECT_FALSE(bundles.bundleWithPath(kPath)->load());
  EXPECT_STREQ(::getenv("MISBEHAVING_ADAPTOR_LOADS"), "1");
  EXPECT_EQ(log.lines().size(), 1U);
  void* const handle = ::dlopen(library_.c_str(), RTLD_NOW | RTLD_NOLOAD);
  EXPECT_NE(handle, nullptr);
  if (handle != nullptr) ::dlclose(handle);
}

TEST_F(DlCodeBundleTest, AClassOfAnotherVersionIsNamed) {
  install(WRONG_VERSION_ADAPTOR);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_THAT(
      log.lines(),
      ElementsAre(Line{LogLevel::error, "loadBundle: " + library_ +
                                            ": its class DravikAdaptor was built with version 2 of "
                                            "tarnel_adaptor.h, the daemon with version 1; build it anew"}));
}

TEST_F(DlCodeBundleTest, AnIncompleteClassIsNamed) {
  install(INCOMPLETE_ADAPTOR);
  for (const std::string name : {"DravikAdaptor", "WithoutCreate", "WithoutDestroy"}) {
    EXPECT_EQ(instance(name.c_str()), nullptr);
    EXPECT_THAT(log.lines().back().text,
                HasSubstr("its class " + name + " lacks create, destroy or find_method"));
  }
}

TEST_F(DlCodeBundleTest, WithoutAnInstanceThereIsNone) {
  install(NO_INSTANCE_ADAPTOR);
  EXPECT_EQ(instance(), nullptr);
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(DlCodeBundleTest, AnInstanceMayRespondToNothing) {
  install(NO_METHODS_ADAPTOR);
  const auto adaptor = instance();
  ASSERT_NE(adaptor, nullptr);
  EXPECT_FALSE(adaptor->respondsTo(kSelector));
}

TEST_F(DlCodeBundleTest, WhatAnAdaptorThrowsIsCaughtAndLogged) {
  install(THROWING_ADAPTOR);
  EXPECT_EQ(instance("Nothing"), nullptr);
  EXPECT_EQ(instance(), nullptr);
  {
    const auto adaptor = instance("ThrowsLater");
    ASSERT_NE(adaptor, nullptr);
    EXPECT_FALSE(adaptor->respondsTo("unheardOf"));
    adaptor->perform(kSelector, Method{1}, RespCode{2}, Dictionary());
  }
  EXPECT_THAT(
      log.lines(),
      ElementsAre(Line{LogLevel::error, "callBundle: tarnel_adaptor_class_named threw: no class"},
                  Line{LogLevel::error, "callBundle: create threw: no instance today"},
                  Line{LogLevel::error, "callBundle: find_method threw"},
                  Line{LogLevel::error, std::string("callBundle: ") + kSelector + " threw: not this one"},
                  Line{LogLevel::error, "callBundle: destroy threw"}));
}

// What the shipped profile lets a confined daemon do.
TEST_F(DlCodeBundleTest, AConfinedProcessLoadsTheBundleAndNoOther) {
  const std::string path =
      "/System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";
  folder.makeDirectory(path.substr(1));
  folder.copy(SAMPLE_ADAPTOR, path.substr(1) + "/QMXPerformance.so");
  install(SAMPLE_ADAPTOR);
  for (const char* name : {"run", "state", "logs", "etc", "etc/sandbox.d"}) folder.makeDirectory(name);
  folder.copy(TARNEL_SHIPPED_PROFILE, "etc/sandbox.d/com.orvane.tarneld.profile");
  ::setenv("SAMPLE_ADAPTOR_FILE", folder.path("logs/written").c_str(), 1);
  const auto outcome = runInChild([this, &path]() -> std::string {
    preloadLazyFacilities();
    LinuxSandbox sandbox(folder.path("etc"), {{"RUNTIME", folder.path("run")},
                                              {"STATE", folder.path("state")},
                                              {"LOGS", folder.path("logs")},
                                              {"CONFIGURATION", folder.path("etc")},
                                              {"MESSAGE_LOGS", folder.path("logs/messages")},
                                              {"BUNDLE", folder.path("bundle")},
                                              {"BUNDLE_ROOT", folder.path()}});
    if (auto failure = sandbox.enter("com.orvane.tarneld")) return "not confined: " + *failure;
    const auto bundle = bundles.bundleWithPath(path);
    if (bundle == nullptr) return "no bundle";
    if (!bundle->load()) return log.lines().at(0).text;
    const auto adaptor = bundle->classNamed("DravikAdaptor")->newInstance();
    adaptor->perform(kSelector, Method{1}, RespCode{2}, Dictionary{{"a", 1}});
    if (instance() != nullptr) return "loaded one that is out of reach";
    return log.lines().at(0).text;
  });
  EXPECT_THAT(outcome, HasSubstr("cannot be loaded"));
  EXPECT_THAT(outcome, HasSubstr("Permission denied"));
  std::ifstream stream(folder.path("logs/written"));
  std::string line;
  ASSERT_TRUE(std::getline(stream, line));
  EXPECT_EQ(withoutNumber(line), "1/2 a=1");
}

}  // namespace
}  // namespace tarnel
