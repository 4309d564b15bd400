#include <dlfcn.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/fake/fake_log.h"
#include "platform/linux/bundles/dl_code_bundle.h"
#include "platform/linux/bundles/trusted_folder_test_support.h"

// What tarnel_adaptor.h promises about threads and lifetimes, as an adaptor sees it.

namespace tarnel {
namespace {

constexpr char kPath[] = "/Probe.framework";
constexpr char kSelector[] = "sendMessageWithMethod:respCode:dict:";

class AdaptorThreadsTest : public testing::Test {
 protected:
  AdaptorThreadsTest() {
    folder.makeDirectory("Probe.framework");
    folder.copy(PROBE_ADAPTOR, "Probe.framework/Probe.so");
  }
  std::shared_ptr<BundleClass> adaptorClass() {
    const auto bundle = bundles.bundleWithPath(kPath);
    return bundle != nullptr && bundle->load() ? bundle->classNamed("DravikAdaptor") : nullptr;
  }
  // What the adaptor counted; -1 when it is not loaded.
  int count(const char* what) const {
    void* const handle = ::dlopen(folder.path("Probe.framework/Probe.so").c_str(), RTLD_NOW | RTLD_NOLOAD);
    if (handle == nullptr) return -1;
    const auto counter = reinterpret_cast<int (*)(const char*)>(::dlsym(handle, "probe_count"));
    const int counted = counter == nullptr ? -1 : counter(what);
    ::dlclose(handle);
    return counted;
  }
  template <class Body>
  static void onThreads(int number, const Body& body) {
    std::vector<std::thread> threads;
    for (int i = 0; i < number; ++i) threads.emplace_back(body);
    for (std::thread& thread : threads) thread.join();
  }

  const TrustedFolder folder;
  fake::FakeLog log;
  DlCodeBundles bundles{folder.path(), log};
};

TEST_F(AdaptorThreadsTest, TheLibraryIsAskedForClassesByOneThreadAtATime) {
  onThreads(4, [this] {
    for (int i = 0; i < 500; ++i) EXPECT_NE(adaptorClass(), nullptr);
  });
  EXPECT_EQ(count("lookups at once"), 1);
}

TEST_F(AdaptorThreadsTest, MethodsOfDifferentInstancesRunAtTheSameTime) {
  const auto found = adaptorClass();
  ASSERT_NE(found, nullptr);
  onThreads(2, [&found] {
    const auto instance = found->newInstance();
    instance->perform(kSelector, Method{1}, RespCode{2}, Dictionary{{"meet", true}});
  });
  EXPECT_EQ(count("met"), 2);
  EXPECT_EQ(count("overlaps"), 0);
}

TEST_F(AdaptorThreadsTest, EveryInstanceIsDestroyedOnceAfterItsLastCallAndTheLibraryStays) {
  auto found = adaptorClass();
  ASSERT_NE(found, nullptr);
  onThreads(4, [&found] {
    for (int i = 0; i < 50; ++i) {
      const auto instance = found->newInstance();
      EXPECT_TRUE(instance->respondsTo(kSelector));
      instance->perform(kSelector, Method{1}, RespCode{2}, std::nullopt);
    }
  });
  EXPECT_EQ(count("created"), 200);
  EXPECT_EQ(count("destroyed"), 200);
  EXPECT_EQ(count("overlaps"), 0);
  found.reset();
  EXPECT_EQ(count("created"), 200) << "what it counted was lost with the library";
}

// Whatever stands at the path later, a loaded library is the one that is used.
TEST_F(AdaptorThreadsTest, ANewLibraryCountsAfterARestart) {
  ASSERT_NE(adaptorClass(), nullptr);
  ASSERT_EQ(::rename(folder.path("Probe.framework/Probe.so").c_str(), folder.path("kept.so").c_str()), 0);
  folder.copy(SAMPLE_ADAPTOR, "Probe.framework/Probe.so");
  const auto instance = adaptorClass()->newInstance();
  void* const handle = ::dlopen(folder.path("kept.so").c_str(), RTLD_NOW | RTLD_NOLOAD);
  ASSERT_NE(handle, nullptr);
  const auto counter = reinterpret_cast<int (*)(const char*)>(::dlsym(handle, "probe_count"));
  EXPECT_EQ(counter("created"), 1);
  ::dlclose(handle);
}

}  // namespace
}  // namespace tarnel
