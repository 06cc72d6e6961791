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
  TestStuffPtr Like(const std::string& name, const TestStuffPtr& like, bool supersedes = true) {
    auto item = Make(name);
    item->SetGuid(like->GetGuid());
    if (!supersedes) item->SetCanSatisfy(kNever);
    return item;
  }
};

TEST_F(SortDirTest, KeepsTheItemsOfOneGuidInTheOrderTheyWereAdded) {
  std::vector<TestStuffPtr> group{Make("g0")};
  dir->AddStuff(group[0]);
  for (int i = 1; i < 4; ++i) {
    group.push_back(Like("g" + std::to_string(i), group[0], false));
    dir->AddStuff(group.back());
  }
  // Enough other groups to make the container rehash several times.
  std::vector<TestStuffPtr> others;
  for (int i = 0; i < 300; ++i) {
    others.push_back(Make("o"));
    dir->AddStuff(others.back());
  }
  // Removing from the middle keeps the rest in order; a new item goes last.
  dir->RemoveStuff(group[1].get());
  auto last = Like("last", group[0], false);
  dir->AddStuff(last);
  EXPECT_EQ(Group(*group[0]),
            (std::vector<RK_Stuff*>{group[0].get(), group[2].get(), group[3].get(), last.get()}));
}

TEST_F(SortDirTest, SupersedesOnlyWhatTheNewItemCanStandInFor) {
  auto a = Enter(Make("a"));
  auto b = Like("b", a, false);
  auto changes = dir->GetLastChangeTime();
  Enter(b);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_EQ(Group(*a), (std::vector<RK_Stuff*>{a.get(), b.get()}));

  // c can stand in for a and b: asked about each in group order, they leave
  // directory and bag and free their memory.
  auto c = Like("c", a);
  std::vector<const RK_Stuff*> asked;
  c->SetCanSatisfy([&](const RK_Stuff* request) {
    asked.push_back(request);
    return true;
  });
  changes = dir->GetLastChangeTime();
  Enter(c);
  EXPECT_EQ(asked, (std::vector<const RK_Stuff*>{a.get(), b.get()}));
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 3);
  EXPECT_EQ(Group(*a), std::vector<RK_Stuff*>{c.get()});
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{c.get()});
  EXPECT_FALSE(a->IsInMemory() || b->IsInMemory());

  // An old item that holds no data at all is dropped without asking.
  c->SetInMemory(false);
  c->SetOnDisk(false);
  auto d = Like("d", c, false);
  Enter(d);
  EXPECT_EQ(journal->Count("d:CanSatisfyRequest"), 0);
  EXPECT_EQ(Group(*c), std::vector<RK_Stuff*>{d.get()});
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
  EXPECT_TRUE(held->IsInMemory());
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);  // the drop in place is no RemoveStuff
  RK_TEST_Access::SetCheckoutCount(*held, 0);
}

TEST_F(SortDirTest, RemovalChecksAndChangeCount) {
  auto a = Make("a");
  dir->AddStuff(a);
  const auto changes = dir->GetLastChangeTime();
  RK_TEST_Access::SetCheckoutCount(*a, 1);
  RK_TEST_Access::SetCheckedOutWriteable(*a, true);
  EXPECT_EQ(ThrownCode([&] { dir->RemoveStuff(a.get()); }), RK_InternalErrorCode);
  RK_TEST_Access::SetCheckedOutWriteable(*a, false);
  RK_TEST_Access::SetCheckoutCount(*a, 0);

  dir->RemoveStuff(a.get());
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_EQ(ThrownCode([&] { dir->RemoveStuff(a.get()); }), RK_InternalErrorCode);

  // Naming the directory without being indexed (as during a writeable
  // check-out): unlinked, and still a change.
  RK_TEST_Access::SortDirLink(*a) = dir;
  dir->RemoveStuff(a.get());
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 2);
  EXPECT_FALSE(a->GetSortDir());
  EXPECT_EQ(rktest::Verifications(),
            (std::vector<rktest::Verification>{{1382, "can't remove a writeable stuff from sortdir"},
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
  EXPECT_FALSE(kept->GetSortDir());
  // Released items leave their bag, so it holds no pointer to a dead item.
  EXPECT_EQ(localBag->GetStuffCount(), 0u);
}

TEST_F(SortDirTest, EnteringRollsBackTheBagWhenTheDirectoryFails) {
  auto existing = Enter(Make("existing"));
  existing->SetThrowFromIsInMemory(77);
  auto item = Like("new", existing, false);
  const auto changes = dir->GetLastChangeTime();
  EXPECT_EQ(ThrownCode([&] { item->AddToBagAndSortDir(bag, milliseconds(50)); }), 77);
  EXPECT_FALSE(item->GetBag() || item->GetSortDir());
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{existing.get()});
  EXPECT_EQ(dir->GetLastChangeTime(), changes);

  // Entered cleanly once the cause is gone; entering twice changes nothing.
  existing->SetThrowFromIsInMemory(0);
  Enter(item);
  EXPECT_EQ(ThrownCode([&] { Enter(item); }), RK_InternalErrorCode);
  EXPECT_EQ(Group(*existing), (std::vector<RK_Stuff*>{existing.get(), item.get()}));
  EXPECT_EQ(bag->GetStuffCount(), 2u);
}

TEST_F(SortDirTest, QueuesABackgroundWriteOnlyWhenEveryConditionHolds) {
  rkhost::control::UseTestClock(true);
  rkhost::control::SetTestClock(1000);
  auto executor = RK_TEST_BackgroundExecutor();
  RK_DeprioritizeBackgroundWrites();  // hold the queue so that jobs stay visible
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
  EXPECT_EQ(enter(milliseconds(1)), 0u);  // not worth it
  EXPECT_EQ(enter(milliseconds(2)), 1u);
  EXPECT_EQ(enter(milliseconds(5), false), 1u);
  EXPECT_EQ(enter(milliseconds(5), true, false), 1u);
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
  // Once resumed the jobs run, and the item is released with its job.
  rkhost::control::AdvanceTestClock(3000);
  RK_TEST_CheckResumeBackgroundWrites();
  executor->WaitUntilIdle();
  EXPECT_EQ(journal->Count("queued:destroyed"), 1);
}

}  // namespace
