// The bag: ordering by last use, refusing double entries, removal from the
// wrong bag, clearing, copying and destruction.
#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>
#include <string>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::milliseconds;
using boost::posix_time::ptime;
using rktest::Journal;
using rktest::TestStuff;
using rktest::TestStuffPtr;

class BagTest : public ::testing::Test {
 protected:
  void SetUp() override {
    rkhost::control::MakeCurrentThreadMain();
    RK_Birth(false);
    rkhost::control::ClearCaptured();
  }
  void TearDown() override {
    RK_StopAllAsyncWork();
    RK_Death();
  }

  static boost::shared_ptr<RK_Bag> NewBag() { return boost::shared_ptr<RK_Bag>(new RK_Bag); }
  static std::vector<RK_Stuff*> Order(const boost::shared_ptr<RK_Bag>& bag) {
    return RK_TEST_Access::Order(*bag);
  }
  static std::vector<int> VerificationNumbers() {
    std::vector<int> out;
    for (const auto& v : rkhost::control::Snapshot().verifications) out.push_back(v.number);
    return out;
  }
  // Runs f, which must throw an int; returns it (or -1).
  template <class F>
  static int ThrownCode(F&& f) {
    try {
      f();
    } catch (int code) {
      return code;
    }
    return -1;
  }
};

TEST_F(BagTest, WalksOldestFirstAndKeepsInsertionOrderForEqualStamps) {
  auto bag = NewBag();
  const ptime t0(boost::gregorian::date(2024, 1, 1), milliseconds(0));
  const ptime t1 = t0 + milliseconds(5);
  std::vector<TestStuffPtr> items;
  // Stamps, in the order of insertion: t1 t0 t1 t1 t0 t1 t0.
  const std::vector<ptime> stamps{t1, t0, t1, t1, t0, t1, t0};
  for (const ptime& t : stamps) {
    auto item = TestStuff::Make();
    RK_TEST_Access::SetLastUseTime(*item, t);
    {
      RK_ScCacheLock lock;
      RK_TEST_Access::AddStuffGuts(*bag, item);
    }
    items.push_back(item);
  }
  const std::vector<RK_Stuff*> expected{items[1].get(), items[4].get(), items[6].get(), items[0].get(),
                                        items[2].get(), items[3].get(), items[5].get()};
  EXPECT_EQ(Order(bag), expected);
  EXPECT_EQ(bag->GetStuffCount(), 7u);

  // A restamp (check-in's remove, stamp, add) moves the item to the young
  // end, behind every equal stamp; the others keep their order.
  {
    RK_ScCacheLock lock;
    RK_TEST_Access::RemoveStuffGuts(*bag, items[1].get());
    EXPECT_FALSE(items[1]->GetBag());
    RK_TEST_Access::SetLastUseTime(*items[1], t1);
    RK_TEST_Access::AddStuffGuts(*bag, items[1]);
  }
  const std::vector<RK_Stuff*> restamped{items[4].get(), items[6].get(), items[0].get(), items[2].get(),
                                         items[3].get(), items[5].get(), items[1].get()};
  EXPECT_EQ(Order(bag), restamped);

  // AddStuff stamps with now, which is later than every stamp above.
  auto young = TestStuff::Make();
  bag->AddStuff(young);
  EXPECT_EQ(Order(bag).back(), young.get());
  EXPECT_EQ(young->GetBag(), bag);
  EXPECT_GT(young->GetLastUseTime(), t1);
  EXPECT_TRUE(VerificationNumbers().empty());
  // The bag holds plain pointers: it goes before the items do.
  bag.reset();
}

TEST_F(BagTest, UsesAfterTheClockWasSetBackStillCountAsTheNewest) {
  auto bag = NewBag();
  auto old = TestStuff::Make();
  bag->AddStuff(old);
  // An item last used an hour "from now": as if the clock had since been set back.
  auto future = TestStuff::Make();
  const ptime later = RK_Now() + boost::posix_time::hours(1);
  RK_TEST_Access::SetLastUseTime(*future, later);
  {
    RK_ScCacheLock lock;
    RK_TEST_Access::AddStuffGuts(*bag, future);
  }
  auto fresh = TestStuff::Make();
  bag->AddStuff(fresh);
  EXPECT_EQ(Order(bag), (std::vector<RK_Stuff*>{old.get(), future.get(), fresh.get()}));
  EXPECT_EQ(fresh->GetLastUseTime(), later);

  // A check-in is a use too: the item goes behind both, not to the front.
  ASSERT_EQ(old->Checkout(RK_Checkout_ReadOnly), RK_CheckoutResult_CheckedOut);
  old->Checkin(0, boost::posix_time::time_duration());
  EXPECT_EQ(Order(bag), (std::vector<RK_Stuff*>{future.get(), fresh.get(), old.get()}));
  EXPECT_EQ(old->GetLastUseTime(), later);
  bag.reset();
}

TEST_F(BagTest, RefusesAnItemThatIsInABagAlreadyAndChangesNothing) {
  auto bag1 = NewBag();
  auto bag2 = NewBag();
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  bag1->AddStuff(a);
  bag1->AddStuff(b);
  const ptime stampA = a->GetLastUseTime();
  const std::vector<RK_Stuff*> before = Order(bag1);

  EXPECT_EQ(ThrownCode([&] { bag1->AddStuff(a); }), RK_InternalErrorCode);
  EXPECT_EQ(ThrownCode([&] { bag2->AddStuff(a); }), RK_InternalErrorCode);
  EXPECT_EQ(ThrownCode([&] {
              RK_ScCacheLock lock;
              RK_TEST_Access::AddStuffGuts(*bag2, a);
            }),
            RK_InternalErrorCode);

  const auto captured = rkhost::control::Snapshot().verifications;
  ASSERT_EQ(captured.size(), 3u);
  for (const auto& v : captured) {
    EXPECT_EQ(v.number, 380);
    EXPECT_EQ(v.message, "stuff already in a bag");
  }
  // The refused item keeps its stamp, so its place in bag1 stays valid.
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(bag1), before);
  EXPECT_EQ(bag2->GetStuffCount(), 0u);
  EXPECT_EQ(a->GetBag(), bag1);
  // And it can still be removed from where it is.
  bag1->RemoveStuff(a.get());
  EXPECT_EQ(Order(bag1), std::vector<RK_Stuff*>{b.get()});
  bag1.reset();
}

TEST_F(BagTest, RemovalFromTheWrongBagIsRefused) {
  auto bag1 = NewBag();
  auto bag2 = NewBag();
  auto a = TestStuff::Make();
  auto loose = TestStuff::Make();
  bag1->AddStuff(a);

  EXPECT_EQ(ThrownCode([&] { bag2->RemoveStuff(a.get()); }), RK_InternalErrorCode);
  EXPECT_EQ(ThrownCode([&] { bag1->RemoveStuff(loose.get()); }), RK_InternalErrorCode);
  EXPECT_EQ(Order(bag1), std::vector<RK_Stuff*>{a.get()});
  EXPECT_EQ(a->GetBag(), bag1);

  bag1->RemoveStuff(a.get());
  EXPECT_EQ(bag1->GetStuffCount(), 0u);
  EXPECT_EQ(ThrownCode([&] { bag1->RemoveStuff(a.get()); }), RK_InternalErrorCode);

  const auto captured = rkhost::control::Snapshot().verifications;
  ASSERT_EQ(captured.size(), 3u);
  for (const auto& v : captured) {
    EXPECT_EQ(v.number, 402);
    EXPECT_EQ(v.message, "stuff not in the right bag");
  }
}

TEST_F(BagTest, ClearingLeavesCheckedOutItems) {
  auto bag = RK_GlobalBag();
  auto dir = RK_GlobalSortDir();
  auto journal = std::make_shared<Journal>();

  // Clearing an empty bag changes nothing.
  const auto changesBefore = dir->GetLastChangeTime();
  bag->ClearBagAndSortDir();
  EXPECT_EQ(dir->GetLastChangeTime(), changesBefore);

  auto kept = TestStuff::Make(100, true, false, journal, "kept");
  kept->AddToBagAndSortDir(bag, {});
  RK_TEST_Access::SetCheckoutCount(*kept, 1);
  for (int i = 0; i < 3; ++i)
    TestStuff::Make(100, true, false, journal, "gone" + std::to_string(i))->AddToBagAndSortDir(bag, {});
  EXPECT_EQ(bag->GetStuffCount(), 4u);

  bag->ClearBagAndSortDir();
  EXPECT_EQ(Order(bag), std::vector<RK_Stuff*>{kept.get()});
  EXPECT_EQ(dir->GetStuffCount(), 1u);
  EXPECT_EQ(kept->GetSortDir(), dir);
  EXPECT_EQ(journal->Count("kept:FreeMemory"), 0);
  for (int i = 0; i < 3; ++i) {
    const std::string name = "gone" + std::to_string(i);
    EXPECT_EQ(journal->Count(name + ":FreeMemory"), 1) << name;
    EXPECT_EQ(journal->Count(name + ":destroyed"), 1) << name;
  }
  RK_TEST_Access::SetCheckoutCount(*kept, 0);
}

TEST_F(BagTest, CopyAssignmentCopiesElementsAndSettingsWithoutTellingItems) {
  auto original = NewBag();
  original->EnableDiskCache(true);
  EXPECT_TRUE(original->IsDiskCacheEnabled());
  RK_TEST_Access::SetDiskCacheSize(*original, 4096);
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  original->AddStuff(a);
  original->AddStuff(b);
  {
    auto copy = NewBag();
    *copy = *original;
    EXPECT_EQ(Order(copy), Order(original));
    EXPECT_TRUE(copy->IsDiskCacheEnabled());
    EXPECT_EQ(copy->GetCurrentDiskCacheSize(), 4096);
    EXPECT_EQ(a->GetBag(), original);
  }
  // Destroying the copy leaves the items in the bag they are in.
  EXPECT_EQ(a->GetBag(), original);
  EXPECT_EQ(b->GetBag(), original);
  original->RemoveStuff(a.get());
  EXPECT_EQ(Order(original), std::vector<RK_Stuff*>{b.get()});
  original->EnableDiskCache(false);
  EXPECT_FALSE(original->IsDiskCacheEnabled());
  original.reset();
}

TEST_F(BagTest, DestroyingABagReleasesItsItemsQuietly) {
  auto dir = RK_GlobalSortDir();
  auto bag = NewBag();
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  a->AddToBagAndSortDir(bag, {});
  b->AddToBagAndSortDir(bag, {});
  bag.reset();

  EXPECT_FALSE(a->GetBag());
  EXPECT_FALSE(b->GetBag());
  EXPECT_EQ(a->GetSortDir(), dir);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *a), std::vector<RK_Stuff*>{a.get()});
  EXPECT_TRUE(VerificationNumbers().empty());
  // The items can enter another bag now.
  auto other = NewBag();
  other->AddStuff(a);
  EXPECT_EQ(a->GetBag(), other);
}

}  // namespace
