// The bag: order of last use, refused double entries and removals,
// clearing, copying and destruction.
#include "support/module_fixture.h"

namespace {

using boost::posix_time::milliseconds;
using boost::posix_time::ptime;
using rktest::TestStuff;
using rktest::TestStuffPtr;
using rktest::ThrownCode;

class BagTest : public rktest::ModuleTest {
 protected:
  static boost::shared_ptr<RK_Bag> NewBag() { return boost::shared_ptr<RK_Bag>(new RK_Bag); }
  static void AddGuts(RK_Bag& b, const TestStuffPtr& item) {
    RK_ScCacheLock lock;
    RK_TEST_Access::AddStuffGuts(b, item);
  }
};

TEST_F(BagTest, WalksOldestFirstAndKeepsInsertionOrderForEqualStamps) {
  auto local = NewBag();
  const ptime t0(boost::gregorian::date(2024, 1, 1), milliseconds(0));
  const ptime t1 = t0 + milliseconds(5);
  std::vector<TestStuffPtr> s;
  for (const ptime& t : {t1, t0, t1, t0}) {
    s.push_back(TestStuff::Make());
    RK_TEST_Access::SetLastUseTime(*s.back(), t);
    AddGuts(*local, s.back());
  }
  EXPECT_EQ(RK_TEST_Access::Order(*local),
            (std::vector<RK_Stuff*>{s[1].get(), s[3].get(), s[0].get(), s[2].get()}));

  // A restamp (remove, stamp, add) goes behind every equal stamp.
  {
    RK_ScCacheLock lock;
    RK_TEST_Access::RemoveStuffGuts(*local, s[1].get());
    RK_TEST_Access::SetLastUseTime(*s[1], t1);
    RK_TEST_Access::AddStuffGuts(*local, s[1]);
  }
  EXPECT_EQ(RK_TEST_Access::Order(*local),
            (std::vector<RK_Stuff*>{s[3].get(), s[0].get(), s[2].get(), s[1].get()}));
  local.reset();  // the bag holds plain pointers: it goes before the items
}

TEST_F(BagTest, UsesAfterTheClockWasSetBackStillCountAsTheNewest) {
  auto old = TestStuff::Make();
  bag->AddStuff(old);
  // Last used an hour "from now": as if the clock had since been set back.
  auto future = TestStuff::Make();
  RK_TEST_Access::SetLastUseTime(*future, RK_Now() + boost::posix_time::hours(1));
  AddGuts(*bag, future);
  auto fresh = TestStuff::Make();
  bag->AddStuff(fresh);
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{old.get(), future.get(), fresh.get()}));

  // A check-in is a use too: the item goes behind both.
  ASSERT_EQ(old->Checkout(RK_Checkout_ReadOnly), RK_CheckoutResult_CheckedOut);
  old->Checkin(0, {});
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{future.get(), fresh.get(), old.get()}));
}

TEST_F(BagTest, RefusesDoubleEntriesAndRemovalFromTheWrongBagChangingNothing) {
  auto bag2 = NewBag();
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  bag->AddStuff(a);
  bag->AddStuff(b);
  const ptime stampA = a->GetLastUseTime();
  const std::vector<RK_Stuff*> before = Order();

  EXPECT_EQ(ThrownCode([&] { bag->AddStuff(a); }), 3);
  EXPECT_EQ(ThrownCode([&] { bag2->RemoveStuff(a.get()); }), 3);
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(), before);
  EXPECT_EQ(rktest::Verifications(),
            (std::vector<rktest::Verification>{{380, "stuff already in a bag"},
                                               {402, "stuff not in the right bag"}}));
  EXPECT_TRUE(rkhost::control::Snapshot().errorReports.empty());
}

TEST_F(BagTest, ClearingLeavesCheckedOutItems) {
  auto kept = Enter(Make("kept", 100));
  RK_TEST_Access::SetCheckoutCount(*kept, 1);
  Enter(Make("gone", 100));
  bag->ClearBagAndSortDir();
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{kept.get()});
  EXPECT_TRUE(Indexed(*kept));
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"gone:FreeMemory", "gone:destroyed"}));
  RK_TEST_Access::SetCheckoutCount(*kept, 0);
}

TEST_F(BagTest, CopyAssignmentCopiesElementsAndSettingsWithoutTellingItems) {
  auto original = NewBag();
  original->EnableDiskCache(true);
  RK_TEST_Access::SetDiskCacheSize(*original, 4096);
  auto a = TestStuff::Make();
  original->AddStuff(a);
  {
    auto copy = NewBag();
    *copy = *original;
    EXPECT_EQ(RK_TEST_Access::Order(*copy), std::vector<RK_Stuff*>{a.get()});
    EXPECT_TRUE(copy->IsDiskCacheEnabled());
    EXPECT_EQ(copy->GetCurrentDiskCacheSize(), 4096);
  }
  // Destroying the copy leaves the item in the bag it is in.
  EXPECT_EQ(a->GetBag(), original);
  original->RemoveStuff(a.get());
  original.reset();
}

TEST_F(BagTest, AnItemThatDiesWhileInABagLeavesIt) {
  auto first = TestStuff::Make();
  auto second = TestStuff::Make();
  bag->AddStuff(first);
  bag->AddStuff(second);
  first.reset();  // no directory held it: this was the last reference
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{second.get()});
  EXPECT_TRUE(rktest::Verifications().empty());
}

TEST_F(BagTest, DestroyingABagReleasesItsItemsQuietly) {
  auto local = NewBag();
  auto a = TestStuff::Make();
  a->AddToBagAndSortDir(local, {});
  local.reset();
  EXPECT_FALSE(a->GetBag());
  EXPECT_TRUE(Indexed(*a));
  EXPECT_TRUE(rktest::Verifications().empty());
  bag->AddStuff(a);  // free to enter another bag
  EXPECT_EQ(a->GetBag(), bag);
}

}  // namespace
