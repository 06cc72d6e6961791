// Traces, the profiler, reference counting and the small-block allocator.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/intrusive_ptr.hpp>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

#include "plinth/allocator.h"
#include "plinth/debug.h"
#include "plinth/refcounted.h"

namespace {

using namespace plinth::debug;
using plinth::utility::RefCountedObject;
using plinth::utility::SmallBlockAllocator;

TEST(PlinthTrace, LevelsAndChangeCount) {
  EXPECT_FALSE(TraceEnabled("DiskCache", 0, true));
  std::uint64_t count = TraceChangeCount();

  SetTraceLevel("DiskCache", 5);
  EXPECT_GT(TraceChangeCount(), count);
  EXPECT_TRUE(TraceEnabled("DiskCache", 5, false));
  EXPECT_FALSE(TraceEnabled("DiskCache", 6, false));
  EXPECT_FALSE(TraceEnabled("RK_Stuff", 1, true));

  count = TraceChangeCount();
  SetTraceLevel("*", 10);
  EXPECT_GT(TraceChangeCount(), count);
  EXPECT_TRUE(TraceEnabled("RK_Stuff", 10, true));  // "*" stands in
  EXPECT_FALSE(TraceEnabled("RK_Stuff", 10, false));
  EXPECT_FALSE(TraceEnabled("DiskCache", 6, true));  // its own setting wins

  count = TraceChangeCount();
  SetTraceLevel("DiskCache", -1);
  EXPECT_GT(TraceChangeCount(), count);
  EXPECT_FALSE(TraceEnabled("DiskCache", 0, true));  // switched off on purpose
}

TEST(PlinthProfiler, ScopesRecordIntervalsIntoANonEmptyLog) {
  CodeProfilerManager& mgr = CodeProfilerManager::Get();
  EXPECT_FALSE(mgr.IsConditionalProfiling());
  mgr.SetConditionalProfiling(true);
  mgr.SetProfilingVolume(6);
  EXPECT_TRUE(mgr.IsConditionalProfiling());
  EXPECT_EQ(mgr.GetProfilingVolume(), 6);

  { CodeProfiler empty{boost::intrusive_ptr<ProfileDataLog>()}; }  // records nowhere, does not crash
  auto log = mgr.CreateNewProfileDataLog("VX.render.RK_Stuff::Checkout", 6);
  for (int i = 0; i < 3; ++i) {
    CodeProfiler p(log);
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  EXPECT_EQ(log->Count(), 3u);
  EXPECT_GE(log->Max(), std::chrono::milliseconds(1));
  const std::string report = mgr.Report();
  EXPECT_NE(report.find("VX.render.RK_Stuff::Checkout volume=6 count=3 "), std::string::npos) << report;

  // The log keeps only the most recent kKeep intervals, oldest first.
  ProfileDataLog ring("ring", 1);
  for (std::size_t i = 0; i < ProfileDataLog::kKeep + 10; ++i) ring.Record(std::chrono::nanoseconds(i));
  const auto kept = ring.Intervals();
  ASSERT_EQ(kept.size(), ProfileDataLog::kKeep);
  EXPECT_EQ(kept.front(), std::chrono::nanoseconds(10));
  EXPECT_EQ(ring.Count(), ProfileDataLog::kKeep + 10);
}

// Counts deletions; its destructor may take and drop a temporary reference
// to itself, as an item's destructor that passes itself to a helper does.
class Counted : public RefCountedObject {
 public:
  Counted(std::atomic<int>& deletions, bool touchSelfInDestructor)
      : deletions_(deletions), touch_(touchSelfInDestructor) {}
  ~Counted() override {
    if (touch_) {
      boost::intrusive_ptr<const Counted> self(this);  // 0 -> 1 -> 0
    }
    ++deletions_;
  }

 private:
  std::atomic<int>& deletions_;
  bool touch_;
};

TEST(PlinthRefCounted, DeletesExactlyOnceOnTheLastRelease) {
  std::atomic<int> deletions{0};
  {
    boost::intrusive_ptr<Counted> a(new Counted(deletions, false));
    boost::intrusive_ptr<Counted> b = a;
    b.reset();
    EXPECT_EQ(deletions.load(), 0);
  }
  EXPECT_EQ(deletions.load(), 1);

  { boost::intrusive_ptr<Counted> c(new Counted(deletions, true)); }
  EXPECT_EQ(deletions.load(), 2);  // the temporary reference did not delete again
}

TEST(PlinthAllocator, BlocksDoNotOverlapAndMayBeFreedOnAnotherThread) {
  std::vector<std::pair<unsigned char*, std::size_t>> blocks;
  for (std::size_t size : {1u, 16u, 256u, 257u, 5000u}) {
    auto* p = static_cast<unsigned char*>(SmallBlockAllocator::Allocate(size));
    ASSERT_NE(p, nullptr);
    std::memset(p, static_cast<int>(size & 0xFF), size);
    blocks.emplace_back(p, size);
  }
  std::thread other([&blocks] {
    for (auto& [p, size] : blocks) {
      for (std::size_t i = 0; i < size; ++i) ASSERT_EQ(p[i], static_cast<unsigned char>(size & 0xFF));
      SmallBlockAllocator::Deallocate(p, size);
    }
  });
  other.join();
}

}  // namespace
