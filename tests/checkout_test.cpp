// Check-out and check-in of single items: conflicts, flags, read-back from a
// cache file, check-in flags and which check-ins start a disk write.
#include <chrono>
#include <filesystem>
#include <functional>
#include <mutex>

#include "plinth/debug.h"
#include "rkcache/testing.h"
#include "support/file_stuff.h"
#include "support/module_fixture.h"

namespace {

using boost::posix_time::time_duration;
using rktest::FileStuff;
using rktest::TestStuff;
using rktest::TestStuffPtr;
using rktest::ThrownCode;

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
    ModuleTest::TearDown();
  }
  std::vector<int> codes;
  void Code(const std::function<void()>& f) { codes.push_back(ThrownCode(f)); }
};

TEST_F(CheckoutTest, ConflictsThrowTheirCodesAndReportOnlyOnTheMainThread) {
  TestStuffPtr item = Enter(TestStuff::Make());
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  Code([&] { item->Checkout(kWriteable); });
  Code([&] { item->ConvertToWriteable(); });
  item->Checkin(0, {});
  item->ConvertToWriteable();
  EXPECT_FALSE(Indexed(*item));
  Code([&] { item->Checkout(kReadOnly); });
  Code([&] { item->Checkout(kWriteable); });
  Code([&] { item->ConvertToWriteable(); });
  item->Checkin(0, {});
  EXPECT_TRUE(Indexed(*item));
  Code([&] { item->ConvertToWriteable(); });
  // A check-in without a check-out changes nothing.
  const auto lastUse = item->GetLastUseTime();
  Code([&] { item->Checkin(0, {}); });
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_EQ(item->GetLastUseTime(), lastUse);
  EXPECT_EQ(codes, (std::vector<int>{0x3A03, 0x3A03, 0x3A03, 0x3A03, 0x3A03, 0x3A04, 0x3A04}));
  EXPECT_EQ(rktest::ReportDetails(),
            (std::vector<std::string>{kMsg12, kMsg12, kMsg11, kMsg11, kMsg11, kMsg22, kMsg19}));

  rkhost::control::ClearCaptured();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  TestStuffPtr held = Enter(TestStuff::Make());
  ASSERT_EQ(held->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  for (bool render : {true, false}) {
    codes.clear();
    rktest::OnThread(render, [&] {
      TestStuffPtr fresh = TestStuff::Make();
      Code([&] { item->Checkout(kWriteable); });
      Code([&] { held->Checkout(kReadOnly); });
      Code([&] { fresh->ConvertToWriteable(); });
      Code([&] { fresh->Checkin(0, {}); });
    });
    EXPECT_EQ(codes, (std::vector<int>{0x3A03, 0x3A03, 0x3A04, 0x3A04})) << "render thread: " << render;
  }
  EXPECT_TRUE(rktest::ReportDetails().empty());
  item->Checkin(0, {});
  held->Checkin(0, {});
}

TEST_F(CheckoutTest, FlagsDecideWhichItemsCanBeCheckedOut) {
  // onDisk: on disk, not in memory, no file to read. empty: neither.
  TestStuffPtr onDisk = Enter(Make("disk", 100, false));
  onDisk->SetOnDisk(true);
  TestStuffPtr empty = Enter(Make("empty", 100, false));
  empty->SetOnDisk(false);
  const struct {
    TestStuffPtr item;
    int flags;
    int result;
  } cases[] = {
      {onDisk, kReadOnly | RK_Checkout_OnlyIfInMemory, RK_CheckoutResult_NotCheckedOut},
      {onDisk, kReadOnly | RK_Checkout_DontRead, RK_CheckoutResult_CheckedOut},
      {onDisk, kReadOnly | RK_Checkout_EvenIfNotInMemory, RK_CheckoutResult_NotCheckedOut},  // read fails
      {empty, kReadOnly, RK_CheckoutResult_NotCheckedOut},
      {empty, kReadOnly | RK_Checkout_DontRead, RK_CheckoutResult_NotCheckedOut},
      {empty, kReadOnly | RK_Checkout_EvenIfNotInMemory, RK_CheckoutResult_CheckedOut},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.item->Checkout(c.flags), c.result) << c.item->Name() << " flags " << c.flags;
    if (c.result == RK_CheckoutResult_CheckedOut) c.item->Checkin(RK_Checkin_KeepLastUse, {});
  }

  // A failed writeable check-out leaves the item at its place in the group.
  auto twin = TestStuff::Make(100, true);
  twin->SetGuid(onDisk->GetGuid());
  twin->SetCanSatisfy([](const RK_Stuff*) { return false; });
  Enter(twin);
  EXPECT_EQ(onDisk->Checkout(kWriteable), RK_CheckoutResult_NotCheckedOut);
  EXPECT_EQ(Group(*onDisk), (std::vector<RK_Stuff*>{onDisk.get(), twin.get()}));

  // A writeable check-out is out of the directory until its check-in.
  EXPECT_EQ(empty->Checkout(kWriteable | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(Indexed(*empty));
  empty->Checkin(0, {});
  EXPECT_TRUE(Indexed(*empty));
}

TEST_F(CheckoutTest, ExceptionsDuringCheckoutLeaveTheCountAsItWas) {
  TestStuffPtr item = Enter(TestStuff::Make());
  item->SetThrowFromIsInMemory(1234);
  EXPECT_EQ(ThrownCode([&] { item->Checkout(kWriteable); }), 1234);
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
}

TEST_F(CheckoutTest, ReadOnlyCheckoutReadsAnOnDiskItemBackFromItsCacheFile) {
  rktest::TempDir folder;
  const std::vector<unsigned char> bytes = rktest::CountingBytes(5000);
  auto item = Enter(FileStuff::Make(5000, journal, "f"));
  RK_TEST_Access::SetDiskCacheFile(*item, rktest::WriteFile(folder, "f.vxcache", bytes));
  std::filesystem::last_write_time(folder.Path() + "/f.vxcache",
                                   std::filesystem::file_time_type::clock::now() - std::chrono::hours(1));
  std::mutex traceMutex;
  std::vector<std::string> traces;
  plinth::debug::SetTraceSink([&](const std::string& line) {
    std::lock_guard<std::mutex> lock(traceMutex);
    traces.push_back(line);
  });
  plinth::debug::SetTraceLevel("RK_Stuff", 10);

  const auto changes = dir->GetLastChangeTime();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  EXPECT_EQ(item->Payload(), bytes);
  EXPECT_EQ(journal->Count("f:Read"), 1);
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_GT(item->GetDiskCacheFile().Modified(), RK_Now() - boost::posix_time::minutes(30));  // touched
  EXPECT_TRUE(RK_TEST_BackgroundExecutor()->Snapshot().suspended);  // a read-back pauses writes
  item->Checkin(0, {});

  std::vector<std::string> steps;
  for (const std::string& line : traces)
    for (const char* step : {"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"})
      if (line.find(step) != std::string::npos && line.find("<RK_Stuff> <10> ") != std::string::npos)
        steps.push_back(step);
  EXPECT_EQ(steps, (std::vector<std::string>{"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"}));
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

    EXPECT_EQ(item->Checkout(kReadOnly | RK_Checkout_EvenIfNotInMemory), RK_CheckoutResult_NotCheckedOut);
    EXPECT_FALSE(file->Exists());
    EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 7000);
    EXPECT_EQ(journal->Events(), (std::vector<std::string>{"f:Read", "f:YourDiskCacheFileWasDeleted"}));
    EXPECT_TRUE(Indexed(*item));
    // A std::exception reaches the host's reporter quietly; an int code is dropped.
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
  EXPECT_TRUE(file->Exists());
}

TEST_F(CheckoutTest, CheckinFlagsKeepLastUseDiscardAndFreeMemory) {
  TestStuffPtr a = Enter(Make("a", 10));
  TestStuffPtr b = Enter(Make("b", 10));
  const auto cycle = [](const TestStuffPtr& item, int flags) {
    ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
    item->Checkin(flags, {});
  };
  const auto stampA = a->GetLastUseTime();
  cycle(a, RK_Checkin_KeepLastUse);
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{a.get(), b.get()}));
  cycle(a, 0);  // a use: to the young end
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{b.get(), a.get()}));

  // FreeMemory keeps an item that is also on disk, and drops one in memory only.
  a->SetOnDisk(true);
  cycle(a, RK_Checkin_FreeMemory);
  EXPECT_FALSE(a->IsInMemory());
  cycle(b, RK_Checkin_FreeMemory | RK_Checkin_WriteNow);
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});
  EXPECT_FALSE(Indexed(*b));

  // Discard wins over FreeMemory: the item leaves, frees its memory, and dies.
  TestStuffPtr c = Enter(Make("c", 10));
  c->SetOnDisk(true);
  journal->Clear();
  cycle(c, RK_Checkin_Discard | RK_Checkin_FreeMemory);
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});
  c.reset();
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"c:FreeMemory", "c:destroyed"}));
}

TEST_F(CheckoutTest, TheLastCheckinOfAnUnheldItemMayDestroyItOnlyAtTheEnd) {
  RK_Stuff* raw = nullptr;
  {
    TestStuffPtr item = Make("x", 10);
    ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
    raw = item.get();
  }
  EXPECT_EQ(journal->Count("x:destroyed"), 0);
  raw->Checkin(0, {});
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"x:destroyed"}));
}

TEST_F(CheckoutTest, WriteableCheckinStartsOneBackgroundWriteWhenWorthIt) {
  auto executor = RK_TEST_BackgroundExecutor();
  executor->Suspend();  // queued jobs stay countable
  TestStuffPtr item = Enter(TestStuff::Make(1000));
  const time_duration costly = boost::posix_time::seconds(2);
  const struct {
    int checkoutFlags;
    bool inMemory, canDiskCache, diskCacheOn;
    std::size_t ready;
  } cases[] = {
      {kReadOnly, true, true, true, 0},   {kWriteable, true, true, true, 1},
      {kWriteable, false, true, true, 1}, {kWriteable, true, false, true, 1},
      {kWriteable, true, true, false, 1},
  };
  for (const auto& c : cases) {
    item->SetCanDiskCache(c.canDiskCache);
    bag->EnableDiskCache(c.diskCacheOn);
    ASSERT_EQ(item->Checkout(c.checkoutFlags), RK_CheckoutResult_CheckedOut);
    item->SetInMemory(c.inMemory);
    item->SetOnDisk(c.inMemory ? std::nullopt : std::optional<bool>(true));
    item->Checkin(0, costly);
    item->SetInMemory(true);
    EXPECT_EQ(executor->Snapshot().ready, c.ready) << &c - cases;
  }

  // Without an executor, a check-in that would write returns normally.
  executor.reset();
  RK_StopAllAsyncWork();
  bag->EnableDiskCache(true);
  ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
  item->Checkin(0, costly);
  EXPECT_TRUE(Indexed(*item));
}

}  // namespace
