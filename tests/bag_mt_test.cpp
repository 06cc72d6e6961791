// Entering items, superseding, reclaiming, purging and size queries from
// several threads at once; afterwards bag, directory, items and the memory
// statistic must agree exactly.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using rktest::Journal;
using rktest::TestStuff;
using rktest::TestStuffPtr;

TEST(BagConcurrencyTest, EnteringAndFreeingConcurrentlyKeepsBagDirectoryAndStatisticInStep) {
  // Bag and directory are tracked allocations too: read the statistic
  // before and after they exist.
  rkhost::control::SetMemoryStat(1u << 20);
  const std::uint64_t unborn = rkhost::control::MemoryStat();
  RK_Birth(false);
  auto bag = RK_GlobalBag();
  auto dir = RK_GlobalSortDir();
  const std::uint64_t base = rkhost::control::MemoryStat();
  auto journal = std::make_shared<Journal>();

  constexpr int kWriters = 3;
  constexpr int kPerWriter = 2000;
  constexpr std::uint32_t kSize = 10;
  // Every writer also enters items of one GUID that it shares with the
  // others; those supersede each other (only the newest may survive).
  const auto shared = TestStuff::Make();
  const auto destroyed = [&] {
    int n = 0;
    for (int w = 0; w < kWriters; ++w) n += journal->Count("w" + std::to_string(w) + ":destroyed");
    return n;
  };
  std::atomic<bool> writersDone{false};
  std::atomic<int> queries{0};

  std::vector<std::thread> threads;
  for (int w = 0; w < kWriters; ++w) {
    threads.emplace_back([&, w] {
      for (int i = 0; i < kPerWriter; ++i) {
        auto item = TestStuff::Make(kSize, true, true, journal, "w" + std::to_string(w));
        if (i % 10 == 0) item->SetGuid(shared->GetGuid());
        // Some items are also on disk, so the first pass has work too.
        if (i % 3 == 0) item->SetOnDisk(true);
        item->AddToBagAndSortDir(bag, {});
      }
    });
  }
  threads.emplace_back([&] {
    // The walkers pause between rounds: the lock is not fair, and walks
    // back to back could keep the writers out for a long time.
    while (!writersDone.load()) {
      bag->FreeUpSomeMemory(20 * kSize);
      std::this_thread::sleep_for(std::chrono::microseconds(50));
    }
  });
  threads.emplace_back([&] {
    while (!writersDone.load()) {
      std::uint64_t memory = 0, disk = 0;
      bag->GetCacheSizesInBytes(memory, disk);
      if (queries.fetch_add(1) % 50 == 0) bag->PurgeAllMemoryCaches();
      std::this_thread::sleep_for(std::chrono::microseconds(50));
    }
  });
  for (int w = 0; w < kWriters; ++w) threads[w].join();
  writersDone.store(true);
  for (std::size_t t = kWriters; t < threads.size(); ++t) threads[t].join();

  // Bag and directory hold exactly the same items, each linked to both.
  const std::vector<RK_Stuff*> inBag = RK_TEST_Access::Order(*bag);
  ASSERT_EQ(inBag.size(), dir->GetStuffCount());
  std::uint64_t inMemoryBytes = 0;
  int sharedGroup = 0;
  for (RK_Stuff* s : inBag) {
    EXPECT_EQ(s->GetBag(), bag);
    EXPECT_EQ(s->GetSortDir(), dir);
    if (static_cast<TestStuff*>(s)->IsInMemory()) inMemoryBytes += kSize;
    if (s->GetGuid() == shared->GetGuid()) ++sharedGroup;
  }
  // Last use order holds.
  for (std::size_t i = 1; i < inBag.size(); ++i)
    EXPECT_LE(inBag[i - 1]->GetLastUseTime(), inBag[i]->GetLastUseTime());
  // The shared GUID's items supersede each other: at most one survives.
  EXPECT_LE(sharedGroup, 1);
  // Every item entered either is still held or was destroyed, exactly once.
  EXPECT_EQ(destroyed() + static_cast<int>(inBag.size()), kWriters * kPerWriter);
  // The statistic moved only by what the surviving items hold.
  EXPECT_EQ(rkhost::control::MemoryStat() - base, inMemoryBytes);
  EXPECT_TRUE(rkhost::control::Snapshot().verifications.empty());
  EXPECT_GT(queries.load(), 0);

  bag.reset();
  dir.reset();
  RK_StopAllAsyncWork();
  RK_Death();
  // The directory's end released every item; none is left behind.
  EXPECT_EQ(destroyed(), kWriters * kPerWriter);
  EXPECT_EQ(rkhost::control::MemoryStat(), unborn);
}

}  // namespace
