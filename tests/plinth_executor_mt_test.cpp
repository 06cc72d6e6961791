// Executors and QueueOnlyOnce: limits, delays, suspend, cancel, idle waits,
// and submitters racing each other and a cancel. Timing is observed through
// Snapshot and ExpediteDelayed, never by long sleeps.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/make_shared.hpp>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include "plinth/threads.h"

namespace {

using namespace plinth::threads;
using Clock = std::chrono::steady_clock;
using Delays = std::vector<std::uint32_t>;

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
  std::atomic<int> now{0}, max{0}, ran{0};
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

// An object bound into a task: counts its destruction.
struct Tracked {
  explicit Tracked(std::atomic<int>& destroyed) : destroyed_(destroyed) {}
  ~Tracked() { ++destroyed_; }
  std::atomic<int>& destroyed_;
};

boost::shared_ptr<AsyncThreadedExecutor> NewSub(int limit) {
  return CreateSubExecutor(CreateIOBoundExecutor(), limit);
}

// Submits a task that holds a slot until `gate` opens; returns once it runs.
void Occupy(AsyncExecutor& ex, Gate& gate) {
  auto started = boost::make_shared<std::atomic<bool>>(false);
  ex.Submit(
      [started, &gate] {
        *started = true;
        gate.Wait();
      },
      0);
  ASSERT_TRUE(PollUntil([&] { return started->load(); }));
}

TEST(PlinthExecutor, SubExecutorRunsNoMoreThanItsLimit) {
  auto ex = NewSub(2);
  Gate gate;
  Concurrency c;
  for (int i = 0; i < 6; ++i)
    ex->Submit(
        [&] {
          c.Enter();
          gate.Wait();
          c.Leave();
        },
        0);
  ASSERT_TRUE(PollUntil([&] { return c.now.load() == 2; }));
  const ExecutorSnapshot s = ex->Snapshot();
  EXPECT_EQ(s.running, 2u);
  EXPECT_EQ(s.ready, 4u);
  gate.Open();
  ex->WaitUntilIdle();
  EXPECT_EQ(c.ran.load(), 6);
  EXPECT_EQ(c.max.load(), 2);
}

TEST(PlinthExecutor, DelayedTasksWaitTheirTimeUnlessExpedited) {
  auto ex = NewSub(2);
  std::atomic<int> longRuns{0};
  std::atomic<bool> shortRan{false};
  ex->Submit([&] { ++longRuns; }, 60000);
  const auto submitted = Clock::now();
  Clock::time_point started;
  ex->Submit(
      [&] {
        started = Clock::now();
        shortRan = true;
      },
      30);
  ASSERT_TRUE(PollUntil([&] { return shortRan.load(); }));
  EXPECT_GE(started - submitted, std::chrono::milliseconds(30));
  EXPECT_EQ(ex->Snapshot().delayedMs, Delays{60000});
  EXPECT_EQ(longRuns.load(), 0);

  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ASSERT_TRUE(PollUntil([&] { return longRuns.load() == 1; }));
  EXPECT_TRUE(ex->Snapshot().delayedMs.empty());
}

TEST(PlinthExecutor, SuspendLetsRunningTasksFinishAndHoldsTheRest) {
  auto ex = NewSub(1);
  Gate gate;
  std::atomic<int> ran{0};
  Occupy(*ex, gate);
  ex->Suspend();
  for (int i = 0; i < 3; ++i) ex->Submit([&] { ++ran; }, 0);
  gate.Open();
  ex->WaitUntilIdle();  // queued tasks of a suspended executor do not count
  const ExecutorSnapshot s = ex->Snapshot();
  EXPECT_EQ(s.running, 0u);
  EXPECT_EQ(s.ready, 3u);
  EXPECT_EQ(ran.load(), 0);
  ex->Resume();
  ex->WaitUntilIdle();
  EXPECT_EQ(ran.load(), 3);
}

TEST(PlinthExecutor, CancelDropsQueuedAndDelayedTasksWithoutRunningThem) {
  auto ex = NewSub(1);
  Gate gate;
  Occupy(*ex, gate);
  std::atomic<int> destroyed{0};
  std::atomic<int> ran{0};
  auto submitTracked = [&](std::uint32_t delay) {
    ex->Submit([t = boost::make_shared<Tracked>(destroyed), &ran] { ++ran; }, delay);
  };
  for (std::uint32_t delay : {0, 0, 50, 60000}) submitTracked(delay);
  EXPECT_EQ(destroyed.load(), 0);

  ex->Cancel();
  // Destroyed at the cancel, while the blocker still runs: dropped, not run.
  EXPECT_EQ(destroyed.load(), 4);
  const ExecutorSnapshot s = ex->Snapshot();
  EXPECT_TRUE(s.cancelled);
  EXPECT_EQ(s.ready, 0u);
  EXPECT_TRUE(s.delayedMs.empty());

  submitTracked(0);
  EXPECT_EQ(destroyed.load(), 5);  // later submissions are dropped at once
  ex->Resume();                    // resuming a cancelled executor starts nothing
  gate.Open();
  ex->WaitUntilIdle();
  EXPECT_EQ(ran.load(), 0);
}

TEST(PlinthExecutor, CancelRacingSubmittersNeitherRunsNorLeaksDroppedTasks) {
  auto ex = NewSub(2);
  std::atomic<int> destroyed{0}, created{0}, ran{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 200; ++i, ++created)
        ex->Submit([tr = boost::make_shared<Tracked>(destroyed), &ran] { ++ran; }, (t % 2 == 0) ? 0 : 5);
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
}

TEST(PlinthQueueOnlyOnce, OneRunPerQueueingAndFreeAgainAfterACancel) {
  auto ex = NewSub(1);
  std::atomic<int> runs{0};
  auto q = boost::make_shared<QueueOnlyOnce>([&] { ++runs; }, ex, 60000);
  for (int i = 0; i < 3; ++i) q->Queue();
  EXPECT_TRUE(q->IsPending());
  EXPECT_EQ(ex->Snapshot().delayedMs, Delays{60000});
  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ex->WaitUntilIdle();
  EXPECT_EQ(runs.load(), 1);
  EXPECT_FALSE(q->IsPending());

  q->Queue();  // a new run once the last one started
  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ex->WaitUntilIdle();
  EXPECT_EQ(runs.load(), 2);

  // A run dropped by a cancelled executor leaves the queue free again.
  q->Queue();
  EXPECT_TRUE(q->IsPending());
  ex->Cancel();
  EXPECT_FALSE(q->IsPending());
  EXPECT_EQ(runs.load(), 2);
}

TEST(PlinthQueueOnlyOnce, NoRunAfterTheQueueIsDestroyed) {
  auto ex = NewSub(1);
  std::atomic<int> runs{0};
  auto q = boost::make_shared<QueueOnlyOnce>([&] { ++runs; }, ex, 60000);
  q->Queue();
  boost::weak_ptr<QueueOnlyOnce> weak = q;
  q.reset();
  EXPECT_TRUE(weak.expired());  // the pending run does not keep it alive
  EXPECT_EQ(ex->ExpediteDelayed(), 1u);
  ex->WaitUntilIdle();
  EXPECT_EQ(runs.load(), 0);
}

}  // namespace
