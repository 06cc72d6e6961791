// The cache lock across threads, and RK_StopAllAsyncWork against tasks that
// are running on the background executor.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/make_shared.hpp>
#include <chrono>
#include <future>
#include <thread>

#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/test_access.h"

TEST(FrameLifecycleMt, SecondThreadWaitsForTheOutermostGuard) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  std::atomic<bool> acquired{false};
  std::atomic<std::uint32_t> countSeenByOther{0};
  std::promise<void> trying;
  std::thread other;
  {
    RK_ScCacheLock outer;
    {
      RK_ScCacheLock inner;
      other = std::thread([&] {
        trying.set_value();
        RK_ScCacheLock lock;
        countSeenByOther = RK_TEST_Access::LockHoldCount(*bag);
        acquired = true;
      });
      trying.get_future().wait();
    }
    // The inner guard is gone but the outer one still holds the lock.
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_FALSE(acquired.load());
  }
  other.join();
  EXPECT_EQ(countSeenByOther.load(), 1u);

  RK_StopAllAsyncWork();
  bag.reset();
  RK_Death();
}

TEST(FrameLifecycleMt, GuardsOnManyThreadsKeepTheCountExact) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  constexpr int kThreads = 4;
  constexpr int kRounds = 2000;
  std::atomic<int> wrongCounts{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < kRounds; ++i) {
        RK_ScCacheLock outer;
        RK_ScCacheLock inner;
        if (RK_TEST_Access::LockHoldCount(*bag) != 2u) ++wrongCounts;
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(wrongCounts.load(), 0);
  RK_StopAllAsyncWork();
  bag.reset();
  RK_Death();
}

TEST(FrameLifecycleMt, StopReturnsOnlyAfterRunningTasksFinishAndDropsWhatTheySubmit) {
  RK_Birth(false);
  boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> executor = RK_TEST_BackgroundExecutor();

  std::promise<void> started;
  std::promise<void> gate;
  std::shared_future<void> gateOpen = gate.get_future().share();
  std::atomic<bool> finished{false};
  auto resubmittedRuns = boost::make_shared<std::atomic<int>>(0);

  // Like a disk cache scan that reschedules itself when it ends.
  executor->Submit(
      [&, executor, resubmittedRuns] {
        started.set_value();
        gateOpen.wait();
        executor->Submit([resubmittedRuns] { ++*resubmittedRuns; }, 0);
        finished = true;
      },
      0);
  started.get_future().wait();

  std::atomic<bool> stopReturned{false};
  std::atomic<bool> finishedWhenStopReturned{false};
  std::thread stopper([&] {
    RK_StopAllAsyncWork();
    finishedWhenStopReturned = finished.load();
    stopReturned = true;
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  EXPECT_FALSE(stopReturned.load());
  gate.set_value();
  stopper.join();

  EXPECT_TRUE(finishedWhenStopReturned.load());
  // The task it submitted after the cancel was dropped, not queued.
  EXPECT_EQ(executor->Snapshot().ready, 0u);
  EXPECT_EQ(resubmittedRuns->load(), 0);
  executor.reset();
  RK_Death();
}
