// Check-out and check-in of single items: conflicts, flags, read-back from a
// real cache file, check-in flags and which check-ins start a disk write
// (the compute-time threshold itself is PacingTest's).
#include <chrono>
#include <filesystem>
#include <functional>
#include <map>
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
    plinth::debug::CodeProfilerManager::Get().SetConditionalProfiling(false);
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
  EXPECT_EQ(item->GetCheckoutCount(), 2u);
  EXPECT_FALSE(item->IsCheckedOutWriteable());

  // Held once: the conversion takes the item out of its directory, whose
  // link it keeps.
  item->Checkin(0, {});
  item->ConvertToWriteable();
  EXPECT_TRUE(item->IsCheckedOutWriteable());
  EXPECT_FALSE(Indexed(*item));
  EXPECT_EQ(item->GetSortDir(), dir);
  Code([&] { item->Checkout(kReadOnly); });
  Code([&] { item->Checkout(kWriteable); });
  Code([&] { item->ConvertToWriteable(); });
  EXPECT_EQ(item->GetCheckoutCount(), 1u);

  item->Checkin(0, {});
  EXPECT_TRUE(Indexed(*item));
  EXPECT_FALSE(item->IsCheckedOutWriteable());
  Code([&] { item->ConvertToWriteable(); });
  // A check-in without a check-out changes nothing: count, last use, order.
  const auto lastUse = item->GetLastUseTime();
  const auto order = Order();
  Code([&] { item->Checkin(0, {}); });
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_EQ(item->GetLastUseTime(), lastUse);
  EXPECT_EQ(Order(), order);
  EXPECT_EQ(codes, (std::vector<int>{0x3A03, 0x3A03, 0x3A03, 0x3A03, 0x3A03, 0x3A04, 0x3A04}));
  EXPECT_EQ(rktest::ReportDetails(),
            (std::vector<std::string>{kMsg12, kMsg12, kMsg11, kMsg11, kMsg11, kMsg22, kMsg19}));

  // On a render thread and on another thread: the same codes, no reports.
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
  EXPECT_TRUE(Indexed(*held));
}

TEST_F(CheckoutTest, FlagsDecideWhichItemsCanBeCheckedOut) {
  // onDisk: on disk (as the item says), not in memory, no file to read.
  // empty: neither in memory nor on disk.
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
      // Without DontRead it must be read back, which fails whatever else.
      {onDisk, kReadOnly | RK_Checkout_EvenIfNotInMemory, RK_CheckoutResult_NotCheckedOut},
      {empty, kReadOnly, RK_CheckoutResult_NotCheckedOut},
      {empty, kReadOnly | RK_Checkout_DontRead, RK_CheckoutResult_NotCheckedOut},
      {empty, kReadOnly | RK_Checkout_EvenIfNotInMemory, RK_CheckoutResult_CheckedOut},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.item->Checkout(c.flags), c.result) << c.item->Name() << " flags " << c.flags;
    EXPECT_EQ(c.item->GetCheckoutCount(), c.result == RK_CheckoutResult_CheckedOut ? 1u : 0u);
    EXPECT_FALSE(c.item->IsInMemory());
    if (c.result == RK_CheckoutResult_CheckedOut) c.item->Checkin(RK_Checkin_KeepLastUse, {});
  }

  // A writeable check-out failing its final test (writeable check-outs do
  // not read back) leaves the item findable at its place in the group.
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

  ASSERT_EQ(item->Checkout(kReadOnly | RK_Checkout_DontRead), RK_CheckoutResult_CheckedOut);
  EXPECT_FALSE(item->IsInMemory());
  item->Checkin(RK_Checkin_KeepLastUse, {});
  const auto changes = dir->GetLastChangeTime();
  ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
  EXPECT_TRUE(item->IsInMemory());
  EXPECT_TRUE(item->IsOnDisk());
  EXPECT_EQ(item->Payload(), bytes);
  EXPECT_EQ(journal->Count("f:Read"), 1);  // once: DontRead read nothing
  EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);
  EXPECT_GT(item->GetDiskCacheFile().Modified(), RK_Now() - boost::posix_time::minutes(30));
  EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 5000);
  item->Checkin(0, {});

  const std::vector<std::string> expectedSteps{"pre-prep", "pre-timestamp", "post-timestamp", "post-prep"};
  std::vector<std::string> steps;
  for (const std::string& line : traces)
    for (const std::string& step : expectedSteps)
      if (line.find(step) != std::string::npos) {
        steps.push_back(step);
        EXPECT_NE(line.find("<RK_Stuff> <10> "), std::string::npos) << line;
      }
  EXPECT_EQ(steps, expectedSteps);
  std::map<std::string, std::uint64_t> counts;
  for (const auto& log : profiler.Logs()) counts[log->Name()] += log->Count();
  EXPECT_EQ(counts["VX.render.RK_Stuff::PrepAndRead"], 1u);
  EXPECT_EQ(counts["VX.render.RK_Stuff::Checkout"], 2u);
  EXPECT_EQ(counts["VX.render.RK_Stuff::Checkin"], 2u);
  EXPECT_TRUE(RK_TEST_BackgroundExecutor()->Snapshot().suspended);  // a read-back pauses writes
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
    EXPECT_EQ(bag->GetCurrentDiskCacheSize(), 7000);
    EXPECT_EQ(dir->GetLastChangeTime(), changes + 1);  // the deletion only
    EXPECT_EQ(journal->Events(), (std::vector<std::string>{"f:Read", "f:YourDiskCacheFileWasDeleted"}));
    EXPECT_TRUE(Indexed(*item));
    // A std::exception reaches the host's reporter inside the quiet
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
  const auto cycle = [](const TestStuffPtr& item, int flags) {
    ASSERT_EQ(item->Checkout(kReadOnly), RK_CheckoutResult_CheckedOut);
    item->Checkin(flags, {});
  };
  const auto stampA = a->GetLastUseTime();
  cycle(a, RK_Checkin_KeepLastUse);
  EXPECT_EQ(a->GetLastUseTime(), stampA);
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{a.get(), b.get()}));
  // A plain check-in is a use: stamped now, moved to the young end.
  const auto before = RK_Now();
  cycle(a, 0);
  EXPECT_GE(a->GetLastUseTime(), before);
  EXPECT_LE(a->GetLastUseTime(), RK_Now());
  EXPECT_EQ(Order(), (std::vector<RK_Stuff*>{b.get(), a.get()}));

  // FreeMemory keeps an item that is also on disk, without its memory...
  a->SetOnDisk(true);
  cycle(a, RK_Checkin_FreeMemory);
  EXPECT_FALSE(a->IsInMemory());
  EXPECT_TRUE(Indexed(*a));
  // ...and drops one in memory only.
  cycle(b, RK_Checkin_FreeMemory | RK_Checkin_WriteNow);
  EXPECT_FALSE(Indexed(*b));
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});

  // Discard wins over FreeMemory: the item leaves, is told to free its
  // memory, and dies with its last reference.
  TestStuffPtr c = Enter(Make("c", 10));
  c->SetOnDisk(true);
  journal->Clear();
  cycle(c, RK_Checkin_Discard | RK_Checkin_FreeMemory);
  EXPECT_FALSE(Indexed(*c));
  EXPECT_EQ(Order(), std::vector<RK_Stuff*>{a.get()});
  c.reset();
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"c:FreeMemory", "c:destroyed"}));
}

TEST_F(CheckoutTest, TheLastCheckinOfAnUnheldItemMayDestroyItOnlyAtTheEnd) {
  RK_Stuff* raw = nullptr;
  {
    TestStuffPtr item = Make("x", 10);  // in no bag or directory
    ASSERT_EQ(item->Checkout(kWriteable), RK_CheckoutResult_CheckedOut);
    raw = item.get();
  }
  EXPECT_EQ(journal->Count("x:destroyed"), 0);  // only the check-out keeps it
  raw->Checkin(0, {});
  EXPECT_EQ(journal->Events(), (std::vector<std::string>{"x:destroyed"}));
}

TEST_F(CheckoutTest, WriteableCheckinStartsOneBackgroundWriteWhenWorthIt) {
  auto executor = RK_TEST_BackgroundExecutor();
  ASSERT_TRUE(executor);
  executor->Suspend();  // keep submitted jobs queued where they can be counted
  bag->EnableDiskCache(true);
  TestStuffPtr item = Enter(TestStuff::Make(1000));
  const time_duration costly = boost::posix_time::seconds(2);
  const struct {
    const char* what;
    int checkoutFlags;
    time_duration computeTime;
    bool inMemory, canDiskCache, diskCacheOn;
    std::size_t ready;
  } cases[] = {
      {"read-only", kReadOnly, costly, true, true, true, 0},
      {"worth it", kWriteable, costly, true, true, true, 1},
      {"not in memory", kWriteable, costly, false, true, true, 1},
      {"not disk-cacheable", kWriteable, costly, true, false, true, 1},
      {"disk cache off", kWriteable, costly, true, true, false, 1},
  };
  for (const auto& c : cases) {
    item->SetCanDiskCache(c.canDiskCache);
    bag->EnableDiskCache(c.diskCacheOn);
    ASSERT_EQ(item->Checkout(c.checkoutFlags), RK_CheckoutResult_CheckedOut) << c.what;
    item->SetInMemory(c.inMemory);
    item->SetOnDisk(c.inMemory ? std::nullopt : std::optional<bool>(true));
    item->Checkin(0, c.computeTime);
    item->SetInMemory(true);
    EXPECT_EQ(executor->Snapshot().ready, c.ready) << c.what;
  }
  EXPECT_EQ(item->RefCountForDiagnostics(), 3u);  // the queued job holds the item

  // After the executor is gone, a check-in that would write returns normally.
  item->SetCanDiskCache(true);
  bag->EnableDiskCache(true);
  executor.reset();
  RK_StopAllAsyncWork();
  EXPECT_EQ(item->RefCountForDiagnostics(), 2u);  // the dropped job released it
  for (int flags : {kWriteable, kReadOnly}) {
    ASSERT_EQ(item->Checkout(flags), RK_CheckoutResult_CheckedOut);
    item->Checkin(flags == kReadOnly ? RK_Checkin_WriteNow : 0, costly);
  }
  EXPECT_EQ(item->GetCheckoutCount(), 0u);
  EXPECT_TRUE(Indexed(*item));
}

}  // namespace
