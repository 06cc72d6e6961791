// Executors and QueueOnlyOnce under concurrency: limits, delays, suspend,
// cancel, idle waits, exceptions, many submitters. Timing is observed through
// Snapshot and ExpediteDelayed, never by long sleeps.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/make_shared.hpp>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "plinth/debug.h"
#include "plinth/threads.h"

namespace {

using namespace plinth::threads;
using Clock = std::chrono::steady_clock;

// Blocks tasks until the test opens it.
class Gate {
 public:
  void Wait() {
    std::unique_lock<std::mutex> lock(m_);
    cv_.wait(lock, [this] { return open_; });
  }
  void Open() {
    std::lock_guard<std::mutex> lock(m_);
    open_ = true;
    cv_.notify_all();
  }

 private:
  std::mutex m_;
  std::condition_variable cv_;
  bool open_ = false;
};

// Short bounded polling for a background task's effect.
bool PollUntil(const std::function<bool()>& done) {
  const auto deadline = Clock::now() + std::chrono::seconds(10);
  while (!done()) {
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

// Counts the tasks of one test that run at the same time.
struct Concurrency {
  std::atomic<int> now{0};
  std::atomic<int> max{0};
  std::atomic<int> ran{0};
  void Enter() {
    const int n = ++now;
    int m = max.load();
    while (n > m && !max.compare_exchange_weak(m, n)) {
    }
  }
  void Leave() {
    --now;
    ++ran;
  }
};

// An object bound into a task: counts its destruction and whether it ran.
struct Tracked {
  explicit Tracked(std::atomic<int>& destroyed) : destroyed_(destroyed) {}
  ~Tracked() { ++destroyed_; }
  std::atomic<int>& destroyed_;
  std::atomic<bool> ran{false};
};

boost::shared_ptr<AsyncThreadedExecutor> NewSub(int limit) {
  return CreateSubExecutor(CreateIOBoundExecutor(), limit);
}

TEST(PlinthExecutor, SubExecutorKeepsItsLimitAndRunsInOrder) {
  auto ex = NewSub(2);
  Gate gate;
  Concurrency c;
  std::mutex orderMutex;
  std::vector<int> order;
  for (int i = 0; i < 6; ++i) {
    ex->Submit(
        [&, i] {
          {
            std::lock_guard<std::mutex> lock(orderMutex);
            order.push_back(i);
          }
          c.Enter();
          gate.Wait();
          c.Leave();
        },
        0);
  }
  ASSERT_TRUE(PollUntil([&] { return c.now.load() == 2; }));
  ExecutorSnapshot s = ex->Snapshot();
  EXPECT_EQ(s.running, 2u);
  EXPECT_EQ(s.ready, 4u);
  EXPECT_TRUE(s.delayedMs.empty());
  gate.Open();
  ex->WaitUntilIdle();
  EXPECT_EQ(c.ran.load(), 6);
  EXPECT_EQ(c.max.load(), 2);
  EXPECT_EQ(ex->Snapshot().running, 0u);
  // The two that started first were the first two submitted (the order of
  // the rest is covered with a limit of 1, where it is deterministic).
  ASSERT_EQ(order.size(), 6u);
  EXPECT_EQ(std::set<int>(order.begin(), order.begin() + 2), (std::set<int>{0, 1}));
  EXPECT_EQ(std::set<int>(order.begin(), order.end()), (std::set<int>{0, 1, 2, 3, 4, 5}));
}

TEST(PlinthExecutor, DelayedTasksStartNoEarlierThanAskedAndCanBeExpedited) {
  auto ex = NewSub(2);
  std::atomic<bool> shortDone{false};
  Clock::time_point started;
  const auto submitted = Clock::now();
  ex->Submit(
      [&] {
        started = Clock::now();
        shortDone = true;
      },
      30);
  std::atomic<int> longRuns{0};
  ex->Submit([&] { ++longRuns; }, 60000);

  ExecutorSnapshot s = ex->Snapshot();
  EXPECT_EQ(s.delayedMs.size(), 2u);
  EXPECT_EQ(std::set<std::uint32_t>(s.delayedMs.begin(), s.delayedMs.end()),
            (std::set<std::uint32_t>{30, 60000}));
  ASSERT_TRUE(PollUntil([&] { return shortDone.load(); }));
  EXPECT_GE(started - submitted, std::chrono::milliseconds(30));
  EXPECT_EQ(ex->Snapshot().delayedMs, std::vector<std::uint32_t>{60000});
  EXPECT_EQ(longRuns.load(), 0);

  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ASSERT_TRUE(PollUntil([&] { return longRuns.load() == 1; }));
  ex->WaitUntilIdle();
  EXPECT_TRUE(ex->Snapshot().delayedMs.empty());
  EXPECT_EQ(ex->ExpediteDelayed(), 0u);

  // The I/O executor honours delays too.
  auto io = CreateIOBoundExecutor();
  EXPECT_NE(io, CreateIOBoundExecutor());  // a new executor each call
  std::atomic<bool> ioDone{false};
  Clock::time_point ioStarted;
  const auto ioSubmitted = Clock::now();
  io->Submit(
      [&] {
        ioStarted = Clock::now();
        ioDone = true;
      },
      20);
  ASSERT_TRUE(PollUntil([&] { return ioDone.load(); }));
  EXPECT_GE(ioStarted - ioSubmitted, std::chrono::milliseconds(20));
}

TEST(PlinthExecutor, SuspendLetsRunningTasksFinishAndHoldsTheRest) {
  auto ex = NewSub(1);
  Gate gate;
  std::mutex m;
  std::vector<int> order;
  auto record = [&](int i) {
    std::lock_guard<std::mutex> lock(m);
    order.push_back(i);
  };
  std::atomic<bool> firstStarted{false};
  ex->Submit(
      [&] {
        firstStarted = true;
        gate.Wait();
        record(0);
      },
      0);
  ASSERT_TRUE(PollUntil([&] { return firstStarted.load(); }));
  ex->Suspend();
  for (int i = 1; i <= 3; ++i) ex->Submit([&, i] { record(i); }, 0);
  gate.Open();
  ex->WaitUntilIdle();  // queued tasks of a suspended executor do not count
  ExecutorSnapshot s = ex->Snapshot();
  EXPECT_TRUE(s.suspended);
  EXPECT_EQ(s.running, 0u);
  EXPECT_EQ(s.ready, 3u);
  {
    std::lock_guard<std::mutex> lock(m);
    EXPECT_EQ(order, std::vector<int>{0});
  }
  ex->Resume();
  ex->WaitUntilIdle();
  std::lock_guard<std::mutex> lock(m);
  EXPECT_EQ(order, (std::vector<int>{0, 1, 2, 3}));
  EXPECT_FALSE(ex->Snapshot().suspended);
}

TEST(PlinthExecutor, CancelDropsQueuedAndDelayedTasksWithoutRunningThem) {
  auto ex = NewSub(1);
  Gate gate;
  std::atomic<bool> blockerStarted{false};
  ex->Submit(
      [&] {
        blockerStarted = true;
        gate.Wait();
      },
      0);
  ASSERT_TRUE(PollUntil([&] { return blockerStarted.load(); }));

  std::atomic<int> destroyed{0};
  std::vector<Tracked*> seen;
  auto submitTracked = [&](std::uint32_t delay) {
    auto t = boost::make_shared<Tracked>(destroyed);
    seen.push_back(t.get());
    ex->Submit([t] { t->ran = true; }, delay);
  };
  for (int i = 0; i < 3; ++i) submitTracked(0);
  submitTracked(50);
  submitTracked(60000);
  ExecutorSnapshot s = ex->Snapshot();
  EXPECT_EQ(s.ready, 3u);
  EXPECT_EQ(s.delayedMs.size(), 2u);
  EXPECT_EQ(destroyed.load(), 0);

  ex->Cancel();
  // Destroyed at the cancel, while the blocker still runs: dropped, not run.
  EXPECT_EQ(destroyed.load(), 5);
  EXPECT_TRUE(ex->IsCancelled());
  s = ex->Snapshot();
  EXPECT_TRUE(s.cancelled);
  EXPECT_EQ(s.ready, 0u);
  EXPECT_TRUE(s.delayedMs.empty());
  EXPECT_EQ(s.running, 1u);

  std::atomic<bool> lateRan{false};
  {
    auto late = boost::make_shared<Tracked>(destroyed);
    ex->Submit([late, &lateRan] { lateRan = true; }, 0);
    ex->Submit([late, &lateRan] { lateRan = true; }, 10);
  }
  EXPECT_EQ(destroyed.load(), 6);  // later submissions are dropped at once
  ex->Resume();                    // resuming a cancelled executor starts nothing
  gate.Open();
  ex->WaitUntilIdle();
  EXPECT_EQ(ex->Snapshot().running, 0u);
  EXPECT_FALSE(lateRan.load());
  EXPECT_EQ(ex->ExpediteDelayed(), 0u);
}

TEST(PlinthExecutor, TaskExceptionsAreTracedAndTheSlotIsFreed) {
  std::mutex m;
  std::string traced;
  plinth::debug::SetTraceSink([&](const std::string& text) {
    std::lock_guard<std::mutex> lock(m);
    traced += text;
  });
  auto ex = NewSub(1);
  std::atomic<int> after{0};
  ex->Submit([] { throw std::runtime_error("disk on fire"); }, 0);
  ex->Submit([] { throw 42; }, 0);
  ex->Submit([&] { ++after; }, 0);
  ex->WaitUntilIdle();
  EXPECT_EQ(after.load(), 1);
  auto io = CreateIOBoundExecutor();
  std::atomic<bool> ioAfter{false};
  io->Submit([] { throw std::runtime_error("io task failed"); }, 0);
  io->Submit([&] { ioAfter = true; }, 0);
  ASSERT_TRUE(PollUntil([&] {
    std::lock_guard<std::mutex> lock(m);
    return traced.find("io task failed") != std::string::npos;
  }));
  ASSERT_TRUE(PollUntil([&] { return ioAfter.load(); }));
  plinth::debug::SetTraceSink({});
  EXPECT_NE(traced.find("disk on fire"), std::string::npos) << traced;
  EXPECT_NE(traced.find("non-standard exception"), std::string::npos) << traced;
}

TEST(PlinthExecutor, ManySubmittersExactCountsWithinTheLimit) {
  auto ex = NewSub(3);
  Concurrency c;
  constexpr int kThreads = 8;
  constexpr int kEach = 300;
  std::atomic<int> nested{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < kEach; ++i) {
        ex->Submit(
            [&, i] {
              c.Enter();
              if (i % 50 == 0) ex->Submit([&] { ++nested; }, 0);  // submitting from a task
              c.Leave();
            },
            0);
      }
    });
  }
  for (auto& t : threads) t.join();
  ASSERT_TRUE(PollUntil([&] { return nested.load() == kThreads * (kEach / 50); }));
  ex->WaitUntilIdle();
  EXPECT_EQ(c.ran.load(), kThreads * kEach);
  EXPECT_LE(c.max.load(), 3);
  EXPECT_GE(c.max.load(), 1);
  EXPECT_EQ(ex->Snapshot().running, 0u);
  EXPECT_EQ(ex->Snapshot().ready, 0u);
}

TEST(PlinthExecutor, CancelRacingSubmittersNeitherRunsNorLeaksDroppedTasks) {
  auto ex = NewSub(2);
  std::atomic<int> destroyed{0};
  std::atomic<int> created{0};
  std::atomic<int> ran{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 200; ++i) {
        auto tr = boost::make_shared<Tracked>(destroyed);
        ++created;
        ex->Submit([tr, &ran] { ++ran; }, (t % 2 == 0) ? 0 : 5);
      }
    });
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(2));
  ex->Cancel();
  for (auto& t : threads) t.join();
  ex->WaitUntilIdle();
  const int ranAtIdle = ran.load();
  // Every task is destroyed, run or not; nothing starts after idle.
  EXPECT_EQ(destroyed.load(), created.load());
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_EQ(ran.load(), ranAtIdle);
  EXPECT_LE(ranAtIdle, 800);
}

TEST(PlinthExecutor, CancelledParentDropsAChildsTasksAndTheChildStaysWaitable) {
  auto parent = NewSub(1);
  auto child = CreateSubExecutor(parent, 2);
  parent->Suspend();
  constexpr int kTasks = 20000;  // deep enough to overflow a recursive hand-over
  std::atomic<int> destroyed{0};
  std::atomic<int> ran{0};
  for (int i = 0; i < kTasks; ++i) {
    auto t = boost::make_shared<Tracked>(destroyed);
    child->Submit([t, &ran] { ++ran; }, 0);
  }
  EXPECT_EQ(child->Snapshot().running, 2u);  // handed to the parent
  EXPECT_EQ(child->Snapshot().ready, static_cast<std::size_t>(kTasks - 2));
  EXPECT_EQ(parent->Snapshot().ready, 2u);
  parent->Cancel();
  child->WaitUntilIdle();  // does not hang on tasks the parent dropped
  EXPECT_EQ(ran.load(), 0);
  EXPECT_EQ(destroyed.load(), kTasks);
  const ExecutorSnapshot s = child->Snapshot();
  EXPECT_EQ(s.running, 0u);
  EXPECT_EQ(s.ready, 0u);
}

TEST(PlinthQueueOnlyOnce, OneRunPendingAtATimeAndNoRunAfterDestruction) {
  auto ex = NewSub(1);
  std::atomic<int> runs{0};
  std::atomic<int> pendingDuringJob{-1};
  boost::shared_ptr<QueueOnlyOnce> q;
  q = boost::make_shared<QueueOnlyOnce>(
      [&] {
        pendingDuringJob = q->IsPending() ? 1 : 0;
        ++runs;
      },
      ex, 60000);
  EXPECT_FALSE(q->IsPending());
  q->Queue();
  q->Queue();
  q->Queue();
  EXPECT_TRUE(q->IsPending());
  EXPECT_EQ(ex->Snapshot().delayedMs, std::vector<std::uint32_t>{60000});
  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ex->WaitUntilIdle();
  EXPECT_EQ(runs.load(), 1);
  EXPECT_EQ(pendingDuringJob.load(), 0);  // cleared before the job ran
  EXPECT_FALSE(q->IsPending());

  q->Queue();  // a new run may be queued once the last one started
  EXPECT_EQ(ex->Snapshot().delayedMs.size(), 1u);
  boost::weak_ptr<QueueOnlyOnce> weak = q;
  q.reset();
  EXPECT_TRUE(weak.expired());  // the pending run does not keep it alive
  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ex->WaitUntilIdle();
  EXPECT_EQ(runs.load(), 1);  // the run found no queue and did nothing

  // Many threads queueing at once: at most one pending run at any time.
  auto ex2 = NewSub(4);
  std::atomic<int> runs2{0};
  auto q2 = boost::make_shared<QueueOnlyOnce>([&] { ++runs2; }, ex2, 60000);
  std::vector<std::thread> threads;
  for (int t = 0; t < 6; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 100; ++i) q2->Queue();
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(ex2->Snapshot().delayedMs.size(), 1u);
  EXPECT_EQ(ex2->ExpediteDelayed(), 1u);
  ex2->WaitUntilIdle();
  EXPECT_EQ(runs2.load(), 1);

  // A run dropped by a cancelled executor leaves the queue free again.
  q2->Queue();
  EXPECT_TRUE(q2->IsPending());
  ex2->Cancel();
  EXPECT_FALSE(q2->IsPending());
}

TEST(PlinthThreads, ThreadIdsAreStablePerThreadAndDistinct) {
  const std::uint64_t mine = GetCurrentThreadID();
  EXPECT_EQ(GetCurrentThreadID(), mine);
  std::mutex m;
  std::set<std::uint64_t> ids{mine};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&] {
      const std::uint64_t id = GetCurrentThreadID();
      EXPECT_EQ(GetCurrentThreadID(), id);
      std::lock_guard<std::mutex> lock(m);
      ids.insert(id);
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(ids.size(), 9u);
}

}  // namespace
