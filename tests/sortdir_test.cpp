// The sort directory: group order, superseding, removal checks, the change
// count, destruction, and AddToBagAndSortDir's rollback and write decision.
#include "rkcache/testing.h"
#include "support/module_fixture.h"

namespace {

using boost::posix_time::milliseconds;
using rktest::TestStuffPtr;
using rktest::ThrownCode;

const auto kNever = [](const RK_Stuff*) { return false; };

class SortDirTest : public rktest::ModuleTest {
 protected:
  void TearDown() override {
    ModuleTest::TearDown();
    rkhost::control::UseTestClock(false);
  }
  // An item with the GUID of `like`.
  TestStuffPtr Like(const std::string& name, const TestStuffPtr& like) {
    auto item = Make(name);
    item->SetGuid(like->GetGuid());
    return item;
  }
};

TEST_F(SortDirTest, KeepsTheItemsOfOneGuidInTheOrderTheyWereAdded) {
  std::vector<TestStuffPtr> group{Make("g0")};
  std::vector<RK_Stuff*> expected{group[0].get()};
  dir->AddStuff(group[0]);
  for (int i = 1; i < 8; ++i) {
    group.push_back(Like("g" + std::to_string(i), group[0]));
    group.back()->SetCanSatisfy(kNever);
    dir->AddStuff(group.back());
    expected.push_back(group.back().get());
  }
  // Enough other groups to make the container rehash several times.
  std::vector<TestStuffPtr> others;
  for (int i = 0; i < 300; ++i) {
    others.push_back(Make("o"));
    dir->AddStuff(others.back());
  }
  EXPECT_EQ(Group(*group[0]), expected);
  EXPECT_EQ(dir->GetStuffCount(), 308u);

  // Removing from the middle keeps the rest in order; a new item goes last.
  dir->RemoveStuff(group[3].get());
  expected.erase(expected.begin() + 3);
  auto last = Like("last", group[0]);
  last->SetCanSatisfy(kNever);
  dir->AddStuff(last);
  expected.push_back(last.get());
  EXPECT_EQ(Group(*group[0]), expected);
}

TEST_F(SortDirTest, SupersedesOnlyWhatTheNewItemCanStandInFor) {
  // Kept: the new item cannot satisfy the old one.
  auto a = Enter(Make("a"));
  auto b = Like("b", a);
  b->SetCanSatisfy(kNever);
  auto changes = dir->GetLastChangeTime();
  Enter(b);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_EQ(Group(*a), (std::vector<RK_Stuff*>{a.get(), b.get()}));
  EXPECT_EQ(journal->Count("b:CanSatisfyRequest"), 1);

  // Dropped: c can stand in for a and b (both in memory); they leave
  // directory and bag and free their memory.
  auto c = Like("c", a);
  const RK_Stuff* asked = nullptr;
  c->SetCanSatisfy([&](const RK_Stuff* request) {
    asked = request;
    return true;
  });
  changes = dir->GetLastChangeTime();
  Enter(c);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 3);
  EXPECT_EQ(asked, b.get());  // asked about each, in group order
  EXPECT_EQ(journal->Count("c:CanSatisfyRequest"), 2);
  EXPECT_EQ(Group(*a), std::vector<RK_Stuff*>{c.get()});
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{c.get()});
  EXPECT_FALSE(a->GetSortDir());  // the removal's link, too
  EXPECT_FALSE(a->IsInMemory() || b->IsInMemory());

  // Dropped without asking: an old item that holds no data at all.
  c->SetInMemory(false);
  c->SetOnDisk(false);
  auto d = Like("d", c);
  d->SetCanSatisfy(kNever);
  changes = dir->GetLastChangeTime();
  Enter(d);
  EXPECT_EQ(journal->Count("d:CanSatisfyRequest"), 0);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 2);
  EXPECT_EQ(Group(*c), std::vector<RK_Stuff*>{d.get()});
  EXPECT_FALSE(c->GetBag());
  EXPECT_TRUE(rktest::Verifications().empty());
}

TEST_F(SortDirTest, DropsACheckedOutItemInPlace) {
  auto held = Enter(Make("held"));
  RK_TEST_Access::SetCheckoutCount(*held, 1);
  const auto changes = dir->GetLastChangeTime();
  auto newer = Enter(Like("newer", held));
  // Out of bag and directory, but alive for its holder with its data.
  EXPECT_EQ(Group(*held), std::vector<RK_Stuff*>{newer.get()});
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{newer.get()});
  EXPECT_FALSE(held->GetBag() || held->GetSortDir());
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
  EXPECT_EQ(rktest::Verifications(),
            (std::vector<std::pair<int, std::string>>{{1382, "can't remove a writeable stuff from sortdir"},
                                                      {1381, "stuff not in the right sortdir"}}));
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
  localDir.reset();
  EXPECT_TRUE(rktest::Verifications().empty());
  EXPECT_EQ(journal->Count("dropped:destroyed"), 1);
  EXPECT_FALSE(kept->GetSortDir());
  // Released items leave their bag, so it holds no pointer to a dead item.
  EXPECT_EQ(localBag->GetStuffCount(), 0u);
  EXPECT_FALSE(kept->GetBag());
}

TEST_F(SortDirTest, EnteringRollsBackTheBagWhenTheDirectoryFails) {
  auto existing = Enter(Make("existing"));
  existing->SetThrowFromIsInMemory(77);
  auto item = Like("new", existing);
  const auto changes = dir->GetLastChangeTime();

  EXPECT_EQ(ThrownCode([&] { item->AddToBagAndSortDir(bag, milliseconds(50)); }), 77);
  EXPECT_FALSE(item->GetBag() || item->GetSortDir());
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{existing.get()});
  EXPECT_EQ(Group(*existing), std::vector<RK_Stuff*>{existing.get()});
  EXPECT_EQ(dir->GetLastChangeTime(), changes);

  // The same item enters cleanly once the cause is gone.
  existing->SetThrowFromIsInMemory(0);
  item->SetCanSatisfy(kNever);
  Enter(item);
  // A failure entering the bag leaves both unchanged.
  EXPECT_EQ(ThrownCode([&] { Enter(item); }), RK_InternalErrorCode);
  EXPECT_EQ(Group(*existing), (std::vector<RK_Stuff*>{existing.get(), item.get()}));
  EXPECT_EQ(bag->GetStuffCount(), 2u);
}

TEST_F(SortDirTest, QueuesABackgroundWriteOnlyWhenEveryConditionHolds) {
  rkhost::control::UseTestClock(true);
  rkhost::control::SetTestClock(1000);
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  RK_DeprioritizeBackgroundWrites();  // hold the queue so that jobs stay visible
  ASSERT_TRUE(executor->Snapshot().suspended);
  bag->EnableDiskCache(true);

  int n = 0;
  const auto enter = [&](const boost::posix_time::time_duration& computeTime, bool canDiskCache = true,
                         bool inMemory = true) {
    auto item = Make("w" + std::to_string(n++), 1000, inMemory);
    item->SetCanDiskCache(canDiskCache);
    item->SetOnDisk(false);
    Enter(item, computeTime);
    return executor->Snapshot().ready;
  };
  // The compute-time threshold itself is PacingTest's.
  EXPECT_EQ(enter(milliseconds(1)), 0u);  // not worth it
  EXPECT_EQ(enter(milliseconds(2)), 1u);
  EXPECT_EQ(enter(milliseconds(5), false), 1u);        // cannot be disk cached
  EXPECT_EQ(enter(milliseconds(5), true, false), 1u);  // not in memory
  bag->EnableDiskCache(false);
  EXPECT_EQ(enter(milliseconds(5)), 1u);
  bag->EnableDiskCache(true);

  // A queued job holds its item: dropping it from the cache does not kill it.
  auto queued = Make("queued");
  queued->SetCanDiskCache(true);
  queued->SetOnDisk(false);
  Enter(queued, milliseconds(5));
  EXPECT_EQ(executor->Snapshot().ready, 2u);
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
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 0);

  // After the executor is stopped, nothing is queued and entering still works.
  RK_StopAllAsyncWork();
  auto late = Make("late");
  late->SetCanDiskCache(true);
  Enter(late, milliseconds(5));
  EXPECT_EQ(late->GetBag(), bag);
}

}  // namespace
