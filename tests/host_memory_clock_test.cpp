// Memory statistic 6 with tracked allocation, and the millisecond clock.
#include <gtest/gtest.h>

#include <ctime>
#include <memory>

#include "host/control.h"
#include "host/hk.h"

namespace ctl = rkhost::control;

namespace {

struct SmallItem : HK_MemTrackedObject {
  char payload[100];
};

struct Base : HK_MemTrackedObject {
  virtual ~Base() = default;
  int tag = 0;
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
  EXPECT_EQ(start, ctl::MemoryStat());

  void* block = HK_TrackedAlloc(4096);
  ASSERT_NE(nullptr, block);
  HK_TrackBytes(1000);
  EXPECT_EQ(start + 5096, Stat());
  HK_TrackBytes(-1000);
  HK_TrackedFree(block, 4096);
  EXPECT_EQ(start, Stat());
  HK_TrackedFree(nullptr, 4096);  // freeing nothing changes nothing
  EXPECT_EQ(start, Stat());
}

TEST(HostMemory, StatisticCanBeSetAndNeverGoesBelowZero) {
  ctl::SetMemoryStat(1000000);
  EXPECT_EQ(1000000u, Stat());
  auto* item = new SmallItem;
  ctl::SetMemoryStat(10);
  delete item;  // frees more than the statistic holds
  EXPECT_EQ(0u, Stat());
  HK_TrackBytes(-5);
  EXPECT_EQ(0u, Stat());
  HK_TrackBytes(7);
  EXPECT_EQ(7u, ctl::MemoryStat());
}

TEST(HostMemory, FailuresOfTheStatistic) {
  ctl::SetMemoryStat(123);
  std::uint64_t value = 55;
  EXPECT_EQ(HK_ErrUnknownSelector, HK_GetMemoryStat(5, &value));
  EXPECT_EQ(55u, value);
  EXPECT_EQ(HK_ErrBadParameter, HK_GetMemoryStat(HK_MemStatItemBytes, nullptr));
  ctl::FailMemoryStat(-9);
  EXPECT_EQ(-9, HK_GetMemoryStat(HK_MemStatItemBytes, &value));
  EXPECT_EQ(55u, value);
  ctl::FailMemoryStat(0);
  EXPECT_EQ(0, HK_GetMemoryStat(HK_MemStatItemBytes, &value));
  EXPECT_EQ(123u, value);
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
  std::uint64_t later = 0;
  ASSERT_EQ(0, HK_MillisecondsSinceBoot(&later));
  EXPECT_LE(ms, later);
  EXPECT_EQ(HK_ErrBadParameter, HK_MillisecondsSinceBoot(nullptr));

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
