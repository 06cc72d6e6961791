// Entering items, superseding, reclaiming, purging and size queries from
// several threads at once; afterwards bag, directory, items and the memory
// statistic must agree exactly.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using rktest::TestStuff;

TEST(BagConcurrencyTest, EnteringAndFreeingConcurrentlyKeepsBagDirectoryAndStatisticInStep) {
  rkhost::control::SetMemoryStat(1u << 20);
  const std::uint64_t unborn = rkhost::control::MemoryStat();
  RK_Birth(false);
  auto bag = RK_GlobalBag();
  auto dir = RK_GlobalSortDir();
  const std::uint64_t base = rkhost::control::MemoryStat();  // bag and directory are tracked too
  auto journal = std::make_shared<rktest::Journal>();

  constexpr int kWriters = 3;
  constexpr int kPerWriter = 2000;
  constexpr std::uint32_t kSize = 10;
  // Items of one shared GUID supersede each other: only the newest may survive.
  const auto shared = TestStuff::Make();
  const auto destroyed = [&] {
    int n = 0;
    for (int w = 0; w < kWriters; ++w) n += journal->Count("w" + std::to_string(w) + ":destroyed");
    return n;
  };
  std::atomic<bool> writersDone{false};

  std::vector<std::thread> threads;
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      for (int i = 0; i < kPerWriter; ++i) {
        auto item = TestStuff::Make(kSize, true, true, journal, "w" + std::to_string(w));
        if (i % 10 == 0) item->SetGuid(shared->GetGuid());
        if (i % 3 == 0) item->SetOnDisk(true);  // work for the first pass too
        item->AddToBagAndSortDir(bag, {});
      }
    });
  }
  // The walkers pause between rounds: the lock is not fair.
  threads.emplace_back([&] {
    while (!writersDone.load()) {
      bag->FreeUpSomeMemory(20 * kSize);
      std::this_thread::sleep_for(std::chrono::microseconds(50));
    }
  });
  threads.emplace_back([&] {
    for (int round = 0; !writersDone.load(); ++round) {
      std::uint64_t memory = 0, disk = 0;
      bag->GetCacheSizesInBytes(memory, disk);
      if (round % 50 == 0) bag->PurgeAllMemoryCaches();
      std::this_thread::sleep_for(std::chrono::microseconds(50));
    }
  });
  for (int w = 0; w < kWriters; ++w) threads[w].join();
  writersDone.store(true);
  for (std::size_t t = kWriters; t < threads.size(); ++t) threads[t].join();

  const std::vector<RK_Stuff*> inBag = RK_TEST_Access::Order(*bag);
  ASSERT_EQ(inBag.size(), dir->GetStuffCount());
  std::uint64_t inMemoryBytes = 0;
  int sharedGroup = 0;
  for (std::size_t i = 0; i < inBag.size(); ++i) {
    EXPECT_EQ(inBag[i]->GetSortDir(), dir);
    if (static_cast<TestStuff*>(inBag[i])->IsInMemory()) inMemoryBytes += kSize;
    if (inBag[i]->GetGuid() == shared->GetGuid()) ++sharedGroup;
    if (i > 0) {
      EXPECT_LE(inBag[i - 1]->GetLastUseTime(), inBag[i]->GetLastUseTime());
    }
  }
  EXPECT_LE(sharedGroup, 1);
  EXPECT_EQ(destroyed() + static_cast<int>(inBag.size()), kWriters * kPerWriter);
  EXPECT_EQ(rkhost::control::MemoryStat() - base, inMemoryBytes);
  EXPECT_TRUE(rkhost::control::Snapshot().verifications.empty());

  bag.reset();
  dir.reset();
  RK_StopAllAsyncWork();
  RK_Death();
  EXPECT_EQ(destroyed(), kWriters * kPerWriter);
  EXPECT_EQ(rkhost::control::MemoryStat(), unborn);
}

}  // namespace
