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

std::uint32_t Holds(const boost::shared_ptr<RK_Bag>& bag) {
  return RK_TEST_Access::LockHoldCount(*bag);
}

}  // namespace

TEST(FrameLifecycle, WalksFromNotBornThroughAliveAndStoppedToDead) {
  ctl::ClearCaptured();
  const std::uint64_t unborn = ctl::MemoryStat();
  EXPECT_FALSE(RK_GlobalBag() || RK_GlobalSortDir() || RK_TEST_BackgroundExecutor());
  { RK_ScCacheLock lock; }  // locks without a bag

  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  boost::shared_ptr<RK_SortDir> sortDir = RK_GlobalSortDir();
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(bag && sortDir && executor);
  EXPECT_GE(ctl::MemoryStat() - unborn, sizeof(RK_Bag) + sizeof(RK_SortDir));

  // Stopped: no executor, but bag and sort directory stay usable. A second
  // stop logs again and changes nothing else.
  RK_StopAllAsyncWork();
  EXPECT_TRUE(executor->IsCancelled());
  EXPECT_FALSE(RK_TEST_BackgroundExecutor());
  RK_StopAllAsyncWork();
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
  EXPECT_EQ(ModuleLogLines(),
            (std::vector<std::string>{"10|Birth|RK Birth", "10|RK_StopAllAsyncWork|RK_StopAllAsyncWork",
                                      "10|RK_StopAllAsyncWork|RK_StopAllAsyncWork", "10|Death|RK Death"}));
  item.reset();
  EXPECT_EQ(ctl::MemoryStat(), unborn);
}

TEST(FrameLifecycle, HostReferenceKeepsTheBagAlivePastDeath) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> held = RK_GlobalBag();
  RK_StopAllAsyncWork();
  RK_Death();
  EXPECT_FALSE(RK_GlobalBag());
  {
    RK_ScCacheLock lock;  // finds no global bag: the kept bag's count stays untouched
    EXPECT_EQ(Holds(held), 0u);
  }
}

TEST(FrameLifecycle, StopDropsQueuedAndDelayedTasksEvenWhileSuspended) {
  RK_Birth(false);
  auto executor = RK_TEST_BackgroundExecutor();
  // Held only by the tasks: its count shows whether they were destroyed.
  auto token = boost::make_shared<int>(0);
  auto ran = boost::make_shared<std::atomic<int>>(0);
  executor->Submit([token, ran] { ++*ran; }, 60000);
  RK_DeprioritizeBackgroundWrites();
  executor->Submit([token, ran] { ++*ran; }, 0);
  EXPECT_EQ(token.use_count(), 3);

  RK_StopAllAsyncWork();  // must return although the executor was suspended
  EXPECT_EQ(token.use_count(), 1);
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
  }  // the outer guard touches neither the dead bag nor the new one
  EXPECT_EQ(Holds(RK_GlobalBag()), 0u);
  RK_StopAllAsyncWork();
  RK_Death();
}
