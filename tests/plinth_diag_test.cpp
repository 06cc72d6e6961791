// Traces, the profiler, reference counting, the small-block allocator, the
// client version and the UI state.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/intrusive_ptr.hpp>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

#include "plinth/allocator.h"
#include "plinth/config.h"
#include "plinth/debug.h"
#include "plinth/refcounted.h"
#include "plinthview/ui.h"

namespace {

using namespace plinth::debug;
using plinth::utility::RefCountedObject;
using plinth::utility::SmallBlockAllocator;

TEST(PlinthTrace, LevelsInheritanceAndChangeCount) {
  EXPECT_FALSE(TraceEnabled("DiskCache", 0, true));
  std::uint64_t count = TraceChangeCount();

  SetTraceLevel("DiskCache", 5);
  EXPECT_GT(TraceChangeCount(), count);
  count = TraceChangeCount();
  EXPECT_TRUE(TraceEnabled("DiskCache", 0, false));
  EXPECT_TRUE(TraceEnabled("DiskCache", 5, false));
  EXPECT_FALSE(TraceEnabled("DiskCache", 6, false));
  EXPECT_FALSE(TraceEnabled("RK_Stuff", 1, true));

  SetTraceLevel("*", 10);
  EXPECT_GT(TraceChangeCount(), count);
  EXPECT_TRUE(TraceEnabled("RK_Stuff", 10, true));  // "*" stands in
  EXPECT_FALSE(TraceEnabled("RK_Stuff", 10, false));
  EXPECT_FALSE(TraceEnabled("DiskCache", 6, true));  // its own setting wins

  count = TraceChangeCount();
  SetTraceLevel("DiskCache", -1);
  EXPECT_GT(TraceChangeCount(), count);
  EXPECT_FALSE(TraceEnabled("DiskCache", 0, true));  // switched off on purpose
  EXPECT_FALSE(TraceEnabled("RK_Stuff", -1, true));
  EXPECT_FALSE(TraceEnabled(nullptr, 0, true));

  // The count moves on every change, from any thread, and never goes back.
  count = TraceChangeCount();
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([t] {
      for (int i = 0; i < 50; ++i) {
        SetTraceLevel("cat" + std::to_string(t), i);
        (void)TraceEnabled("cat0", 3, true);
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(TraceChangeCount(), count + 200);

  std::vector<std::string> lines;
  SetTraceSink([&lines](const std::string& text) { lines.push_back(text); });
  Trace("<1> <DiskCache> <5> hello\r\n");
  SetTraceSink({});
  Trace("to stderr, not to the old sink\n");
  EXPECT_EQ(lines, std::vector<std::string>{"<1> <DiskCache> <5> hello\r\n"});
}

TEST(PlinthProfiler, LogsRecordIntervalsOnlyThroughANonEmptyLog) {
  CodeProfilerManager& mgr = CodeProfilerManager::Get();
  EXPECT_EQ(&mgr, &CodeProfilerManager::Get());
  EXPECT_FALSE(mgr.IsConditionalProfiling());
  mgr.SetConditionalProfiling(true);
  mgr.SetProfilingVolume(6);
  EXPECT_TRUE(mgr.IsConditionalProfiling());
  EXPECT_EQ(mgr.GetProfilingVolume(), 6);

  { CodeProfiler empty{boost::intrusive_ptr<ProfileDataLog>()}; }  // records nowhere, does not crash
  auto log = mgr.CreateNewProfileDataLog("VX.render.RK_Stuff::Checkout", 6);
  EXPECT_EQ(log->Count(), 0u);
  for (int i = 0; i < 3; ++i) {
    CodeProfiler p(log);
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  EXPECT_EQ(log->Count(), 3u);
  EXPECT_GE(log->Max(), std::chrono::milliseconds(1));
  EXPECT_GE(log->Total(), 3 * std::chrono::milliseconds(1));
  EXPECT_EQ(log->Intervals().size(), 3u);

  log->Record(std::chrono::nanoseconds(5));
  EXPECT_EQ(log->Intervals().back(), std::chrono::nanoseconds(5));

  const std::string report = mgr.Report();
  EXPECT_NE(report.find("VX.render.RK_Stuff::Checkout volume=6 count=4 "), std::string::npos) << report;
  ASSERT_EQ(mgr.Logs().size(), 1u);
  EXPECT_EQ(mgr.Logs()[0], log);

  // The ring keeps the most recent kKeep intervals, oldest first.
  ProfileDataLog ring("ring", 1);
  for (std::size_t i = 0; i < ProfileDataLog::kKeep + 10; ++i) ring.Record(std::chrono::nanoseconds(i));
  const auto kept = ring.Intervals();
  ASSERT_EQ(kept.size(), ProfileDataLog::kKeep);
  EXPECT_EQ(kept.front(), std::chrono::nanoseconds(10));
  EXPECT_EQ(kept.back(), std::chrono::nanoseconds(ProfileDataLog::kKeep + 9));
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
    EXPECT_EQ(a->RefCountForDiagnostics(), 1u);
    boost::intrusive_ptr<Counted> b = a;
    EXPECT_EQ(a->RefCountForDiagnostics(), 2u);
    b.reset();
    EXPECT_EQ(deletions.load(), 0);
  }
  EXPECT_EQ(deletions.load(), 1);

  { boost::intrusive_ptr<Counted> c(new Counted(deletions, true)); }
  EXPECT_EQ(deletions.load(), 2);  // the temporary reference did not delete again

  // Many threads releasing at once: one deletion.
  boost::intrusive_ptr<Counted> shared(new Counted(deletions, false));
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([copy = shared]() mutable {
      for (int i = 0; i < 1000; ++i) {
        boost::intrusive_ptr<Counted> more = copy;
      }
      copy.reset();
    });
  }
  shared.reset();
  for (auto& t : threads) t.join();
  EXPECT_EQ(deletions.load(), 3);
}

TEST(PlinthAllocator, SmallAndLargeBlocksFromAnyThread) {
  std::vector<std::pair<unsigned char*, std::size_t>> blocks;
  for (std::size_t size : {1u, 15u, 16u, 17u, 100u, 255u, 256u, 257u, 5000u}) {
    auto* p = static_cast<unsigned char*>(SmallBlockAllocator::Allocate(size));
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(p) % 16, 0u);
    std::memset(p, static_cast<int>(size & 0xFF), size);
    blocks.emplace_back(p, size);
  }
  for (auto& [p, size] : blocks) {
    for (std::size_t i = 0; i < size; ++i)
      ASSERT_EQ(p[i], static_cast<unsigned char>(size & 0xFF));  // no overlap
    SmallBlockAllocator::Deallocate(p, size);
  }

  plinth::utility::ByteVector v;
  for (int i = 0; i < 1000; ++i) v.push_back(static_cast<unsigned char>(i));
  EXPECT_EQ(v[999], static_cast<unsigned char>(999 & 0xFF));
  plinth::utility::SmallUString s(u"abc");
  s += u"def";
  EXPECT_EQ(s, plinth::utility::SmallUString(u"abcdef"));

  // Allocated on one thread, freed on another.
  std::vector<void*> handoff(2000);
  std::thread producer([&] {
    for (std::size_t i = 0; i < handoff.size(); ++i) handoff[i] = SmallBlockAllocator::Allocate(1 + i % 256);
  });
  producer.join();
  std::vector<std::thread> consumers;
  for (int t = 0; t < 4; ++t) {
    consumers.emplace_back([&, t] {
      for (std::size_t i = t; i < handoff.size(); i += 4)
        SmallBlockAllocator::Deallocate(handoff[i], 1 + i % 256);
    });
  }
  for (auto& t : consumers) t.join();
}

TEST(PlinthConfigAndUi, VersionAndFrontmostState) {
  EXPECT_EQ(plinth::config::GetClientInternalVersion(), u"1.0");
  plinth::config::SetClientInternalVersion(u"24.1.0x2");
  EXPECT_EQ(plinth::config::GetClientInternalVersion(), u"24.1.0x2");

  using plinthview::ui::UI_NodeManager;
  EXPECT_EQ(UI_NodeManager::Get(true), nullptr);
  UI_NodeManager* m = UI_NodeManager::Get(false);
  ASSERT_NE(m, nullptr);
  EXPECT_EQ(UI_NodeManager::Get(true), m);
  EXPECT_TRUE(m->IsApplicationFrontmost());
  m->SetApplicationFrontmost(false);
  EXPECT_FALSE(UI_NodeManager::Get(true)->IsApplicationFrontmost());
}

}  // namespace
