// Lookup by request: only the request's GUID group is asked, identical
// candidates win over satisfying ones, refused candidates are passed over,
// and the was-on-disk flag follows the candidates tried.
#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>
#include <string>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::time_duration;
using rktest::Journal;
using rktest::TestStuff;
using rktest::TestStuffPtr;

constexpr int kReadOnly = RK_Checkout_ReadOnly;

class LookupTest : public ::testing::Test {
 protected:
  void SetUp() override {
    rkhost::control::MakeCurrentThreadMain();
    RK_Birth(false);
    rkhost::control::ClearCaptured();
    bag = RK_GlobalBag();
    dir = RK_GlobalSortDir();
    journal = std::make_shared<Journal>();
    request = TestStuff::Make(1, false, false, journal, "request");
  }
  void TearDown() override {
    bag.reset();
    dir.reset();
    RK_StopAllAsyncWork();
    RK_Death();
  }

  // An item of the request's GUID, entered into bag and directory. Items
  // never supersede each other here.
  TestStuffPtr Candidate(const std::string& name, bool identical, bool satisfies, bool inMemory = true) {
    TestStuffPtr item = TestStuff::Make(10, inMemory, false, journal, name);
    item->SetGuid(request->GetGuid());
    // Entering asks the new item's CanSatisfyRequest about the group, which
    // must keep everyone; the answers for lookups are set afterwards.
    item->SetCanSatisfy([](const RK_Stuff*) { return false; });
    item->AddToBagAndSortDir(bag, time_duration());
    item->SetIdentical([identical](const RK_Stuff*) { return identical; });
    item->SetCanSatisfy([satisfies](const RK_Stuff*) { return satisfies; });
    return item;
  }
  TestStuffPtr Candidate(const std::string& name, bool identical, bool satisfies, bool inMemory,
                         bool onDisk) {
    TestStuffPtr item = Candidate(name, identical, satisfies, inMemory);
    item->SetOnDisk(onDisk);
    return item;
  }

  boost::shared_ptr<RK_Bag> bag;
  boost::shared_ptr<RK_SortDir> dir;
  std::shared_ptr<Journal> journal;
  TestStuffPtr request;
};

TEST_F(LookupTest, AskedOnlyInItsGroupAndNotFoundWithoutOne) {
  TestStuffPtr other = TestStuff::Make(10, true, false, journal, "other");
  other->AddToBagAndSortDir(bag, time_duration());
  journal->Clear();
  RK_Stuff* found = reinterpret_cast<RK_Stuff*>(0x1);
  bool wasOnDisk = true;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &found, &wasOnDisk),
            RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(found, nullptr);
  EXPECT_TRUE(wasOnDisk);  // untouched
  EXPECT_TRUE(journal->Events().empty());
  EXPECT_EQ(other->GetCheckoutCount(), 0u);
  // The call released its reference to the request.
  EXPECT_EQ(request->RefCountForDiagnostics(), 1u);

  // An item of the request's GUID is found; the others are never asked.
  TestStuffPtr a = Candidate("a", true, true);
  journal->Clear();
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &found, &wasOnDisk), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, a.get());
  EXPECT_FALSE(wasOnDisk);
  EXPECT_EQ(a->GetCheckoutCount(), 1u);
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"a:IdenticalRequest"}));
  EXPECT_EQ(request->RefCountForDiagnostics(), 1u);
  found->Checkin(0, time_duration());
}

TEST_F(LookupTest, IdenticalCandidatesWinOverEarlierSatisfyingOnes) {
  TestStuffPtr s = Candidate("s", false, true);
  TestStuffPtr i = Candidate("i", true, true);
  journal->Clear();
  RK_Stuff* found = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &found, nullptr), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, i.get());
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"s:IdenticalRequest", "i:IdenticalRequest"}));
  found->Checkin(0, time_duration());

  // Without an identical one, the second pass takes the first satisfying
  // one, asking every candidate again from the start of the group.
  i->SetIdentical([](const RK_Stuff*) { return false; });
  journal->Clear();
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &found, nullptr), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, s.get());
  EXPECT_EQ(journal->Events(),
            (std::vector<std::string>{"s:IdenticalRequest", "i:IdenticalRequest", "s:CanSatisfyRequest"}));
  found->Checkin(0, time_duration());

  // Neither: nothing found, every candidate asked twice.
  s->SetCanSatisfy([](const RK_Stuff*) { return false; });
  i->SetCanSatisfy([](const RK_Stuff*) { return false; });
  journal->Clear();
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &found, nullptr), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(found, nullptr);
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"s:IdenticalRequest", "i:IdenticalRequest",
                                                         "s:CanSatisfyRequest", "i:CanSatisfyRequest"}));
}

TEST_F(LookupTest, RefusedCandidatesArePassedOverAndWasOnDiskFollowsTheLastTried) {
  // Identical but only on disk (refused by OnlyIfInMemory), identical in
  // memory, and a satisfying one.
  TestStuffPtr d = Candidate("d", true, true, false, true);
  TestStuffPtr m = Candidate("m", true, true);
  TestStuffPtr s = Candidate("s", false, true);
  journal->Clear();
  RK_Stuff* found = nullptr;
  bool wasOnDisk = true;
  const int flags = kReadOnly | RK_Checkout_OnlyIfInMemory;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), flags, &found, &wasOnDisk), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, m.get());
  EXPECT_FALSE(wasOnDisk);
  EXPECT_EQ(d->GetCheckoutCount(), 0u);
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"d:IdenticalRequest", "m:IdenticalRequest"}));
  found->Checkin(0, time_duration());

  // m out of memory too: pass 1 refuses both, pass 2 reaches s after trying
  // d and m again.
  m->SetInMemory(false);
  m->SetOnDisk(true);
  s->SetInMemory(false);
  s->SetOnDisk(true);
  journal->Clear();
  EXPECT_EQ(dir->FindAndCheckout(request.get(), flags, &found, &wasOnDisk), RK_CheckoutResult_NotCheckedOut);
  EXPECT_TRUE(wasOnDisk);  // s, the last tried, is on disk
  EXPECT_EQ(found, nullptr);
  EXPECT_EQ(journal->Events(),
            (std::vector<std::string>{"d:IdenticalRequest", "m:IdenticalRequest", "s:IdenticalRequest",
                                      "d:CanSatisfyRequest", "m:CanSatisfyRequest", "s:CanSatisfyRequest"}));

  // DontRead accepts on-disk items: the first identical one is taken.
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly | RK_Checkout_DontRead, &found, &wasOnDisk),
            RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, d.get());
  EXPECT_TRUE(wasOnDisk);
  found->Checkin(0, time_duration());
  for (const TestStuffPtr& item : {d, m, s}) EXPECT_EQ(item->GetCheckoutCount(), 0u);
}

TEST_F(LookupTest, WriteableLookupsTakeTheItemOutAndStopAtAConflict) {
  TestStuffPtr a = Candidate("a", true, true);
  TestStuffPtr b = Candidate("b", true, true);
  RK_Stuff* found = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), 0, &found, nullptr), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, a.get());
  EXPECT_TRUE(a->IsCheckedOutWriteable());
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *request), (std::vector<RK_Stuff*>{b.get()}));

  // The next writeable lookup finds b, and a read-only one finds b too.
  RK_Stuff* second = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly, &second, nullptr), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(second, b.get());
  // A writeable lookup whose match is held read-only throws the conflict
  // instead of moving on; nothing is found.
  RK_Stuff* third = reinterpret_cast<RK_Stuff*>(0x1);
  int code = 0;
  try {
    dir->FindAndCheckout(request.get(), 0, &third, nullptr);
  } catch (int c) {
    code = c;
  }
  EXPECT_EQ(code, 0x3A03);
  EXPECT_EQ(third, nullptr);
  EXPECT_EQ(b->GetCheckoutCount(), 1u);
  EXPECT_EQ(request->RefCountForDiagnostics(), 1u);
  ASSERT_EQ(rkhost::control::Snapshot().errorReports.size(), 1u);
  EXPECT_EQ(rkhost::control::Snapshot().errorReports[0].detail,
            "cannot check-out read/write already checked-out item");

  second->Checkin(0, time_duration());
  // Back in the directory after its check-in, at the end of its group...
  a->SetCanSatisfy([](const RK_Stuff*) { return false; });
  found->Checkin(0, time_duration());
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *request), (std::vector<RK_Stuff*>{b.get(), a.get()}));
  EXPECT_FALSE(a->IsCheckedOutWriteable());
  // ...where its new data stands in for older items it can satisfy.
  ASSERT_EQ(dir->FindAndCheckout(request.get(), 0, &found, nullptr), RK_CheckoutResult_CheckedOut);
  ASSERT_EQ(found, b.get());
  b->SetCanSatisfy([](const RK_Stuff*) { return true; });
  found->Checkin(0, time_duration());
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *request), (std::vector<RK_Stuff*>{b.get()}));
  EXPECT_FALSE(a->GetBag());
}

TEST_F(LookupTest, ACandidateHeldOnlyByTheDirectorySurvivesAWriteableLookup) {
  auto journal2 = journal;
  RK_Stuff* found = nullptr;
  { TestStuffPtr a = Candidate("a", true, true); }  // only the directory holds it now
  EXPECT_EQ(dir->FindAndCheckout(request.get(), 0, &found, nullptr), RK_CheckoutResult_CheckedOut);
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(journal2->Count("a:destroyed"), 0);
  EXPECT_EQ(found->RefCountForDiagnostics(), 1u);  // the check-out's
  found->Checkin(0, time_duration());
  EXPECT_EQ(journal2->Count("a:destroyed"), 0);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *request), (std::vector<RK_Stuff*>{found}));
}

TEST_F(LookupTest, AReadBackThatChangesTheDirectoryDoesNotDerailTheWalk) {
  // d's read-back "fails" in a way that drops e from the directory (the
  // host's item callbacks may re-enter the cache); the walk must not offer
  // e, and must go on to f.
  TestStuffPtr d = Candidate("d", true, true, false, true);
  TestStuffPtr e = Candidate("e", true, true, false, true);
  TestStuffPtr f = Candidate("f", true, true, true, false);
  d->SetIdentical([&](const RK_Stuff*) {
    e->RemoveFromBagAndSortDir();
    return true;
  });
  journal->Clear();
  RK_Stuff* found = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(request.get(), kReadOnly | RK_Checkout_OnlyIfInMemory, &found, nullptr),
            RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, f.get());
  EXPECT_EQ(journal->Count("e:IdenticalRequest"), 0);
  found->Checkin(0, time_duration());
}

}  // namespace
