// Finds, check-outs, conversions, check-ins, new items and reclamation from
// several threads at once; afterwards every item is checked in, bag and
// directory agree, and no item died while checked out.
#include <gtest/gtest.h>

#include <atomic>
#include <boost/date_time/posix_time/posix_time.hpp>
#include <random>
#include <set>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::time_duration;
using rktest::TestStuff;

std::atomic<int> g_diedCheckedOut{0};
std::atomic<int> g_alive{0};

// Counts items alive, and those destroyed while still checked out.
class StressStuff : public TestStuff {
 public:
  explicit StressStuff(const plinth::utility::Guid& guid) : TestStuff(4096, true, /*trackMemory=*/true) {
    SetGuid(guid);
    g_alive.fetch_add(1);
  }

 protected:
  ~StressStuff() override {
    if (GetCheckoutCount() != 0) g_diedCheckedOut.fetch_add(1);
    g_alive.fetch_sub(1);
  }
};

constexpr int kThreads = 4;
constexpr int kIterations = 3000;
constexpr int kGuids = 24;

TEST(CheckoutStressTest, ConcurrentHitPathEnteringAndReclaimingKeepTheInvariants) {
  rkhost::control::MakeCurrentThreadMain();
  rkhost::control::SetMemoryStat(0);
  RK_Birth(false);
  rkhost::control::ClearCaptured();
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  boost::shared_ptr<RK_SortDir> dir = RK_GlobalSortDir();

  std::vector<plinth::utility::Guid> guids;
  for (int i = 0; i < kGuids; ++i) guids.push_back(plinth::utility::Guid(0x1000 + i, 0x2000 + i));

  std::atomic<int> hits{0}, unexpected{0}, converted{0};
  auto worker = [&](int seed) {
    rkhost::control::SetCurrentThreadIsRenderThread(seed % 2 == 0);
    std::mt19937 rng(static_cast<unsigned>(seed));
    std::uniform_int_distribution<int> pick(0, kGuids - 1), op(0, 99);
    for (int i = 0; i < kIterations; ++i) {
      const plinth::utility::Guid guid = guids[pick(rng)];
      const int what = op(rng);
      try {
        if (what < 55) {
          boost::intrusive_ptr<StressStuff> request(new StressStuff(guid));
          RK_ScCheckout receipt;
          if (receipt.FindAndCheckout(request.get(), RK_Checkout_ReadOnly)) {
            RK_Stuff* item = receipt.GetStuff();
            if (item->IsCheckedOutWriteable() || item->GetGuid() != guid) unexpected.fetch_add(1);
            hits.fetch_add(1);
            const int flags = what < 5 ? RK_Checkin_FreeMemory : (what < 10 ? RK_Checkin_KeepLastUse : 0);
            receipt.Checkin(flags, time_duration());
          }
        } else if (what < 65) {
          boost::intrusive_ptr<StressStuff> request(new StressStuff(guid));
          RK_ScCheckout receipt;
          if (receipt.FindAndCheckout(request.get(), 0)) {
            if (!receipt.GetStuff()->IsCheckedOutWriteable() || receipt.GetStuff()->GetCheckoutCount() != 1)
              unexpected.fetch_add(1);
          }
        } else if (what < 72) {
          boost::intrusive_ptr<StressStuff> request(new StressStuff(guid));
          RK_ScCheckout receipt;
          if (receipt.FindAndCheckout(request.get(), RK_Checkout_ReadOnly)) {
            receipt.GetStuff()->ConvertToWriteable();
            converted.fetch_add(1);
          }
        } else if (what < 92) {
          boost::intrusive_ptr<StressStuff> item(new StressStuff(guid));
          item->AddToBagAndSortDir(bag, time_duration());
        } else {
          bag->FreeUpSomeMemory(8 * 4096);
        }
      } catch (int code) {
        if (code != RK_ModuleErrorCheckout) unexpected.fetch_add(1);  // only a conflict may happen
      }
    }
  };

  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) threads.emplace_back(worker, t + 1);
  for (std::thread& t : threads) t.join();

  EXPECT_EQ(unexpected.load(), 0);
  EXPECT_EQ(g_diedCheckedOut.load(), 0);
  EXPECT_GT(hits.load(), 0);
  EXPECT_GT(converted.load(), 0);
  // No thread here is the main thread: conflicts are thrown, never reported.
  EXPECT_TRUE(rkhost::control::Snapshot().errorReports.empty());

  // Bag and directory hold the same items, none checked out, each indexed
  // under its own GUID and in order of last use.
  const std::vector<RK_Stuff*> order = RK_TEST_Access::Order(*bag);
  EXPECT_EQ(order.size(), dir->GetStuffCount());
  std::set<RK_Stuff*> indexed;
  for (const plinth::utility::Guid& guid : guids) {
    boost::intrusive_ptr<StressStuff> key(new StressStuff(guid));
    for (RK_Stuff* item : RK_TEST_Access::Group(*dir, *key)) indexed.insert(item);
  }
  EXPECT_EQ(indexed, std::set<RK_Stuff*>(order.begin(), order.end()));
  for (std::size_t i = 0; i < order.size(); ++i) {
    EXPECT_EQ(order[i]->GetCheckoutCount(), 0u);
    if (i > 0) {
      EXPECT_LE(order[i - 1]->GetLastUseTime(), order[i]->GetLastUseTime());
    }
  }
  // Every item still alive is held by the directory alone.
  EXPECT_EQ(g_alive.load(), static_cast<int>(order.size()));

  bag.reset();
  dir.reset();
  RK_StopAllAsyncWork();
  RK_Death();
  EXPECT_EQ(g_alive.load(), 0);
  EXPECT_EQ(g_diedCheckedOut.load(), 0);
}

}  // namespace
