// Receipts: checking in on reuse and destruction, release, swap, move,
// errors in the destructor, the was-on-disk flag, and shared copies.
#include "support/file_stuff.h"
#include "support/module_fixture.h"

namespace {

using rktest::TestStuff;
using rktest::TestStuffPtr;
using rktest::ThrownCode;

constexpr int kReadOnly = RK_Checkout_ReadOnly;

using ReceiptTest = rktest::ModuleTest;

TEST_F(ReceiptTest, ChecksInOnReuseAndDestructionButNotAfterAFailedCheckout) {
  TestStuffPtr a = Enter(TestStuff::Make());
  TestStuffPtr b = Enter(TestStuff::Make());
  {
    RK_ScCheckout receipt(a.get(), kReadOnly);
    EXPECT_EQ(receipt.Checkout(a.get(), kReadOnly), RK_CheckoutResult_CheckedOut);
    EXPECT_EQ(a->GetCheckoutCount(), 1u);  // the first was checked in first
    EXPECT_EQ(receipt.Checkout(b.get(), kReadOnly), RK_CheckoutResult_CheckedOut);
    EXPECT_EQ(a->GetCheckoutCount(), 0u);
    EXPECT_EQ(receipt.FindAndCheckout(a.get(), kReadOnly), RK_CheckoutResult_CheckedOut);
    EXPECT_EQ(b->GetCheckoutCount(), 0u);
  }
  EXPECT_EQ(a->GetCheckoutCount(), 0u);

  // A failed check-out holds nothing, so its destructor checks nothing in.
  a->SetInMemory(false);
  {
    RK_ScCheckout receipt(a.get(), kReadOnly | RK_Checkout_OnlyIfInMemory);
    EXPECT_FALSE(receipt.DidCheckout());
    a->SetInMemory(true);
    ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);  // someone else's
  }
  EXPECT_EQ(a->GetCheckoutCount(), 1u);
  a->Checkin(0, {});

  // Checkin passes its flags and empties the receipt; a second does nothing.
  RK_ScCheckout receipt(a.get(), kReadOnly);
  receipt.Checkin(RK_Checkin_Discard, {});
  EXPECT_FALSE(a->GetBag());
  receipt.Checkin(0, {});
  EXPECT_EQ(a->GetCheckoutCount(), 0u);

  // Without a global directory nothing is found.
  RK_StopAllAsyncWork();
  dir.reset();
  RK_Death();
  EXPECT_EQ(receipt.FindAndCheckout(b.get(), kReadOnly), RK_CheckoutResult_NotCheckedOut);
  RK_Birth(false);
}

TEST_F(ReceiptTest, ReleaseHandsTheCheckoutOverAndSwapAndMoveTransferIt) {
  TestStuffPtr a = Enter(TestStuff::Make());
  RK_Stuff* released = nullptr;
  {
    RK_ScCheckout receipt(a.get(), kReadOnly);
    released = receipt.Release();
    EXPECT_EQ(released, a.get());
    EXPECT_EQ(a->RefCountForDiagnostics(), 4u);  // test, directory, check-out, receipt
  }
  EXPECT_EQ(a->GetCheckoutCount(), 1u);  // the destructor did not check in
  released->Checkin(0, {});

  RK_ScCheckout holder(a.get(), kReadOnly);
  {
    RK_ScCheckout empty;
    empty.Swap(holder);
    EXPECT_FALSE(holder.DidCheckout());
  }
  EXPECT_EQ(a->GetCheckoutCount(), 0u);  // checked in once, by the new holder

  RK_ScCheckout first(a.get(), kReadOnly);
  RK_ScCheckout moved(std::move(first));
  EXPECT_FALSE(first.DidCheckout());  // NOLINT(bugprone-use-after-move): a moved-from receipt is empty
  RK_ScCheckout target;
  target = std::move(moved);
  EXPECT_EQ(a->GetCheckoutCount(), 1u);
  target = RK_ScCheckout();
  EXPECT_EQ(a->GetCheckoutCount(), 0u);
}

TEST_F(ReceiptTest, CopiesShareOneCheckoutAndCheckItInOnce) {
  TestStuffPtr a = Enter(TestStuff::Make());
  TestStuffPtr b = Enter(TestStuff::Make());
  {
    RK_ScCheckout original(a.get(), kReadOnly);
    EXPECT_EQ(a->RefCountForDiagnostics(), 3u);  // a lone holder takes no reference
    {
      RK_ScCheckout copy(original);
      RK_ScCheckout another = copy;
      EXPECT_EQ(a->GetCheckoutCount(), 1u);
      EXPECT_EQ(a->RefCountForDiagnostics(), 5u);  // each copy keeps the item alive
    }
    EXPECT_EQ(a->RefCountForDiagnostics(), 3u);
  }
  EXPECT_EQ(a->RefCountForDiagnostics(), 2u);

  // The last holder checks in with its own flags.
  {
    RK_ScCheckout original(a.get(), kReadOnly);
    RK_ScCheckout copy(original);
    original.Checkin(RK_Checkin_Discard, {});
    EXPECT_EQ(a->GetCheckoutCount(), 1u);
    copy.Checkin(RK_Checkin_KeepLastUse, {});
    EXPECT_EQ(a->GetCheckoutCount(), 0u);
    EXPECT_TRUE(a->GetBag());
  }

  // Assignment lets go of what the target held, then shares the source's.
  {
    RK_ScCheckout onA(a.get(), kReadOnly);
    RK_ScCheckout onB(b.get(), kReadOnly);
    onB = onA;
    EXPECT_EQ(b->GetCheckoutCount(), 0u);
    RK_ScCheckout& alias = onB;
    onB = alias;
    onA = RK_ScCheckout();
    EXPECT_EQ(a->GetCheckoutCount(), 1u);
  }
  EXPECT_EQ(a->GetCheckoutCount(), 0u);

  // Release from one copy takes the check-out away from every copy.
  RK_Stuff* released = nullptr;
  {
    RK_ScCheckout original(a.get(), kReadOnly);
    RK_ScCheckout copy(original);
    released = copy.Release();
    EXPECT_FALSE(original.DidCheckout());
  }
  EXPECT_EQ(a->GetCheckoutCount(), 1u);
  EXPECT_EQ(a->RefCountForDiagnostics(), 3u);
  released->Checkin(0, {});

  // Copies on two threads let go at the same time: exactly one check-in.
  for (int round = 0; round < 50; ++round) {
    auto* original = new RK_ScCheckout(a.get(), kReadOnly);
    RK_ScCheckout copy(*original);
    std::thread other([original] { delete original; });
    copy.Checkin(0, {});
    other.join();
    ASSERT_EQ(a->GetCheckoutCount(), 0u);
  }
  EXPECT_TRUE(rktest::ReportDetails().empty());
}

TEST_F(ReceiptTest, WasOnDiskAndEnsureInMemory) {
  rktest::TempDir folder;
  auto item = Enter(rktest::FileStuff::Make(64));
  RK_TEST_Access::SetDiskCacheFile(*item, rktest::WriteFile(folder, "r.vxcache", rktest::CountingBytes(64)));
  {
    RK_ScCheckout receipt(item.get(), kReadOnly);
    ASSERT_TRUE(receipt.IsInMemory());
    // Still true once the item's file is gone: it was on disk when tried.
    RK_TEST_Access::SetDiskCacheFile(*item, nullptr);
    EXPECT_TRUE(receipt.IsOnDisk());
    receipt.Checkin(0, {});
    EXPECT_FALSE(receipt.IsOnDisk());
  }

  // EnsureInMemory empties a receipt whose item cannot be brought in.
  auto gone = Enter(TestStuff::Make(10, false));
  gone->SetOnDisk(true);
  RK_ScCheckout receipt(gone.get(), kReadOnly | RK_Checkout_DontRead);
  ASSERT_TRUE(receipt.DidCheckout());
  receipt.EnsureInMemory();
  EXPECT_FALSE(receipt.DidCheckout());
  EXPECT_EQ(gone->GetCheckoutCount(), 0u);
  // A failed check-out still records whether the item was on disk.
  EXPECT_EQ(receipt.Checkout(gone.get(), kReadOnly | RK_Checkout_OnlyIfInMemory),
            RK_CheckoutResult_NotCheckedOut);
  EXPECT_TRUE(receipt.IsOnDisk());
}

TEST_F(ReceiptTest, ConflictsLeaveTheReceiptEmptyAndTheDestructorSwallowsCheckinErrors) {
  TestStuffPtr a = Enter(TestStuff::Make());
  RK_ScCheckout writer(a.get(), 0);
  EXPECT_EQ(ThrownCode([&] { RK_ScCheckout reader(a.get(), kReadOnly); }), 0x3A03);
  // A conflict in a lookup empties the receipt, which checked in what it held first.
  TestStuffPtr b = Enter(TestStuff::Make());
  RK_ScCheckout holdsB(b.get(), kReadOnly);
  RK_ScCheckout reader(b.get(), kReadOnly);
  EXPECT_EQ(ThrownCode([&] { reader.FindAndCheckout(b.get(), 0); }), 0x3A03);
  EXPECT_FALSE(reader.DidCheckout());
  EXPECT_EQ(b->GetCheckoutCount(), 1u);
  writer.Release()->Checkin(0, {});

  // Ended behind the receipt's back, its destructor's check-in fails quietly.
  rkhost::control::ClearCaptured();
  rktest::OnThread(true, [&] {
    RK_ScCheckout held(a.get(), kReadOnly);
    a->Checkin(0, {});
  });
  EXPECT_EQ(a->GetCheckoutCount(), 0u);
  EXPECT_TRUE(rkhost::control::Snapshot().errorReports.empty());
  EXPECT_TRUE(rkhost::control::Snapshot().exceptions.empty());
}

}  // namespace
