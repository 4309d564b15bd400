#include "session/shared_reporting.h"

#include <gtest/gtest.h>

#include "platform/fake/fake_world.h"
#include "tarnel/keys.h"

namespace tarnel::fake {
namespace {

class SharedReportingTest : public ::testing::Test {
 protected:
  SharedReportingTest() {
    backends_.append(kTarnelBackendHTTPPost, backend_);
    reporting_.replaceBackends(backends_);
  }

  FakeWorld world_;
  std::shared_ptr<TarnelBackend> backend_ =
      TarnelBackend::initWithName(world_.dependencies, kTarnelBackendHTTPPost, std::nullopt, std::nullopt);
  BackendSet backends_;
  SharedReporting reporting_;
};

TEST_F(SharedReportingTest, NotesWaitForTheOwnerAndAreAppliedOnce) {
  reporting_.noteSamplingThreshold(kTarnelBackendHTTPPost, Value(0.25));
  reporting_.noteCorrelatedSessionID("TOP.OWN");
  EXPECT_FALSE(backend_->samplingThreshold());
  EXPECT_FALSE(backend_->combinedSessionIDString());
  reporting_.applyNotes(world_.log, backends_);
  EXPECT_EQ(backend_->samplingThreshold(), Value(0.25));
  EXPECT_EQ(backend_->combinedSessionIDString(), "TOP.OWN");
  backend_->setSamplingThreshold(Value(0.5));
  reporting_.applyNotes(world_.log, backends_);
  EXPECT_EQ(backend_->samplingThreshold(), Value(0.5));
}

TEST_F(SharedReportingTest, TheOwnersNewDecisionVoidsAThresholdNotedMeanwhileButNoIdentifier) {
  reporting_.noteSamplingThreshold(kTarnelBackendHTTPPost, Value(0.25));
  reporting_.noteCorrelatedSessionID("TOP.OWN");
  backend_->setSamplingThreshold(Value(0.5));
  reporting_.publish(backends_);
  reporting_.applyNotes(world_.log, backends_);
  EXPECT_EQ(backend_->samplingThreshold(), Value(0.5));
  EXPECT_EQ(reporting_.reports().at(0).samplingThreshold, Value(0.5));
  EXPECT_EQ(backend_->combinedSessionIDString(), "TOP.OWN");
}

TEST_F(SharedReportingTest, ReplacedBackendsVoidEveryNote) {
  reporting_.noteSamplingThreshold(kTarnelBackendHTTPPost, Value(0.25));
  reporting_.noteCorrelatedSessionID("TOP.OWN");
  reporting_.replaceBackends(backends_);
  reporting_.applyNotes(world_.log, backends_);
  EXPECT_FALSE(backend_->samplingThreshold());
  EXPECT_FALSE(backend_->combinedSessionIDString());
}

TEST_F(SharedReportingTest, NothingIsNotedForABackendThatIsNotThere) {
  reporting_.noteSamplingThreshold(kTarnelBackendDashboard, Value(0.25));
  ASSERT_EQ(reporting_.reports().size(), 1U);
  EXPECT_FALSE(reporting_.reports().at(0).samplingThreshold);
}

TEST_F(SharedReportingTest, TheLevelIsShownWithTheDecision) {
  EXPECT_EQ(reporting_.hierarchy(), 0);
  backend_->setHierarchy(3);
  EXPECT_EQ(reporting_.hierarchy(), 0);
  reporting_.publish(backends_);
  EXPECT_EQ(reporting_.hierarchy(), 3);
  EXPECT_EQ(reporting_.reports().at(0).hierarchy, 3);
}

}  // namespace
}  // namespace tarnel::fake
