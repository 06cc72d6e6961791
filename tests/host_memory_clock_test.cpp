// The tracked-memory statistic and the millisecond clock.
#include <gtest/gtest.h>

#include <ctime>

#include "host/control.h"
#include "host/hk.h"

namespace ctl = rkhost::control;

namespace {

struct SmallItem : HK_MemTrackedObject {
  char payload[100];
};

struct Base : HK_MemTrackedObject {
  virtual ~Base() = default;
};
struct Large : Base {
  char payload[5000];
};

std::uint64_t Stat() {
  std::uint64_t value = 0;
  EXPECT_EQ(0, HK_GetMemoryStat(HK_MemStatItemBytes, &value));
  return value;
}

TEST(HostMemory, TrackedObjectsMoveTheStatisticBySize) {
  const std::uint64_t start = Stat();
  auto* small = new SmallItem;
  EXPECT_EQ(start + sizeof(SmallItem), Stat());
  // Deleting through the base frees the size of the whole object.
  Base* large = new Large;
  EXPECT_EQ(start + sizeof(SmallItem) + sizeof(Large), Stat());
  delete small;
  EXPECT_EQ(start + sizeof(Large), Stat());
  delete large;
  EXPECT_EQ(start, Stat());
}

TEST(HostMemory, StatisticCanBeSetAndNeverGoesBelowZero) {
  ctl::SetMemoryStat(1000000);
  EXPECT_EQ(1000000u, Stat());
  auto* item = new SmallItem;
  ctl::SetMemoryStat(10);
  delete item;  // frees more than the statistic holds
  EXPECT_EQ(0u, Stat());
  HK_TrackBytes(7);  // counts from zero, not from a wrapped value
  EXPECT_EQ(7u, Stat());
}

std::uint64_t SystemMonotonicMs() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::uint64_t>(now.tv_sec) * 1000u + static_cast<std::uint64_t>(now.tv_nsec) / 1000000u;
}

TEST(HostClock, MonotonicAndTestClocks) {
  std::uint64_t ms = 0;
  const std::uint64_t before = SystemMonotonicMs();
  ASSERT_EQ(0, HK_MillisecondsSinceBoot(&ms));
  const std::uint64_t after = SystemMonotonicMs();
  EXPECT_LE(before, ms);
  EXPECT_GE(after, ms);

  ctl::UseTestClock(true);
  ctl::SetTestClock(1000);
  ASSERT_EQ(0, HK_MillisecondsSinceBoot(&ms));
  EXPECT_EQ(1000u, ms);
  ctl::AdvanceTestClock(2999);
  ASSERT_EQ(0, HK_MillisecondsSinceBoot(&ms));
  EXPECT_EQ(3999u, ms);
  ctl::UseTestClock(false);
  ASSERT_EQ(0, HK_MillisecondsSinceBoot(&ms));
  EXPECT_LE(after, ms);
}

}  // namespace
