#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "platform/fake/fake_clock.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/notices.h"
#include "tools/receiving/stored_files.h"

namespace tarnel::lab {

// What the receivers of files and of log data stand on: a folder of the test's own, and nobody who listens.
class StoringReceiverTest : public ::testing::Test {
 protected:
  // folderPrefix: the name of the folder begins with it.
  explicit StoringReceiverTest(const std::string& folderPrefix)
      : folder_(::testing::TempDir() + folderPrefix +
                ::testing::UnitTest::GetInstance()->current_test_info()->name()) {
    std::filesystem::remove_all(folder_);
    std::filesystem::create_directories(folder_);
    EXPECT_FALSE(files_.open());
  }
  ~StoringReceiverTest() override { std::filesystem::remove_all(folder_); }

  class Silence final : public Notices {
   public:
    void storebagServed(const ServedStorebag&) override {}
    void warning(const std::string&) override {}
  };

  const std::string folder_;
  ArrivalStore store_{100};
  Misbehaviours misbehaviours_;
  fake::FakeClock clock_;
  Silence notices_;
  StoredFiles files_{folder_, notices_, {}};
};

}  // namespace tarnel::lab
