// Lookup by request: only the request's GUID group is asked, identical
// candidates win, refused ones are passed over, was-on-disk follows the tries.
#include "support/module_fixture.h"

namespace {

using rktest::TestStuffPtr;

constexpr int kReadOnly = RK_Checkout_ReadOnly;
using Events = std::vector<std::string>;

class LookupTest : public rktest::ModuleTest {
 protected:
  void SetUp() override {
    ModuleTest::SetUp();
    request = Make("request", 1, false);
  }
  // An entered item of the request's GUID; items never supersede each other here.
  TestStuffPtr Candidate(const std::string& name, bool identical, bool satisfies, bool inMemory = true,
                         int onDisk = -1) {
    TestStuffPtr item = Make(name, 10, inMemory);
    item->SetGuid(request->GetGuid());
    item->SetCanSatisfy([](const RK_Stuff*) { return false; });
    Enter(item);
    item->SetIdentical([identical](const RK_Stuff*) { return identical; });
    item->SetCanSatisfy([satisfies](const RK_Stuff*) { return satisfies; });
    if (onDisk >= 0) item->SetOnDisk(onDisk == 1);
    journal->Clear();
    return item;
  }
  int Find(int flags, RK_Stuff** found, bool* wasOnDisk = nullptr) {
    return dir->FindAndCheckout(request.get(), flags, found, wasOnDisk);
  }

  TestStuffPtr request;
};

TEST_F(LookupTest, AskedOnlyInItsGroupAndNotFoundWithoutOne) {
  TestStuffPtr other = Enter(Make("other", 10));
  journal->Clear();
  RK_Stuff* found = reinterpret_cast<RK_Stuff*>(0x1);
  EXPECT_EQ(Find(kReadOnly, &found), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(found, nullptr);

  TestStuffPtr a = Candidate("a", true, true);
  EXPECT_EQ(Find(kReadOnly, &found), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, a.get());
  EXPECT_EQ(journal->Events(), Events{"a:IdenticalRequest"});
  EXPECT_EQ(request->RefCountForDiagnostics(), 1u);  // the call released its reference
  found->Checkin(0, {});
}

TEST_F(LookupTest, IdenticalCandidatesWinOverEarlierSatisfyingOnes) {
  TestStuffPtr s = Candidate("s", false, true);
  TestStuffPtr i = Candidate("i", true, true);
  RK_Stuff* found = nullptr;
  EXPECT_EQ(Find(kReadOnly, &found), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, i.get());
  found->Checkin(0, {});

  // Without an identical one, a second pass from the start of the group
  // takes the first satisfying one.
  i->SetIdentical([](const RK_Stuff*) { return false; });
  journal->Clear();
  EXPECT_EQ(Find(kReadOnly, &found), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, s.get());
  EXPECT_EQ(journal->Events(), (Events{"s:IdenticalRequest", "i:IdenticalRequest", "s:CanSatisfyRequest"}));
  found->Checkin(0, {});
}

TEST_F(LookupTest, RefusedCandidatesArePassedOverAndWasOnDiskFollowsTheLastTried) {
  // Identical but only on disk (refused by OnlyIfInMemory), identical in
  // memory, and a satisfying one.
  TestStuffPtr d = Candidate("d", true, true, false, 1);
  TestStuffPtr m = Candidate("m", true, true);
  TestStuffPtr s = Candidate("s", false, true);
  RK_Stuff* found = nullptr;
  bool wasOnDisk = true;
  const int flags = kReadOnly | RK_Checkout_OnlyIfInMemory;
  EXPECT_EQ(Find(flags, &found, &wasOnDisk), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, m.get());
  EXPECT_FALSE(wasOnDisk);
  found->Checkin(0, {});

  // All out of memory: both passes refuse every candidate.
  for (const TestStuffPtr& item : {m, s}) {
    item->SetInMemory(false);
    item->SetOnDisk(true);
  }
  journal->Clear();
  EXPECT_EQ(Find(flags, &found, &wasOnDisk), RK_CheckoutResult_NotCheckedOut);
  EXPECT_TRUE(wasOnDisk);
  EXPECT_EQ(journal->Events(), (Events{"d:IdenticalRequest", "m:IdenticalRequest", "s:IdenticalRequest",
                                       "d:CanSatisfyRequest", "m:CanSatisfyRequest", "s:CanSatisfyRequest"}));

  // DontRead accepts on-disk items.
  EXPECT_EQ(Find(kReadOnly | RK_Checkout_DontRead, &found, &wasOnDisk), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, d.get());
  EXPECT_TRUE(wasOnDisk);
  found->Checkin(0, {});
}

TEST_F(LookupTest, WriteableLookupsTakeTheItemOutAndStopAtAConflict) {
  TestStuffPtr a = Candidate("a", true, true);
  TestStuffPtr b = Candidate("b", true, true);
  RK_Stuff* found = nullptr;
  EXPECT_EQ(Find(0, &found), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, a.get());
  EXPECT_EQ(Group(*request), std::vector<RK_Stuff*>{b.get()});

  RK_Stuff* second = nullptr;
  EXPECT_EQ(Find(kReadOnly, &second), RK_CheckoutResult_CheckedOut);
  // A writeable lookup whose match is held read-only throws instead of moving on.
  RK_Stuff* third = reinterpret_cast<RK_Stuff*>(0x1);
  EXPECT_EQ(rktest::ThrownCode([&] { Find(0, &third); }), 0x3A03);
  EXPECT_EQ(third, nullptr);
  EXPECT_EQ(request->RefCountForDiagnostics(), 1u);
  second->Checkin(0, {});

  // Back at the end of its group after its check-in, where its new data
  // stands in for older items it can satisfy.
  found->Checkin(0, {});
  EXPECT_EQ(Group(*request), (std::vector<RK_Stuff*>{a.get()}));
  EXPECT_FALSE(b->GetBag());
}

TEST_F(LookupTest, ACandidateHeldOnlyByTheDirectorySurvivesAWriteableLookup) {
  Candidate("a", true, true);  // only the directory holds it now
  RK_Stuff* found = nullptr;
  ASSERT_EQ(Find(0, &found), RK_CheckoutResult_CheckedOut);
  found->Checkin(0, {});
  EXPECT_EQ(journal->Count("a:destroyed"), 0);
  EXPECT_EQ(Group(*request), std::vector<RK_Stuff*>{found});
}

TEST_F(LookupTest, AReadBackThatChangesTheDirectoryDoesNotDerailTheWalk) {
  // Asking d drops e from the directory (item callbacks may re-enter the
  // cache); the walk must not offer e, and must go on to f.
  TestStuffPtr d = Candidate("d", true, true, false, 1);
  TestStuffPtr e = Candidate("e", true, true, false, 1);
  TestStuffPtr f = Candidate("f", true, true, true, 0);
  d->SetIdentical([&](const RK_Stuff*) {
    e->RemoveFromBagAndSortDir();
    return true;
  });
  RK_Stuff* found = nullptr;
  EXPECT_EQ(Find(kReadOnly | RK_Checkout_OnlyIfInMemory, &found), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, f.get());
  EXPECT_EQ(journal->Count("e:IdenticalRequest"), 0);
  found->Checkin(0, {});
}

}  // namespace
