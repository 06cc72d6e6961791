// Memory reclamation driven by the host's memory statistic 6: the two
// passes, where they stop, what they never touch, nesting, the log line.
#include <algorithm>

#include "support/module_fixture.h"

namespace {

using Lines = std::vector<std::string>;

class ReclaimTest : public rktest::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    rkhost::control::SetMemoryStat(1000000);
  }
  void TearDown() override {
    rkhost::control::FailMemoryStat(0);
    ModuleTest::TearDown();
  }
  // `count` items of 100 bytes, oldest first, those in onDisk also on disk;
  // the cache holds the only reference.
  std::vector<RK_Stuff*> EnterItems(int count, std::vector<int> onDisk = {}, bool track = true) {
    std::vector<RK_Stuff*> out;
    for (int i = 0; i < count; ++i) {
      auto item = Make("i" + std::to_string(i), 100, true, track);
      item->SetOnDisk(std::find(onDisk.begin(), onDisk.end(), i) != onDisk.end());
      out.push_back(Enter(item).get());
    }
    return out;
  }
  static Lines PurgeLines() {
    Lines out;
    for (const auto& line : rkhost::control::Snapshot().logLines)
      if (line.tag == "PURGE_STATS") {
        EXPECT_EQ(line.module, "RK");
        EXPECT_EQ(line.level, 0);
        out.push_back(line.text);
      }
    return out;
  }
  static std::uint64_t Stat() { return rkhost::control::MemoryStat(); }
};

TEST_F(ReclaimTest, FreesDiskBackedMemoryFirstThenDropsOldestMemoryOnlyItems) {
  auto items = EnterItems(5, {1, 3});
  ASSERT_EQ(Stat(), 1000500u);
  const auto changes = dir->GetLastChangeTime();
  // Pass 1 frees i1 and i3 (200), pass 2 drops i0 (300 > 250) and stops.
  EXPECT_EQ(bag->FreeUpSomeMemory(250), RK_Bag::FreeUpResult_FreedEnough);
  EXPECT_EQ(Stat(), 1000200u);
  EXPECT_EQ(PurgeLines(), Lines{"numFreed:1, numWalked:6, Total: 4"});
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{items[1], items[2], items[3], items[4]}));
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 3);  // two memory releases, one removal
}

TEST_F(ReclaimTest, ResultsAtTheEdges) {
  EnterItems(4, {0, 1, 2, 3});
  // All on disk and freeing it all is not enough: FreedSome, nothing dropped.
  EXPECT_EQ(bag->FreeUpSomeMemory(10000), RK_Bag::FreeUpResult_FreedSome);
  EXPECT_EQ(Stat(), 1000000u);
  EXPECT_EQ(bag->GetStuffCount(), 4u);
  EXPECT_EQ(bag->FreeUpSomeMemory(0), RK_Bag::FreeUpResult_NothingFreed);
  EXPECT_EQ(PurgeLines(), (Lines{"numFreed:0, numWalked:8, Total: 4", "numFreed:0, numWalked:8, Total: 4"}));
}

TEST_F(ReclaimTest, UntrackedItemsAreDroppedButNothingCountsAsFreed) {
  EnterItems(3, {}, false);
  EXPECT_EQ(bag->FreeUpSomeMemory(50), RK_Bag::FreeUpResult_NothingFreed);
  EXPECT_EQ(PurgeLines(), Lines{"numFreed:3, numWalked:6, Total: 0"});
}

TEST_F(ReclaimTest, CheckedOutItemsAreWalkedButNeverFreed) {
  auto items = EnterItems(3, {1});
  for (RK_Stuff* s : items) RK_TEST_Access::SetCheckoutCount(*s, 1);
  EXPECT_EQ(bag->FreeUpSomeMemory(1), RK_Bag::FreeUpResult_NothingFreed);
  EXPECT_EQ(PurgeLines(), Lines{"numFreed:0, numWalked:6, Total: 3"});
  // Dropping a checked-out item directly, or purging, does nothing either.
  items[0]->RemoveFromBagAndSortDir();
  bag->PurgeAllMemoryCaches();
  EXPECT_EQ(Stat(), 1000300u);
  EXPECT_EQ(bag->GetStuffCount(), 3u);
  for (RK_Stuff* s : items) RK_TEST_Access::SetCheckoutCount(*s, 0);
}

TEST_F(ReclaimTest, NestedCallsFreeNothingAndFailuresOfTheStatisticPassThrough) {
  EnterItems(2);
  {
    RK_ScCacheLock lock;
    EXPECT_EQ(bag->FreeUpSomeMemory(0), RK_Bag::FreeUpResult_NothingFreed);
  }
  rkhost::control::FailMemoryStat(42);
  EXPECT_EQ(rktest::ThrownCode([&] { bag->FreeUpSomeMemory(0); }), 42);
  EXPECT_TRUE(PurgeLines().empty());
  EXPECT_EQ(bag->GetStuffCount(), 2u);
}

TEST_F(ReclaimTest, PurgeFreesEverythingAndKeepsOnlyDiskBackedItems) {
  auto items = EnterItems(4, {2});
  const auto changes = dir->GetLastChangeTime();
  bag->PurgeAllMemoryCaches();
  EXPECT_EQ(Stat(), 1000000u);
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{items[2]});
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 7);  // four memory releases, three removals
}

TEST_F(ReclaimTest, FreeUpAsMuchAsPossibleReportsWhetherMemoryWasFreed) {
  auto item = Make("x", 100, true, true);
  item->SetOnDisk(true);
  Enter(item);
  item->SetFreeMemoryRefuses(true);
  EXPECT_FALSE(RK_TEST_Access::FreeUpAsMuchAsPossible(*item));
  item->SetFreeMemoryRefuses(false);
  EXPECT_TRUE(RK_TEST_Access::FreeUpAsMuchAsPossible(*item));
  EXPECT_EQ(item->GetBag(), bag);  // on disk: stays indexed
  // Already free: FreeMemory is not asked again.
  EXPECT_FALSE(RK_TEST_Access::FreeUpAsMuchAsPossible(*item));
  EXPECT_EQ(journal->Count("x:FreeMemory"), 2);
  // Without its disk copy it holds nothing and leaves.
  item->SetOnDisk(false);
  EXPECT_FALSE(RK_TEST_Access::FreeUpAsMuchAsPossible(*item));
  EXPECT_FALSE(item->GetBag());
}

}  // namespace
