// Write pacing: the write-worthiness threshold, the disk-speed average and
// the pause of background writes (on the host's test clock).
#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::microseconds;
using boost::posix_time::milliseconds;

bool Worth(std::uint32_t size, const boost::posix_time::time_duration& computeTime) {
  auto item = rktest::TestStuff::Make(size);
  return RK_TEST_Access::WorthWritingToDiskCache(*item, computeTime);
}

TEST(PacingTest, WorthWritingNeedsMoreComputeTimeThanTheReadBackEstimate) {
  ASSERT_EQ(RK_TEST_DiskSpeedAverage(), 536870912.0);
  // 2^29 bytes at 2^29 bytes/s: one second to read back.
  EXPECT_FALSE(Worth(536870912u, milliseconds(1000)));
  EXPECT_TRUE(Worth(536870912u, milliseconds(1001)));
  // Small items: one millisecond is the least a read costs, in whole milliseconds.
  EXPECT_TRUE(Worth(1000u, milliseconds(2)));
  EXPECT_FALSE(Worth(1000u, microseconds(1999)));
  // The multiplier scales the estimate.
  RK_TEST_SetProclivityMultiplier(2.0);
  EXPECT_FALSE(Worth(536870912u, milliseconds(2000)));
  EXPECT_TRUE(Worth(536870912u, milliseconds(2001)));
}

TEST(PacingTest, SpeedSamplesFollowTheirRules) {
  double expected = 536870912.0;
  RK_TEST_OfferDiskSpeedSample(true, 1000, 0.0);  // no time, no sample
  EXPECT_EQ(RK_TEST_DiskSpeedSamples(), 0);

  // Writes seed the average: 20 are taken, the rest ignored.
  for (int i = 0; i < 25; ++i) RK_TEST_OfferDiskSpeedSample(true, 50000000, 0.5);  // 1e8 B/s
  for (int i = 0; i < 20; ++i) expected = 0.9 * expected + 0.1 * 1e8;
  EXPECT_DOUBLE_EQ(RK_TEST_DiskSpeedAverage(), expected);
  EXPECT_EQ(RK_TEST_DiskSpeedSamples(), 20);

  // Reads always count.
  RK_TEST_OfferDiskSpeedSample(false, 100000000, 0.5);  // 2e8 B/s
  expected = 0.9 * expected + 0.1 * 2e8;
  EXPECT_DOUBLE_EQ(RK_TEST_DiskSpeedAverage(), expected);

  // At the cap: dropped. Just below: taken.
  RK_TEST_SetSpeedAverageCap(1e8);
  RK_TEST_OfferDiskSpeedSample(false, 50000000, 0.5);
  EXPECT_EQ(RK_TEST_DiskSpeedSamples(), 21);
  RK_TEST_OfferDiskSpeedSample(false, 49999999, 0.5);
  expected = 0.9 * expected + 0.1 * 99999998.0;
  EXPECT_DOUBLE_EQ(RK_TEST_DiskSpeedAverage(), expected);
}

class PacingPauseTest : public ::testing::Test {
 protected:
  void SetUp() override {
    rkhost::control::UseTestClock(true);
    rkhost::control::SetTestClock(100000);
    RK_Birth(false);
  }
  void TearDown() override {
    RK_StopAllAsyncWork();
    RK_Death();
    rkhost::control::UseTestClock(false);
  }
  static bool Suspended() { return RK_TEST_BackgroundExecutor()->Snapshot().suspended; }
};

TEST_F(PacingPauseTest, PauseLastsUntilThreeQuietSecondsAndOutlivesNoExecutor) {
  ASSERT_FALSE(Suspended());
  RK_DeprioritizeBackgroundWrites();
  EXPECT_TRUE(Suspended());
  rkhost::control::AdvanceTestClock(2000);
  RK_DeprioritizeBackgroundWrites();  // at 102000
  rkhost::control::AdvanceTestClock(2999);
  RK_TEST_CheckResumeBackgroundWrites();
  EXPECT_TRUE(Suspended());
  rkhost::control::AdvanceTestClock(1);  // 105000: 3 s after the second call
  RK_TEST_CheckResumeBackgroundWrites();
  EXPECT_FALSE(Suspended());

  // After stopping only the time is recorded: there is nothing to resume.
  RK_StopAllAsyncWork();
  rkhost::control::SetTestClock(7000);
  RK_DeprioritizeBackgroundWrites();
  EXPECT_EQ(RK_TEST_LastDeprioritizeTime(), 7000u);
  RK_TEST_CheckResumeBackgroundWrites();
  EXPECT_FALSE(RK_TEST_BackgroundExecutor());
}

}  // namespace
