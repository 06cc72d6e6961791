// Check-out and check-in of single items: conflicts with their codes and
// reports, the check-out flags, read-back from a real cache file, the
// check-in flags, writeable check-outs leaving and re-entering the
// directory, and which check-ins start a disk write.
#include <gtest/gtest.h>

#include <boost/date_time/posix_time/posix_time.hpp>
#include <chrono>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "plinth/debug.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/file_stuff.h"
#include "support/temp_dir.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace {

using boost::posix_time::milliseconds;
using boost::posix_time::seconds;
using boost::posix_time::time_duration;
using rktest::FileStuff;
using rktest::Journal;
using rktest::TestStuff;
using rktest::TestStuffPtr;

constexpr int kReadOnly = RK_Checkout_ReadOnly;
constexpr int kWriteable = 0;

const char* const kMsg11 = "cached item already checked-out read/write";
const char* const kMsg12 = "cannot check-out read/write already checked-out item";
const char* const kMsg19 = "cannot reference an ID which is not checked out";
const char* const kMsg22 = "can#{rsquo}t convert to writeable when not checked out";

class CheckoutTest : public ::testing::Test {
 protected:
  void SetUp() override {
    rkhost::control::MakeCurrentThreadMain();
    RK_Birth(false);
    rkhost::control::ClearCaptured();
    bag = RK_GlobalBag();
    dir = RK_GlobalSortDir();
  }
  void TearDown() override {
    plinth::debug::SetTraceSink({});
    plinth::debug::SetTraceLevel("RK_Stuff", -1);
    plinth::debug::CodeProfilerManager::Get().SetConditionalProfiling(false);
    bag.reset();
    dir.reset();
    RK_StopAllAsyncWork();
    RK_Death();
  }

  template <class T>
  boost::intrusive_ptr<T> Enter(boost::intrusive_ptr<T> item) {
    item->AddToBagAndSortDir(bag, time_duration(0, 0, 0));
    return item;
  }
  bool Indexed(const RK_Stuff& item) const {
    for (RK_Stuff* s : RK_TEST_Access::Group(*dir, item))
      if (s == &item) return true;
    return false;
  }
  // Runs f, which must throw an int; returns it (or -1 if nothing was thrown).
  template <class F>
  static int ThrownCode(F&& f) {
    try {
      f();
    } catch (int code) {
      return code;
    }
    return -1;
  }
  // The detail texts of the error reports captured so far; each must carry
  // the module's group and the number 2.
  static std::vector<std::string> Reports() {
    std::vector<std::string> out;
    for (const auto& r : rkhost::control::Snapshot().errorReports) {
      EXPECT_EQ(r.group, 0x3A0000);
      EXPECT_EQ(r.number, 2);
      out.push_back(r.detail);
    }
    return out;
  }

  boost::shared_ptr<RK_Bag> bag;
  boost::shared_ptr<RK_SortDir> dir;
};

TEST_F(CheckoutTest, ConflictsThrowTheirCodesAndReportOnlyOnTheMainThread) {
  TestStuffPtr item = Enter(TestStuff::Make());

  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(item->GetCheckoutCount(), 2u);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A03);
  EXPECT_EQ(item->GetCheckoutCount(), 2u);
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_TRUE(Indexed(*item));

  // Held once: the conversion succeeds and takes the item out of its
  // directory, whose link it keeps.
  item->Checkin(0, time_duration());
  item->ConvertToWriteable();
  EXPECT_TRUE(item->IsCheckedOutWriteable());
  EXPECT_EQ(item->GetCheckoutCount(), 1u);
  EXPECT_FALSE(Indexed(*item));
  EXPECT_EQ(item->GetSortDir(), dir);

  EXPECT_EQ(ThrownCode([&] { item->Checkout(kReadOnly); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 0x3A03);
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A03);
  EXPECT_EQ(item->GetCheckoutCount(), 1u);

  item->Checkin(0, time_duration());
  EXPECT_TRUE(Indexed(*item));
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  EXPECT_EQ(ThrownCode([&] { item->ConvertToWriteable(); }), 0x3A04);

  // A check-in without a check-out changes nothing: not the count, not the
  // last use, not the bag's order.
  const auto lastUse = item->GetLastUseTime();
  const auto order = RK_TEST_Access::Order(*bag);
  EXPECT_EQ(ThrownCode([&] { item->Checkin(0, time_duration()); }), 0x3A04);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_EQ(item->GetLastUseTime(), lastUse);
  EXPECT_EQ(RK_TEST_Access::Order(*bag), order);

  EXPECT_EQ(Reports(), (std::vector<std::string>{kMsg12, kMsg12, kMsg11, kMsg11, kMsg11, kMsg22, kMsg19}));

  // The same conflicts on a render thread and on another thread: the same
  // codes, and nothing reported.
  rkhost::control::ClearCaptured();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  TestStuffPtr held = Enter(TestStuff::Make());
  ASSERT_EQ(held->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  for (bool render : {true, false}) {
    std::vector<int> codes;
    std::thread other([&] {
      rkhost::control::SetCurrentThreadIsRenderThread(render);
      codes.push_back(ThrownCode([&] { item->Checkout(kWriteable); }));
      codes.push_back(ThrownCode([&] { item->ConvertToWriteable(); }));
      codes.push_back(ThrownCode([&] { held->Checkout(kReadOnly); }));
      TestStuffPtr fresh = TestStuff::Make();
      codes.push_back(ThrownCode([&] { fresh->ConvertToWriteable(); }));
      codes.push_back(ThrownCode([&] { fresh->Checkin(0, time_duration()); }));
    });
    other.join();
    EXPECT_EQ(codes, (std::vector<int>{0x3A03, 0x3A03, 0x3A03, 0x3A04, 0x3A04}))
        << "render thread: " << render;
  }
  EXPECT_TRUE(Reports().empty());
  item->Checkin(0, time_duration());
  item->Checkin(0, time_duration());
  held->Checkin(0, time_duration());
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_EQ(held->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
  EXPECT_TRUE(Indexed(*held));
}

TEST_F(CheckoutTest, FlagsDecideWhichItemsCanBeCheckedOut) {
  auto journal = std::make_shared<Journal>();
  // On disk (as the item says), not in memory, with no file to read.
  TestStuffPtr onDisk = Enter(TestStuff::Make(100, false, false, journal, "disk"));
  onDisk->SetOnDisk(true);

  EXPECT_EQ(onDisk->Checkout(kReadOnly | RK_Checkout_OnlyIfInMemory), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(onDisk->GetCheckoutCount(), 0u);
  EXPECT_EQ(onDisk->Checkout(kReadOnly | RK_Checkout_DontRead), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(onDisk->IsInMemory());
  EXPECT_EQ(onDisk->GetCheckoutCount(), 1u);
  onDisk->Checkin(0, time_duration());
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
  empty->Checkin(RK_Checkin_KeepLastUse, time_duration());

  // A writeable check-out that fails its final test (not in memory, and
  // writeable check-outs do not read back) leaves the item where lookups
  // find it, at its place in the group, with nothing changed.
  auto twin = TestStuff::Make(100, true);
  twin->SetGuid(onDisk->GetGuid());
  twin->SetCanSatisfy([](const RK_Stuff*) { return false; });  // keeps `onDisk` in the group
  Enter(twin);
  const std::vector<RK_Stuff*> group = RK_TEST_Access::Group(*dir, *onDisk);
  ASSERT_EQ(group, (std::vector<RK_Stuff*>{onDisk.get(), twin.get()}));
  const auto changes = dir->GetLastChangeTime();
  EXPECT_EQ(onDisk->Checkout(kWriteable), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(onDisk->GetCheckoutCount(), 0u);
  EXPECT_EQ(RK_TEST_Access::Group(*dir, *onDisk), group);
  EXPECT_EQ(onDisk->GetSortDir(), dir);
  EXPECT_EQ(dir->GetLastChangeTime(), changes);
  RK_Stuff* found = nullptr;
  EXPECT_EQ(dir->FindAndCheckout(onDisk.get(), kReadOnly | RK_Checkout_DontRead, &found, nullptr),
            RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(found, onDisk.get());
  found->Checkin(0, time_duration());

  // Writeable with EvenIfNotInMemory: out of the directory until check-in.
  EXPECT_EQ(empty->Checkout(kWriteable | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(Indexed(*empty));
  empty->Checkin(0, time_duration());
  EXPECT_TRUE(Indexed(*empty));
  EXPECT_EQ(journal->Count("disk:destroyed"), 0);
}

TEST_F(CheckoutTest, ExceptionsDuringCheckoutLeaveTheCountAsItWas) {
  TestStuffPtr item = Enter(TestStuff::Make());
  item->SetThrowFromIsInMemory(1234);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kReadOnly); }), 1234);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 1234);
  item->SetThrowFromIsInMemory(0);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
  // Exactly one reference each: the test's and the directory's.
  EXPECT_EQ(item->RefCountForDiagnostics(), 2u);
}

TEST_F(CheckoutTest, ReadOnlyCheckoutReadsAnOnDiskItemBackFromItsCacheFile) {
  rktest::TempDir folder;
  auto journal = std::make_shared<Journal>();
  const std::vector<unsigned char> bytes = rktest::CountingBytes(5000);
  auto item = Enter(FileStuff::Make(5000, journal, "f"));
  RK_TEST_Access::SetDiskCacheFile(*item, rktest::WriteFile(folder, "f.vxcache", bytes));
  RK_TEST_Access::SetDiskCacheSize(*bag, 5000);
  // Age the file so that the read's touch is visible.
  std::filesystem::last_write_time(folder.Path() + "/f.vxcache",
                                   std::filesystem::file_time_type::clock::now() - std::chrono::hours(1));
  const auto agedTime = item->GetDiskCacheFile().Modified();
  ASSERT_LT(agedTime, RK_Now() - boost::posix_time::minutes(30));

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
  item->Checkin(RK_Checkin_KeepLastUse, time_duration());
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
  item->Checkin(0, time_duration());

  std::vector<std::string> steps;
  for (const std::string& line : traces) {
    for (const char* step : {"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"}) {
      if (line.find(step) != std::string::npos) {
        steps.push_back(step);
        EXPECT_NE(line.find("<RK_Stuff> <10> "), std::string::npos) << line;
      }
    }
  }
  EXPECT_EQ(steps, (std::vector<std::string>{"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"}));
  bool sawRead = false;
  for (const auto& log : profiler.Logs()) {
    if (log->Name() == "VX.render.RK_Stuff::PrepAndRead") {
      sawRead = true;
      EXPECT_EQ(log->Count(), 1u);
    }
    if (log->Name() == "VX.render.RK_Stuff::Checkout" || log->Name() == "VX.render.RK_Stuff::Checkin") {
      EXPECT_EQ(log->Count(), 2u) << log->Name();
    }
  }
  EXPECT_TRUE(sawRead);
  // A read-back pauses background writes.
  EXPECT_TRUE(RK_TEST_BackgroundExecutor()->Snapshot().suspended);
  EXPECT_TRUE(Reports().empty());
}

TEST_F(CheckoutTest, AFailedReadBackDeletesTheCacheFileAndFailsTheCheckout) {
  rktest::TempDir folder;
  auto journal = std::make_shared<Journal>();
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
  EXPECT_TRUE(item->EnsureInMemory());  // already in memory: no second read
}

TEST_F(CheckoutTest, CheckinFlagsKeepLastUseDiscardAndFreeMemory) {
  auto journal = std::make_shared<Journal>();
  TestStuffPtr a = Enter(TestStuff::Make(10, true, false, journal, "a"));
  TestStuffPtr b = Enter(TestStuff::Make(10, true, false, journal, "b"));
  ASSERT_EQ(RK_TEST_Access::Order(*bag), (std::vector<RK_Stuff*>{a.get(), b.get()}));

  // KeepLastUse: neither the stamp nor the place in the bag moves.
  const auto stampA = a->GetLastUseTime();
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  a->Checkin(RK_Checkin_KeepLastUse, time_duration());
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(RK_TEST_Access::Order(*bag), (std::vector<RK_Stuff*>{a.get(), b.get()}));

  // A plain check-in is a use: stamped with the check-in time, moved to the
  // young end.
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  const auto before = RK_Now();
  a->Checkin(0, time_duration());
  const auto after = RK_Now();
  EXPECT_GE(a->GetLastUseTime(), before);
  EXPECT_LE(a->GetLastUseTime(), after);
  EXPECT_EQ(RK_TEST_Access::Order(*bag), (std::vector<RK_Stuff*>{b.get(), a.get()}));

  // FreeMemory on an item that is also on disk frees its memory and keeps it.
  a->SetOnDisk(true);
  ASSERT_EQ(a->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  a->Checkin(RK_Checkin_FreeMemory, time_duration());
  EXPECT_FALSE(a->IsInMemory());
  EXPECT_TRUE(Indexed(*a));
  EXPECT_EQ(bag->GetStuffCount(), 2u);

  // FreeMemory on an item in memory only drops it from bag and directory.
  ASSERT_EQ(b->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  b->Checkin(RK_Checkin_FreeMemory | RK_Checkin_WriteNow, time_duration());
  EXPECT_FALSE(Indexed(*b));
  EXPECT_EQ(bag->GetStuffCount(), 1u);

  // Discard wins over FreeMemory: the item leaves bag and directory, is told
  // to free its memory, and dies with its last reference.
  TestStuffPtr c = Enter(TestStuff::Make(10, true, false, journal, "c"));
  c->SetOnDisk(true);
  ASSERT_EQ(c->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  journal->Clear();
  c->Checkin(RK_Checkin_Discard | RK_Checkin_FreeMemory, time_duration());
  EXPECT_FALSE(Indexed(*c));
  EXPECT_EQ(bag->GetStuffCount(), 1u);
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"c:FreeMemory"}));
  c.reset();
  EXPECT_EQ(journal->Count("c:destroyed"), 1);
}

TEST_F(CheckoutTest, TheLastCheckinOfAnUnheldItemMayDestroyItOnlyAtTheEnd) {
  auto journal = std::make_shared<Journal>();
  RK_Stuff* raw = nullptr;
  {
    TestStuffPtr item = TestStuff::Make(10, true, false, journal, "x");  // in no bag or directory
    ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
    raw = item.get();
  }
  // Only the check-out keeps it now; the check-in runs to its end first.
  EXPECT_EQ(journal->Count("x:destroyed"), 0);
  raw->Checkin(0, time_duration());
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"x:destroyed"}));
}

TEST_F(CheckoutTest, WriteableCheckinStartsOneBackgroundWriteWhenWorthIt) {
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  executor->Suspend();  // keep submitted jobs queued where they can be counted
  bag->EnableDiskCache(true);
  TestStuffPtr item = Enter(TestStuff::Make(1000));
  item->SetCanDiskCache(true);
  const time_duration costly = seconds(2);

  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, costly);
  EXPECT_EQ(executor->Snapshot().ready, 0u) << "a read-only check-in never writes";

  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, milliseconds(1));
  EXPECT_EQ(executor->Snapshot().ready, 0u) << "1 ms is not worth a write";

  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, costly);
  EXPECT_EQ(executor->Snapshot().ready, 1u);

  // Not in memory, or not disk-cacheable, or the bag's disk cache off: no write.
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->SetInMemory(false);
  item->SetOnDisk(true);
  item->Checkin(0, costly);
  item->SetInMemory(true);
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->SetCanDiskCache(false);
  item->Checkin(0, costly);
  item->SetCanDiskCache(true);
  bag->EnableDiskCache(false);
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, costly);
  EXPECT_EQ(executor->Snapshot().ready, 1u);
  // The queued job holds its own reference to the item.
  EXPECT_EQ(item->RefCountForDiagnostics(), 3u);

  // After the executor is gone, a check-in that would write returns normally.
  bag->EnableDiskCache(true);
  executor.reset();
  RK_StopAllAsyncWork();
  EXPECT_EQ(item->RefCountForDiagnostics(), 2u);  // the dropped job released it
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, costly);
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  item->Checkin(RK_Checkin_WriteNow, costly);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
}

}  // namespace
