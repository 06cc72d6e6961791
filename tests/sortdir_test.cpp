// The sort directory: group order, the supersede step, removal checks, the
// change count, destruction, and entering items with AddToBagAndSortDir
// (its rollback and its background-write decision).
#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>
#include <string>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::microseconds;
using boost::posix_time::milliseconds;
using rktest::Journal;
using rktest::TestStuff;
using rktest::TestStuffPtr;

class SortDirTest : public ::testing::Test {
 protected:
  void SetUp() override {
    rkhost::control::MakeCurrentThreadMain();
    RK_Birth(false);
    bag = RK_GlobalBag();
    dir = RK_GlobalSortDir();
    rkhost::control::ClearCaptured();
  }
  void TearDown() override {
    bag.reset();
    dir.reset();
    RK_StopAllAsyncWork();
    RK_Death();
    rkhost::control::UseTestClock(false);
  }

  // An item with the GUID of `like` (or its own), named for the journal.
  TestStuffPtr Make(const std::string& name, const TestStuffPtr& like = nullptr, bool inMemory = true) {
    auto item = TestStuff::Make(1000, inMemory, false, journal, name);
    if (like) item->SetGuid(like->GetGuid());
    return item;
  }
  template <class F>
  static int ThrownCode(F&& f) {
    try {
      f();
    } catch (int code) {
      return code;
    }
    return -1;
  }

  boost::shared_ptr<RK_Bag> bag;
  boost::shared_ptr<RK_SortDir> dir;
  std::shared_ptr<Journal> journal = std::make_shared<Journal>();
};

TEST_F(SortDirTest, KeepsTheItemsOfOneGuidInTheOrderTheyWereAdded) {
  std::vector<TestStuffPtr> group;
  std::vector<RK_Stuff*> expected;
  for (int i = 0; i < 8; ++i) {
    auto item = Make("g" + std::to_string(i), group.empty() ? nullptr : group.front());
    item->SetCanSatisfy([](const RK_Stuff*) { return false; });
    dir->AddStuff(item);
    group.push_back(item);
    expected.push_back(item.get());
    EXPECT_EQ(RK_TEST_Access::Group(*dir, *item), expected) << "after " << i + 1;
  }
  // Enough other groups to make the container rehash several times.
  std::vector<TestStuffPtr> others;
  for (int i = 0; i < 300; ++i) {
    others.push_back(Make("o"));
    dir->AddStuff(others.back());
  }
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *group.front()), expected);
  EXPECT_EQ(dir->GetStuffCount(), 308u);

  // Removing from the middle keeps the rest in order; a new item goes last.
  dir->RemoveStuff(group[3].get());
  expected.erase(expected.begin() + 3);
  auto last = Make("last", group.front());
  last->SetCanSatisfy([](const RK_Stuff*) { return false; });
  dir->AddStuff(last);
  expected.push_back(last.get());
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *group.front()), expected);
}

TEST_F(SortDirTest, SupersedesOnlyWhatTheNewItemCanStandInFor) {
  // Kept: the new item cannot satisfy the old one.
  auto a = Make("a");
  a->AddToBagAndSortDir(bag, {});
  auto b = Make("b", a);
  b->SetCanSatisfy([](const RK_Stuff*) { return false; });
  auto changes = dir->GetLastChangeTime();
  b->AddToBagAndSortDir(bag, {});
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *a), (std::vector<RK_Stuff*>{a.get(), b.get()}));
  EXPECT_EQ(journal->Count("b:CanSatisfyRequest"), 1);

  // Dropped: c can stand in for a and b (both in memory); they leave
  // directory and bag and free their memory.
  auto c = Make("c", a);
  const RK_Stuff* asked = nullptr;
  c->SetCanSatisfy([&](const RK_Stuff* request) {
    asked = request;
    return true;
  });
  changes = dir->GetLastChangeTime();
  c->AddToBagAndSortDir(bag, {});
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 3);
  EXPECT_EQ(asked, b.get());  // asked about each, in group order
  EXPECT_EQ(journal->Count("c:CanSatisfyRequest"), 2);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *a), std::vector<RK_Stuff*>{c.get()});
  EXPECT_EQ(RK_TEST_Access::Order(*bag), std::vector<RK_Stuff*>{c.get()});
  EXPECT_FALSE(a->GetBag());
  EXPECT_FALSE(a->GetSortDir());
  EXPECT_FALSE(a->IsInMemory());
  EXPECT_FALSE(b->IsInMemory());

  // Dropped without asking: an old item that holds no data at all.
  c->SetInMemory(false);
  c->SetOnDisk(false);
  auto d = Make("d", c);
  d->SetCanSatisfy([](const RK_Stuff*) { return false; });
  changes = dir->GetLastChangeTime();
  d->AddToBagAndSortDir(bag, {});
  EXPECT_EQ(journal->Count("d:CanSatisfyRequest"), 0);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 2);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *c), std::vector<RK_Stuff*>{d.get()});
  EXPECT_FALSE(c->GetBag());
  EXPECT_TRUE(rkhost::control::Snapshot().verifications.empty());
}

TEST_F(SortDirTest, DropsACheckedOutItemInPlace) {
  auto held = Make("held");
  held->AddToBagAndSortDir(bag, {});
  RK_TEST_Access::SetCheckoutCount(*held, 1);
  auto newer = Make("newer", held);
  const auto changes = dir->GetLastChangeTime();
  newer->AddToBagAndSortDir(bag, {});

  // Out of bag and directory, but alive for its holder with its data.
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *held), std::vector<RK_Stuff*>{newer.get()});
  EXPECT_EQ(RK_TEST_Access::Order(*bag), std::vector<RK_Stuff*>{newer.get()});
  EXPECT_FALSE(held->GetBag());
  EXPECT_FALSE(held->GetSortDir());
  EXPECT_TRUE(held->IsInMemory());
  EXPECT_EQ(journal->Count("held:FreeMemory"), 0);
  EXPECT_EQ(journal->Count("held:destroyed"), 0);
  // Only the addition counts: the in-place drop is not a RemoveStuff.
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);

  RK_TEST_Access::SetCheckoutCount(*held, 0);
  held.reset();
  EXPECT_EQ(journal->Count("held:destroyed"), 1);
}

TEST_F(SortDirTest, RemovalChecksAndChangeCount) {
  auto a = Make("a");
  dir->AddStuff(a);
  auto changes = dir->GetLastChangeTime();

  // Checked out writeable: refused although it is in the right directory.
  RK_TEST_Access::SetCheckoutCount(*a, 1);
  RK_TEST_Access::SetCheckedOutWriteable(*a, true);
  EXPECT_EQ(ThrownCode([&] { dir->RemoveStuff(a.get()); }), RK_InternalErrorCode);
  EXPECT_EQ(dir->GetStuffCount(), 1u);
  RK_TEST_Access::SetCheckedOutWriteable(*a, false);
  RK_TEST_Access::SetCheckoutCount(*a, 0);

  dir->RemoveStuff(a.get());
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_EQ(dir->GetStuffCount(), 0u);
  EXPECT_FALSE(a->GetSortDir());
  // Twice: the link is gone now.
  EXPECT_EQ(ThrownCode([&] { dir->RemoveStuff(a.get()); }), RK_InternalErrorCode);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);

  // An item that names the directory but is not indexed (as during a
  // writeable check-out) is unlinked and still counts as a change.
  RK_TEST_Access::SortDirLink(*a) = dir;
  dir->RemoveStuff(a.get());
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 2);
  EXPECT_FALSE(a->GetSortDir());

  const auto captured = rkhost::control::Snapshot().verifications;
  ASSERT_EQ(captured.size(), 2u);
  EXPECT_EQ(captured[0].number, 1382);
  EXPECT_EQ(captured[0].message, "can't remove a writeable stuff from sortdir");
  EXPECT_EQ(captured[1].number, 1381);
  EXPECT_EQ(captured[1].message, "stuff not in the right sortdir");
}

TEST_F(SortDirTest, DestroyingADirectoryReleasesItsItemsQuietly) {
  auto localBag = boost::shared_ptr<RK_Bag>(new RK_Bag);
  auto localDir = boost::shared_ptr<RK_SortDir>(new RK_SortDir);
  auto kept = Make("kept");
  localBag->AddStuff(kept);
  localDir->AddStuff(kept);
  {
    auto dropped = Make("dropped");
    localBag->AddStuff(dropped);
    localDir->AddStuff(dropped);
  }
  EXPECT_EQ(localBag->GetStuffCount(), 2u);
  localDir.reset();

  EXPECT_TRUE(rkhost::control::Snapshot().verifications.empty());
  EXPECT_EQ(journal->Count("dropped:destroyed"), 1);
  EXPECT_FALSE(kept->GetSortDir());
  // Released items leave their bag, so it holds no pointer to a dead item.
  EXPECT_EQ(localBag->GetStuffCount(), 0u);
  EXPECT_FALSE(kept->GetBag());
}

TEST_F(SortDirTest, EnteringRollsBackTheBagWhenTheDirectoryFails) {
  auto existing = Make("existing");
  existing->AddToBagAndSortDir(bag, {});
  existing->SetThrowFromIsInMemory(77);
  auto item = Make("new", existing);
  const auto changes = dir->GetLastChangeTime();

  EXPECT_EQ(ThrownCode([&] { item->AddToBagAndSortDir(bag, milliseconds(50)); }), 77);
  EXPECT_FALSE(item->GetBag());
  EXPECT_FALSE(item->GetSortDir());
  EXPECT_EQ(RK_TEST_Access::Order(*bag), std::vector<RK_Stuff*>{existing.get()});
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *existing), std::vector<RK_Stuff*>{existing.get()});
  EXPECT_EQ(dir->GetLastChangeTime(), changes);

  // The same item enters cleanly once the cause is gone.
  existing->SetThrowFromIsInMemory(0);
  item->SetCanSatisfy([](const RK_Stuff*) { return false; });
  item->AddToBagAndSortDir(bag, {});
  EXPECT_EQ(item->GetBag(), bag);

  // A failure entering the bag leaves both unchanged.
  EXPECT_EQ(ThrownCode([&] { item->AddToBagAndSortDir(bag, {}); }), RK_InternalErrorCode);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *existing), (std::vector<RK_Stuff*>{existing.get(), item.get()}));
  EXPECT_EQ(bag->GetStuffCount(), 2u);
}

TEST_F(SortDirTest, QueuesABackgroundWriteOnlyWhenEveryConditionHolds) {
  rkhost::control::UseTestClock(true);
  rkhost::control::SetTestClock(1000);
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  // Hold the queue so that submitted jobs stay visible.
  RK_DeprioritizeBackgroundWrites();
  ASSERT_TRUE(executor->Snapshot().suspended);
  bag->EnableDiskCache(true);

  int n = 0;
  const auto enter = [&](const boost::posix_time::time_duration& computeTime, bool canDiskCache = true,
                         bool inMemory = true) {
    auto item = Make("w" + std::to_string(n++), nullptr, inMemory);
    item->SetCanDiskCache(canDiskCache);
    item->SetOnDisk(false);
    item->AddToBagAndSortDir(bag, computeTime);
    return executor->Snapshot().ready;
  };

  EXPECT_EQ(enter(milliseconds(5)), 1u);
  EXPECT_EQ(enter(microseconds(999)), 1u);   // under 1 ms: never
  EXPECT_EQ(enter(microseconds(1999)), 1u);  // counts as 1 ms: not worth it
  EXPECT_EQ(enter(milliseconds(2)), 2u);
  EXPECT_EQ(enter(milliseconds(5), false), 2u);        // cannot be disk cached
  EXPECT_EQ(enter(milliseconds(5), true, false), 2u);  // not in memory
  bag->EnableDiskCache(false);
  EXPECT_EQ(enter(milliseconds(5)), 2u);
  bag->EnableDiskCache(true);

  // A queued job holds its item: dropping it from the cache does not kill it.
  auto queued = Make("queued");
  queued->SetCanDiskCache(true);
  queued->SetOnDisk(false);
  queued->AddToBagAndSortDir(bag, milliseconds(5));
  EXPECT_EQ(executor->Snapshot().ready, 3u);
  queued->RemoveFromBagAndSortDir();
  queued.reset();
  EXPECT_EQ(journal->Count("queued:destroyed"), 0);

  // Once resumed, the jobs run; they write nothing, and the item whose job
  // ends last is released with it.
  rkhost::control::AdvanceTestClock(3000);
  RK_TEST_CheckResumeBackgroundWrites();
  executor->WaitUntilIdle();
  EXPECT_EQ(executor->Snapshot().ready, 0u);
  EXPECT_EQ(journal->Count("queued:destroyed"), 1);
  EXPECT_EQ(RK_GlobalBag()->GetCurrentDiskCacheSize(), 0);

  // After the executor is stopped, nothing is queued and entering still works.
  RK_StopAllAsyncWork();
  auto late = Make("late");
  late->SetCanDiskCache(true);
  late->AddToBagAndSortDir(bag, milliseconds(5));
  EXPECT_EQ(late->GetBag(), bag);
}

}  // namespace
