// The module's lifecycle: not born, alive, stopped, dead; the global objects
// and their owners; the cache lock guard's hold count.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/make_shared.hpp>
#include <boost/weak_ptr.hpp>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace ctl = rkhost::control;

namespace {

// "level|tag|text" of every captured line of module "RK".
std::vector<std::string> ModuleLogLines() {
  std::vector<std::string> out;
  for (const ctl::LogLine& line : ctl::Snapshot().logLines)
    if (line.module == "RK") out.push_back(std::to_string(line.level) + "|" + line.tag + "|" + line.text);
  return out;
}

const std::string kBirthLine = "10|Birth|RK Birth";
const std::string kStopLine = "10|RK_StopAllAsyncWork|RK_StopAllAsyncWork";
const std::string kDeathLine = "10|Death|RK Death";

std::uint32_t Holds(const boost::shared_ptr<RK_Bag>& bag) {
  return RK_TEST_Access::LockHoldCount(*bag);
}

}  // namespace

TEST(FrameLifecycle, WalksFromNotBornThroughAliveAndStoppedToDead) {
  ctl::ClearCaptured();
  const std::uint64_t unborn = ctl::MemoryStat();
  // Not born: no globals, and the guard still locks without a bag.
  EXPECT_FALSE(RK_GlobalBag());
  EXPECT_FALSE(RK_GlobalSortDir());
  EXPECT_FALSE(RK_TEST_BackgroundExecutor());
  { RK_ScCacheLock lock; }

  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  boost::shared_ptr<RK_SortDir> sortDir = RK_GlobalSortDir();
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(bag && sortDir && executor);
  EXPECT_EQ(bag->GetStuffCount(), 0u);
  EXPECT_FALSE(executor->IsCancelled());
  // Bag and directory come from tracked allocation.
  EXPECT_GE(ctl::MemoryStat() - unborn, sizeof(RK_Bag) + sizeof(RK_SortDir));
  EXPECT_EQ(ModuleLogLines(), std::vector<std::string>{kBirthLine});

  // Stopped: no executor, but bag and sort directory stay usable. A second
  // stop logs again and changes nothing else.
  RK_StopAllAsyncWork();
  EXPECT_TRUE(executor->IsCancelled());
  EXPECT_FALSE(RK_TEST_BackgroundExecutor());
  RK_StopAllAsyncWork();
  EXPECT_EQ(RK_GlobalBag(), bag);
  EXPECT_EQ(RK_GlobalSortDir(), sortDir);
  rktest::TestStuffPtr item = rktest::TestStuff::Make();
  item->AddToBagAndSortDir(bag, boost::posix_time::milliseconds(1));
  EXPECT_EQ(item->GetBag(), bag);

  // Dead: both globals dropped; with no other owner both objects go.
  boost::weak_ptr<RK_Bag> bagWatch = bag;
  boost::weak_ptr<RK_SortDir> sortDirWatch = sortDir;
  bag.reset();
  sortDir.reset();
  executor.reset();
  RK_Death();
  EXPECT_FALSE(RK_GlobalBag() || RK_GlobalSortDir());
  EXPECT_TRUE(bagWatch.expired() && sortDirWatch.expired());
  EXPECT_FALSE(item->GetBag());
  { RK_ScCacheLock lock; }
  EXPECT_EQ(ModuleLogLines(), (std::vector<std::string>{kBirthLine, kStopLine, kStopLine, kDeathLine}));
  item.reset();
  EXPECT_EQ(ctl::MemoryStat(), unborn);
}

TEST(FrameLifecycle, HostReferenceKeepsTheBagAlivePastDeath) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> held = RK_GlobalBag();
  boost::weak_ptr<RK_SortDir> sortDirWatch = RK_GlobalSortDir();
  RK_StopAllAsyncWork();
  RK_Death();
  EXPECT_TRUE(sortDirWatch.expired());
  EXPECT_FALSE(RK_GlobalBag());
  // The guard finds no global bag, so the kept bag's count stays untouched.
  {
    RK_ScCacheLock lock;
    EXPECT_EQ(Holds(held), 0u);
  }
  boost::weak_ptr<RK_Bag> bagWatch = held;
  held.reset();
  EXPECT_TRUE(bagWatch.expired());
}

TEST(FrameLifecycle, StopDropsQueuedAndDelayedTasksEvenWhileSuspended) {
  RK_Birth(false);
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  // Held only by the tasks: its count shows whether they were destroyed.
  auto token = boost::make_shared<int>(0);
  auto ran = boost::make_shared<std::atomic<int>>(0);
  executor->Submit([token, ran] { ++*ran; }, 60000);
  RK_DeprioritizeBackgroundWrites();
  EXPECT_TRUE(executor->Snapshot().suspended);
  executor->Submit([token, ran] { ++*ran; }, 0);
  EXPECT_EQ(executor->Snapshot().ready, 1u);
  EXPECT_EQ(executor->Snapshot().delayedMs, std::vector<std::uint32_t>{60000});
  EXPECT_EQ(token.use_count(), 3);

  RK_StopAllAsyncWork();  // must return although the executor was suspended
  EXPECT_EQ(token.use_count(), 1);
  EXPECT_TRUE(executor->Snapshot().cancelled);  // the token shows the queues are empty
  // Nothing submitted to the stopped executor runs either.
  executor->Submit([token, ran] { ++*ran; }, 0);
  executor->WaitUntilIdle();
  EXPECT_EQ(token.use_count(), 1);
  executor.reset();
  RK_Death();
  EXPECT_EQ(ran->load(), 0);
}

TEST(FrameLifecycle, GuardsCountOnTheGlobalBagAndOneHeldAcrossDeathLeavesBothBagsAlone) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  {
    RK_ScCacheLock outer;
    EXPECT_EQ(Holds(bag), 1u);
    {
      RK_ScCacheLock middle;
      RK_ScCacheLock inner;
      EXPECT_EQ(Holds(bag), 3u);
      EXPECT_EQ(bag->GetStuffCount(), 0u);  // the bag's own operations lock again on this thread
    }
    EXPECT_EQ(Holds(bag), 1u);
  }
  EXPECT_EQ(Holds(bag), 0u);
  bag.reset();

  RK_StopAllAsyncWork();
  {
    RK_ScCacheLock guard;
    RK_Death();  // destroys the bag the guard raised
    RK_Birth(false);
    boost::shared_ptr<RK_Bag> fresh = RK_GlobalBag();
    EXPECT_EQ(Holds(fresh), 0u);
    {
      RK_ScCacheLock inner;
      EXPECT_EQ(Holds(fresh), 1u);
    }
  }  // the outer guard touches neither the dead bag nor the new one
  EXPECT_EQ(Holds(RK_GlobalBag()), 0u);
  RK_StopAllAsyncWork();
  RK_Death();
}
