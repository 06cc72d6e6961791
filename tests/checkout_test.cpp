// Check-out and check-in of single items: conflicts with their codes and
// reports, the check-out flags, read-back from a real cache file, the
// check-in flags, writeable check-outs leaving and re-entering the
// directory, and which check-ins start a disk write.
#include <boost/date_time/posix_time/posix_time.hpp>
#include <chrono>
#include <filesystem>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "plinth/debug.h"
#include "rkcache/testing.h"
#include "support/file_stuff.h"
#include "support/module_fixture.h"

namespace {

using boost::posix_time::time_duration;
using rktest::FileStuff;
using rktest::ThrownCode;
using rktest::TestStuff;
using rktest::TestStuffPtr;

constexpr int kReadOnly = RK_Checkout_ReadOnly;
constexpr int kWriteable = 0;

const char* const kMsg11 = "cached item already checked-out read/write";
const char* const kMsg12 = "cannot check-out read/write already checked-out item";
const char* const kMsg19 = "cannot reference an ID which is not checked out";
const char* const kMsg22 = "can#{rsquo}t convert to writeable when not checked out";

class CheckoutTest : public rktest::ModuleTest {
 protected:
  void TearDown() override {
    plinth::debug::SetTraceSink({});
    plinth::debug::SetTraceLevel("RK_Stuff", -1);
    plinth::debug::CodeProfilerManager::Get().SetConditionalProfiling(false);
    ModuleTest::TearDown();
  }
};

TEST_F(CheckoutTest, ConflictsThrowTheirCodesAndReportOnlyOnTheMainThread) {
  TestStuffPtr item = Enter(TestStuff::Make());
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A03);
  EXPECT_EQ(item->GetCheckoutCount(), 2u);
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_TRUE(Indexed(*item));

  // Held once: the conversion succeeds and takes the item out of its
  // directory, whose link it keeps.
  item->Checkin(0, {});
  item->ConvertToWriteable();
  EXPECT_TRUE(item->IsCheckedOutWriteable());
  EXPECT_EQ(item->GetCheckoutCount(), 1u);
  EXPECT_FALSE(Indexed(*item));
  EXPECT_EQ(item->GetSortDir(), dir);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kReadOnly); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A03);
  EXPECT_EQ(item->GetCheckoutCount(), 1u);

  item->Checkin(0, {});
  EXPECT_TRUE(Indexed(*item));
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A04);
  // A check-in without a check-out changes nothing: count, last use, order.
  const auto lastUse = item->GetLastUseTime();
  const auto order = Order();
  EXPECT_EQ(ThrownCode([&] { item->Checkin(0, {}); }), 0x3A04);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_EQ(item->GetLastUseTime(), lastUse);
  EXPECT_EQ(Order(), order);
  EXPECT_EQ(rktest::ReportDetails(),
            (std::vector<std::string>{kMsg12, kMsg12, kMsg11, kMsg11, kMsg11, kMsg22, kMsg19}));

  // The same conflicts on a render thread and on another thread: the same
  // codes, and nothing reported.
  rkhost::control::ClearCaptured();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  TestStuffPtr held = Enter(TestStuff::Make());
  ASSERT_EQ(held->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  for (bool render : {true, false}) {
    std::vector<int> codes;
    rktest::OnThread(render, [&] {
      TestStuffPtr fresh = TestStuff::Make();
      for (auto f : std::vector<std::function<void()>>{[&] { item->Checkout(kWriteable); },
                                                       [&] { held->Checkout(kReadOnly); },
                                                       [&] { fresh->ConvertToWriteable(); },
                                                       [&] { fresh->Checkin(0, {}); }})
        codes.push_back(ThrownCode(f));
    });
    EXPECT_EQ(codes, (std::vector<int>{0x3A03, 0x3A03, 0x3A04, 0x3A04})) << "render thread: " << render;
  }
  EXPECT_TRUE(rktest::ReportDetails().empty());
  item->Checkin(0, {});
  held->Checkin(0, {});
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*held));
}

TEST_F(CheckoutTest, FlagsDecideWhichItemsCanBeCheckedOut) {
  // On disk (as the item says), not in memory, with no file to read.
  TestStuffPtr onDisk = Enter(Make("disk", 100, false));
  onDisk->SetOnDisk(true);
  EXPECT_EQ(onDisk->Checkout(kReadOnly | RK_Checkout_OnlyIfInMemory), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(onDisk->GetCheckoutCount(), 0u);
  EXPECT_EQ(onDisk->Checkout(kReadOnly | RK_Checkout_DontRead), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(onDisk->IsInMemory());
  EXPECT_EQ(onDisk->GetCheckoutCount(), 1u);
  onDisk->Checkin(0, {});
  // Without DontRead the item must be read back; with nothing to read that
  // fails, whatever else the flags say.
  EXPECT_EQ(onDisk->Checkout(kReadOnly | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(onDisk->GetCheckoutCount(), 0u);

  // Neither in memory nor on disk: only EvenIfNotInMemory gets it.
  TestStuffPtr empty = Enter(TestStuff::Make(100, false));
  empty->SetOnDisk(false);
  EXPECT_EQ(empty->Checkout(kReadOnly), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(empty->Checkout(kReadOnly | RK_Checkout_DontRead), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(empty->Checkout(kReadOnly | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_CheckedOut);
  empty->Checkin(RK_Checkin_KeepLastUse, {});

  // A writeable check-out that fails its final test (not in memory, and
  // writeable check-outs do not read back) leaves the item where lookups
  // find it, at its place in the group, with nothing changed.
  auto twin = TestStuff::Make(100, true);
  twin->SetGuid(onDisk->GetGuid());
  twin->SetCanSatisfy([](const RK_Stuff*) { return false; });  // keeps `onDisk` in the group
  Enter(twin);
  const std::vector<RK_Stuff*> group{onDisk.get(), twin.get()};
  ASSERT_EQ(Group(*onDisk), group);
  const auto changes = dir->GetLastChangeTime();
  EXPECT_EQ(onDisk->Checkout(kWriteable), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(onDisk->GetCheckoutCount(), 0u);
  EXPECT_EQ(Group(*onDisk), group);
  EXPECT_EQ(dir->GetLastChangeTime(), changes);
  RK_Stuff* found = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(onDisk.get(), kReadOnly | RK_Checkout_DontRead, &found, nullptr),
            RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, onDisk.get());
  found->Checkin(0, {});

  // Writeable with EvenIfNotInMemory: out of the directory until check-in.
  EXPECT_EQ(empty->Checkout(kWriteable | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(Indexed(*empty));
  empty->Checkin(0, {});
  EXPECT_TRUE(Indexed(*empty));
}

TEST_F(CheckoutTest, ExceptionsDuringCheckoutLeaveTheCountAsItWas) {
  TestStuffPtr item = Enter(TestStuff::Make());
  item->SetThrowFromIsInMemory(1234);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kReadOnly); }), 1234);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 1234);
  item->SetThrowFromIsInMemory(0);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
  EXPECT_EQ(item->RefCountForDiagnostics(), 2u);  // the test's and the directory's
}

TEST_F(CheckoutTest, ReadOnlyCheckoutReadsAnOnDiskItemBackFromItsCacheFile) {
  rktest::TempDir folder;
  const std::vector<unsigned char> bytes = rktest::CountingBytes(5000);
  auto item = Enter(FileStuff::Make(5000, journal, "f"));
  RK_TEST_Access::SetDiskCacheFile(*item, rktest::WriteFile(folder, "f.vxcache", bytes));
  RK_TEST_Access::SetDiskCacheSize(*bag, 5000);
  // Age the file so that the read's touch is visible.
  std::filesystem::last_write_time(folder.Path() + "/f.vxcache",
                                   std::filesystem::file_time_type::clock::now() - std::chrono::hours(1));
  ASSERT_LT(item->GetDiskCacheFile().Modified(), RK_Now() - boost::posix_time::minutes(30));

  std::mutex traceMutex;
  std::vector<std::string> traces;
  plinth::debug::SetTraceSink([&](const std::string& line) {
    std::lock_guard<std::mutex> lock(traceMutex);
    traces.push_back(line);
  });
  plinth::debug::SetTraceLevel("RK_Stuff", 10);
  auto& profiler = plinth::debug::CodeProfilerManager::Get();
  profiler.SetConditionalProfiling(true);
  profiler.SetProfilingVolume(6);

  // DontRead accepts the item as it is.
  ASSERT_EQ(item->Checkout(kReadOnly | RK_Checkout_DontRead), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(item->IsInMemory());
  item->Checkin(RK_Checkin_KeepLastUse, {});
  EXPECT_EQ(journal->Count("f:Read"), 0);

  const auto changes = dir->GetLastChangeTime();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  EXPECT_TRUE(item->IsInMemory());
  EXPECT_TRUE(item->IsOnDisk());
  EXPECT_EQ(item->Payload(), bytes);
  EXPECT_EQ(journal->Count("f:Read"), 1);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_GT(item->GetDiskCacheFile().Modified(), RK_Now() - boost::posix_time::minutes(30));
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 5000);
  item->Checkin(0, {});

  const std::vector<std::string> expectedSteps{"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"};
  std::vector<std::string> steps;
  for (const std::string& line : traces) {
    for (const std::string& step : expectedSteps) {
      if (line.find(step) == std::string::npos) continue;
      steps.push_back(step);
      EXPECT_NE(line.find("<RK_Stuff> <10> "), std::string::npos) << line;
    }
  }
  EXPECT_EQ(steps, expectedSteps);
  std::map<std::string, std::uint64_t> counts;
  for (const auto& log : profiler.Logs()) counts[log->Name()] += log->Count();
  EXPECT_EQ(counts["VX.render.RK_Stuff::PrepAndRead"], 1u);
  EXPECT_EQ(counts["VX.render.RK_Stuff::Checkout"], 2u);
  EXPECT_EQ(counts["VX.render.RK_Stuff::Checkin"], 2u);
  // A read-back pauses background writes.
  EXPECT_TRUE(RK_TEST_BackgroundExecutor()->Snapshot().suspended);
  EXPECT_TRUE(rktest::ReportDetails().empty());
}

TEST_F(CheckoutTest, AFailedReadBackDeletesTheCacheFileAndFailsTheCheckout) {
  rktest::TempDir folder;
  for (FileStuff::Failure failure : {FileStuff::Failure::kIoError, FileStuff::Failure::kIntCode}) {
    journal->Clear();
    rkhost::control::ClearCaptured();
    auto item = Enter(FileStuff::Make(3000, journal, "f"));
    auto file = rktest::WriteFile(folder, "bad.vxcache", rktest::CountingBytes(3000));
    RK_TEST_Access::SetDiskCacheFile(*item, file);
    RK_TEST_Access::SetDiskCacheSize(*bag, 10000);
    item->SetReadFailure(failure);
    const auto changes = dir->GetLastChangeTime();

    EXPECT_EQ(item->Checkout(kReadOnly | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_NotCheckedOut);
    EXPECT_EQ(item->GetCheckoutCount(), 0u);
    EXPECT_FALSE(file->Exists());
    EXPECT_FALSE(item->IsOnDisk());
    EXPECT_TRUE(item->GetDiskCacheFile().IsEmpty());
    EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 7000);
    EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);  // the deletion only
    EXPECT_EQ(journal->Events(), (std::vector<std::string>{"f:Read", "f:YourDiskCacheFileWasDeleted"}));
    EXPECT_TRUE(Indexed(*item));

    // A std::exception reaches the host's reporter, inside the quiet
    // bracket; an int code is dropped.
    const auto captured = rkhost::control::Snapshot();
    if (failure == FileStuff::Failure::kIoError) {
      ASSERT_EQ(captured.exceptions.size(), 1u);
      EXPECT_NE(captured.exceptions[0].find("payload unreadable"), std::string::npos);
      for (const auto& report : captured.errorReports) EXPECT_TRUE(report.suppressed);
    } else {
      EXPECT_TRUE(captured.exceptions.empty());
    }
    item->RemoveFromBagAndSortDir();
  }
}

TEST_F(CheckoutTest, EnsureInMemoryThrowsWhenQuietErrorsCannotStart) {
  rktest::TempDir folder;
  auto item = Enter(FileStuff::Make(100));
  auto file = rktest::WriteFile(folder, "q.vxcache", rktest::CountingBytes(100));
  RK_TEST_Access::SetDiskCacheFile(*item, file);
  rkhost::control::FailStartQuietErrors(41);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kReadOnly); }), 41);
  rkhost::control::FailStartQuietErrors(0);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(file->Exists());  // nothing was read, so nothing deleted
  EXPECT_TRUE(item->EnsureInMemory());
}

TEST_F(CheckoutTest, CheckinFlagsKeepLastUseDiscardAndFreeMemory) {
  TestStuffPtr a = Enter(Make("a", 10));
  TestStuffPtr b = Enter(Make("b", 10));
  // KeepLastUse: neither the stamp nor the place in the bag moves.
  const auto stampA = a->GetLastUseTime();
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  a->Checkin(RK_Checkin_KeepLastUse, {});
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{a.get(), b.get()}));

  // A plain check-in is a use: stamped with the check-in time, moved to the
  // young end.
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  const auto before = RK_Now();
  a->Checkin(0, {});
  EXPECT_GE(a->GetLastUseTime(), before);
  EXPECT_LE(a->GetLastUseTime(), RK_Now());
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{b.get(), a.get()}));

  // FreeMemory on an item that is also on disk frees its memory and keeps it.
  a->SetOnDisk(true);
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  a->Checkin(RK_Checkin_FreeMemory, {});
  EXPECT_FALSE(a->IsInMemory());
  EXPECT_TRUE(Indexed(*a));
  // FreeMemory on an item in memory only drops it from bag and directory.
  ASSERT_EQ(b->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  b->Checkin(RK_Checkin_FreeMemory | RK_Checkin_WriteNow, {});
  EXPECT_FALSE(Indexed(*b));
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});

  // Discard wins over FreeMemory: the item leaves bag and directory, is told
  // to free its memory, and dies with its last reference.
  TestStuffPtr c = Enter(Make("c", 10));
  c->SetOnDisk(true);
  ASSERT_EQ(c->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  journal->Clear();
  c->Checkin(RK_Checkin_Discard | RK_Checkin_FreeMemory, {});
  EXPECT_FALSE(Indexed(*c));
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"c:FreeMemory"}));
  c.reset();
  EXPECT_EQ(journal->Count("c:destroyed"), 1);
}

TEST_F(CheckoutTest, TheLastCheckinOfAnUnheldItemMayDestroyItOnlyAtTheEnd) {
  RK_Stuff* raw = nullptr;
  {
    TestStuffPtr item = Make("x", 10);  // in no bag or directory
    ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
    raw = item.get();
  }
  // Only the check-out keeps it now; the check-in runs to its end first.
  EXPECT_EQ(journal->Count("x:destroyed"), 0);
  raw->Checkin(0, {});
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"x:destroyed"}));
}

TEST_F(CheckoutTest, WriteableCheckinStartsOneBackgroundWriteWhenWorthIt) {
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  executor->Suspend();  // keep submitted jobs queued where they can be counted
  bag->EnableDiskCache(true);
  TestStuffPtr item = Enter(TestStuff::Make(1000));
  item->SetCanDiskCache(true);
  const time_duration costly = boost::posix_time::seconds(2);
  const auto cycle = [&](int checkoutFlags, const time_duration& computeTime, int checkinFlags = 0) {
    ASSERT_EQ(item->Checkout(checkoutFlags), RK_CheckoutResult_CheckedOut);
    item->Checkin(checkinFlags, computeTime);
  };

  cycle(kReadOnly, costly);
  EXPECT_EQ(executor->Snapshot().ready, 0u) << "a read-only check-in never writes";
  cycle(kWriteable, boost::posix_time::milliseconds(1));
  EXPECT_EQ(executor->Snapshot().ready, 0u) << "1 ms is not worth a write";
  cycle(kWriteable, costly);
  EXPECT_EQ(executor->Snapshot().ready, 1u);

  // Not in memory, or not disk-cacheable, or the bag's disk cache off: no write.
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->SetInMemory(false);
  item->SetOnDisk(true);
  item->Checkin(0, costly);
  item->SetInMemory(true);
  item->SetCanDiskCache(false);
  cycle(kWriteable, costly);
  item->SetCanDiskCache(true);
  bag->EnableDiskCache(false);
  cycle(kWriteable, costly);
  EXPECT_EQ(executor->Snapshot().ready, 1u);
  // The queued job holds its own reference to the item.
  EXPECT_EQ(item->RefCountForDiagnostics(), 3u);

  // After the executor is gone, a check-in that would write returns normally.
  bag->EnableDiskCache(true);
  executor.reset();
  RK_StopAllAsyncWork();
  EXPECT_EQ(item->RefCountForDiagnostics(), 2u);  // the dropped job released it
  cycle(kWriteable, costly);
  cycle(kReadOnly, costly, RK_Checkin_WriteNow);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
}

}  // namespace
