// Error codes, the localised message table, user-visible reports (main
// thread only) and failed verifications.
#include <gtest/gtest.h>

#include <cstdio>
#include <string>
#include <thread>

#include "host/control.h"
#include "rkcache/rkcache.h"
#include "support/test_access.h"
#include "support/test_stuff.h"

namespace ctl = rkhost::control;

namespace {

const char* const kTexts[27] = {
    "",
    "bag to store cached items",
    "internal structure damaged",
    " %s (bag)",
    " %s (cache sort directory)",
    " %s (global data)",
    "disposing non-empty cache",
    "cannot dispose the global cache",
    "cannot resize or move disk cache",
    "cache sort directory",
    "cannot dispose checked-out cached item",
    "cached item already checked-out read/write",
    "cannot check-out read/write already checked-out item",
    " %s (cache check-out receipt)",
    "cache check-out receipt",
    "unable to search importance sort directory",
    "unable to add cached item to disposed sort directory",
    "cache item not found",
    "unable to dispose importance sort directory",
    "cannot reference an ID which is not checked out",
    "stale stuff ID",
    "unsafe operation attempted",
    "can#{rsquo}t convert to writeable when not checked out",
    "This Computer",
    "Disk Cache folder doesn#{rsquo}t exist, so it will be reset to the system temporary directory. Please "
    "check your settings in Memory & Cache Preferences.",
    "Disk Cache folder isn#{rsquo}t a folder, so it will be reset to the system temporary directory. Please "
    "check your settings in Memory & Cache Preferences.",
    "Unable to write to Disk Cache folder, so disk caching will be disabled. Please check your settings in "
    "Memory & Cache Preferences.",
};

std::string KeyOf(int index) {
  char key[32];
  std::snprintf(key, sizeof key, "$$$/VX/RK/LStr/%04d", index);
  return key;
}

// Runs f and returns the int it throws (-1 if it throws nothing).
template <class F>
int ThrownCode(F&& f) {
  try {
    f();
  } catch (int code) {
    return code;
  }
  return -1;
}

}  // namespace

TEST(FrameErrors, MessageTableHoldsTheStoredTextsAndTheTerminator) {
  ASSERT_NE(RK_G_zref, nullptr);
  EXPECT_STREQ(RK_G_zref->moduleKey, "RK");
  ASSERT_EQ(RK_G_zref->count, 28);
  ASSERT_NE(RK_G_zref->entries, nullptr);

  // The raw strings first, before any lookup could touch the slots.
  const std::string marker = "{{*COMMENT*}}";
  for (int i = 0; i < 27; ++i) {
    SCOPED_TRACE(i);
    const HK_LStrEntry& entry = RK_G_zref->entries[i];
    ASSERT_NE(entry.keyAndText, nullptr);
    const std::string raw = entry.keyAndText;
    const std::string stored = KeyOf(i) + "=" + kTexts[i];
    if (i < 21) {
      EXPECT_EQ(raw, stored);
    } else {
      // Entries 21 to 26 carry a translator note after the marker.
      ASSERT_GT(raw.size(), stored.size() + marker.size());
      EXPECT_EQ(raw.substr(0, stored.size()), stored);
      EXPECT_EQ(raw.substr(stored.size(), marker.size()), marker);
    }
    EXPECT_EQ(entry.slots[0], 0);
    EXPECT_EQ(entry.slots[1], 0);
    EXPECT_EQ(entry.slots[2], 0);
  }
  const HK_LStrEntry& terminator = RK_G_zref->entries[27];
  EXPECT_EQ(terminator.keyAndText, nullptr);
  EXPECT_EQ(terminator.slots[0], -1);
  EXPECT_EQ(terminator.slots[1], -1);
  EXPECT_EQ(terminator.slots[2], 0);

  // What the host's string service hands back: the text, markup unchanged,
  // without the note.
  for (int i = 0; i < 27; ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(HK_ZLookupLStrCache(RK_G_zref, i, 0, 0), kTexts[i]);
  }
}

TEST(FrameErrors, UserErrorsAreReportedOnTheMainThreadOnlyAndThrownEverywhere) {
  rktest::TestStuffPtr item = rktest::TestStuff::Make();
  ctl::ClearCaptured();

  // Main thread: report (group, number 2, the message's text), then throw.
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); }), 0x3A04);
  RK_TEST_Access::SetCheckoutCount(*item, 2);
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutMoreThan(*item, 1); }), 0x3A03);
  RK_TEST_Access::SetCheckoutCount(*item, 0);
  ctl::Captured captured = ctl::Snapshot();
  ASSERT_EQ(captured.errorReports.size(), 2u);
  EXPECT_EQ(captured.errorReports[0].group, 0x3A0000);
  EXPECT_EQ(captured.errorReports[0].number, 2);
  EXPECT_EQ(captured.errorReports[0].detail, kTexts[22]);
  EXPECT_FALSE(captured.errorReports[0].suppressed);
  EXPECT_EQ(captured.errorReports[1].group, 0x3A0000);
  EXPECT_EQ(captured.errorReports[1].number, 2);
  EXPECT_EQ(captured.errorReports[1].detail, kTexts[12]);

  // Another thread: the same failure throws the same code and reports nothing.
  ctl::ClearCaptured();
  int codeOnOtherThread = 0;
  std::thread([&] {
    codeOnOtherThread = ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); });
  }).join();
  EXPECT_EQ(codeOnOtherThread, 0x3A04);
  EXPECT_TRUE(ctl::Snapshot().errorReports.empty());

  // Which thread is main is decided per call: once another thread is made
  // main, it reports and the test's thread no longer does.
  std::thread([&] {
    ctl::MakeCurrentThreadMain();
    codeOnOtherThread = ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); });
  }).join();
  EXPECT_EQ(codeOnOtherThread, 0x3A04);
  EXPECT_EQ(ThrownCode([&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); }), 0x3A04);
  captured = ctl::Snapshot();
  ASSERT_EQ(captured.errorReports.size(), 1u);
  EXPECT_EQ(captured.errorReports[0].detail, kTexts[22]);
  EXPECT_TRUE(captured.verifications.empty());
}

TEST(FrameErrors, FailedVerificationsReportTheirNumberAndThrowThree) {
  RK_Birth(false);
  boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
  boost::shared_ptr<RK_Bag> otherBag(new RK_Bag());
  rktest::TestStuffPtr item = rktest::TestStuff::Make();
  bag->AddStuff(item);
  ctl::ClearCaptured();

  EXPECT_EQ(ThrownCode([&] { bag->AddStuff(item); }), 3);
  EXPECT_EQ(ThrownCode([&] { otherBag->RemoveStuff(item.get()); }), 3);

  const ctl::Captured captured = ctl::Snapshot();
  ASSERT_EQ(captured.verifications.size(), 2u);
  EXPECT_EQ(captured.verifications[0].number, 380);
  EXPECT_EQ(captured.verifications[0].message, "stuff already in a bag");
  EXPECT_EQ(captured.verifications[1].number, 402);
  EXPECT_EQ(captured.verifications[1].message, "stuff not in the right bag");
  EXPECT_TRUE(captured.errorReports.empty());
  // The structure that failed the check is left as it was.
  EXPECT_EQ(bag->GetStuffCount(), 1u);
  EXPECT_EQ(item->GetBag(), bag);

  bag->RemoveStuff(item.get());
  RK_StopAllAsyncWork();
  otherBag.reset();
  bag.reset();
  RK_Death();
}
