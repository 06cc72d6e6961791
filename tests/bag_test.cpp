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
  for (const ptime& t : {t1, t0, t1, t1, t0, t1, t0}) {
    s.push_back(TestStuff::Make());
    RK_TEST_Access::SetLastUseTime(*s.back(), t);
    AddGuts(*local, s.back());
  }
  EXPECT_EQ(RK_TEST_Access::Order(*local),
            (std::vector<RK_Stuff*>{s[1].get(), s[4].get(), s[6].get(), s[0].get(), s[2].get(), s[3].get(),
                                    s[5].get()}));

  // A restamp (remove, stamp, add) goes behind every equal stamp.
  {
    RK_ScCacheLock lock;
    RK_TEST_Access::RemoveStuffGuts(*local, s[1].get());
    RK_TEST_Access::SetLastUseTime(*s[1], t1);
    RK_TEST_Access::AddStuffGuts(*local, s[1]);
  }
  EXPECT_EQ(RK_TEST_Access::Order(*local),
            (std::vector<RK_Stuff*>{s[4].get(), s[6].get(), s[0].get(), s[2].get(), s[3].get(), s[5].get(),
                                    s[1].get()}));

  // AddStuff stamps with now, later than every stamp above.
  auto young = TestStuff::Make();
  local->AddStuff(young);
  EXPECT_EQ(RK_TEST_Access::Order(*local).back(), young.get());
  EXPECT_EQ(local->GetStuffCount(), 8u);
  local.reset();  // the bag holds plain pointers: it goes before the items
}

TEST_F(BagTest, UsesAfterTheClockWasSetBackStillCountAsTheNewest) {
  auto old = TestStuff::Make();
  bag->AddStuff(old);
  // Last used an hour "from now": as if the clock had since been set back.
  auto future = TestStuff::Make();
  const ptime later = RK_Now() + boost::posix_time::hours(1);
  RK_TEST_Access::SetLastUseTime(*future, later);
  AddGuts(*bag, future);
  auto fresh = TestStuff::Make();
  bag->AddStuff(fresh);
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{old.get(), future.get(), fresh.get()}));
  EXPECT_EQ(fresh->GetLastUseTime(), later);

  // A check-in is a use too: the item goes behind both.
  ASSERT_EQ(old->Checkout(RK_Checkout_ReadOnly), RK_CheckoutResult_CheckedOut);
  old->Checkin(0, {});
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{future.get(), fresh.get(), old.get()}));
  EXPECT_EQ(old->GetLastUseTime(), later);
}

TEST_F(BagTest, RefusesDoubleEntriesAndRemovalFromTheWrongBagChangingNothing) {
  auto bag2 = NewBag();
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  auto loose = TestStuff::Make();
  bag->AddStuff(a);
  bag->AddStuff(b);
  const ptime stampA = a->GetLastUseTime();
  const std::vector<RK_Stuff*> before = Order();

  EXPECT_EQ(ThrownCode([&] { bag->AddStuff(a); }), 3);
  EXPECT_EQ(ThrownCode([&] { bag2->AddStuff(a); }), 3);
  EXPECT_EQ(ThrownCode([&] { AddGuts(*bag2, a); }), 3);
  EXPECT_EQ(ThrownCode([&] { bag2->RemoveStuff(a.get()); }), 3);
  EXPECT_EQ(ThrownCode([&] { bag->RemoveStuff(loose.get()); }), 3);
  // The refused item keeps its stamp, so its place in the bag stays valid.
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(), before);
  EXPECT_EQ(bag2->GetStuffCount(), 0u);
  bag->RemoveStuff(a.get());
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{b.get()});
  EXPECT_EQ(ThrownCode([&] { bag->RemoveStuff(a.get()); }), 3);

  const std::pair<int, std::string> twice{380, "stuff already in a bag"};
  const std::pair<int, std::string> wrong{402, "stuff not in the right bag"};
  EXPECT_EQ(rktest::Verifications(),
            (std::vector<std::pair<int, std::string>>{twice, twice, twice, wrong, wrong, wrong}));
  EXPECT_TRUE(rkhost::control::Snapshot().errorReports.empty());
}

TEST_F(BagTest, ClearingLeavesCheckedOutItems) {
  const auto changesBefore = dir->GetLastChangeTime();
  bag->ClearBagAndSortDir();  // empty: changes nothing
  EXPECT_EQ(dir->GetLastChangeTime(), changesBefore);

  auto kept = Enter(Make("kept", 100));
  RK_TEST_Access::SetCheckoutCount(*kept, 1);
  for (int i = 0; i < 3; ++i) Enter(Make("gone" + std::to_string(i), 100));
  bag->ClearBagAndSortDir();
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{kept.get()});
  EXPECT_EQ(Group(*kept), std::vector<RK_Stuff*>{kept.get()});
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
  RK_TEST_Access::SetDiskCacheSize(*original, 4096);
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  original->AddStuff(a);
  original->AddStuff(b);
  {
    auto copy = NewBag();
    *copy = *original;
    EXPECT_EQ(RK_TEST_Access::Order(*copy), RK_TEST_Access::Order(*original));
    EXPECT_TRUE(copy->IsDiskCacheEnabled());
    EXPECT_EQ(copy->GetCurrentDiskCacheSize(), 4096);
  }
  // Destroying the copy leaves the items in the bag they are in.
  EXPECT_EQ(a->GetBag(), original);
  original->RemoveStuff(a.get());
  EXPECT_EQ(RK_TEST_Access::Order(*original), std::vector<RK_Stuff*>{b.get()});
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
  second.reset();
  EXPECT_EQ(bag->GetStuffCount(), 0u);
}

TEST_F(BagTest, DestroyingABagReleasesItsItemsQuietly) {
  auto local = NewBag();
  auto a = TestStuff::Make();
  auto b = TestStuff::Make();
  a->AddToBagAndSortDir(local, {});
  b->AddToBagAndSortDir(local, {});
  local.reset();
  EXPECT_FALSE(a->GetBag() || b->GetBag());
  EXPECT_EQ(Group(*a), std::vector<RK_Stuff*>{a.get()});
  EXPECT_TRUE(rktest::Verifications().empty());
  // The items can enter another bag now.
  bag->AddStuff(a);
  EXPECT_EQ(a->GetBag(), bag);
}

}  // namespace
