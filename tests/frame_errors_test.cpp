// Error codes, the localised message table, and user-visible reports (main
// thread only). Failed verifications are checked where they arise.
#include <cstdint>
#include <cstdio>

#include "support/module_fixture.h"

namespace ctl = rkhost::control;
using rktest::ThrownCode;

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

}  // namespace

TEST(FrameErrors, MessageTableHoldsTheStoredTextsAndTheTerminator) {
  ASSERT_NE(RK_G_zref, nullptr);
  EXPECT_STREQ(RK_G_zref->moduleKey, "RK");
  ASSERT_EQ(RK_G_zref->count, 28);

  // The raw strings first, before any lookup could touch the slots. Entries
  // 21 to 26 carry a translator note after the marker; the others end there.
  const std::string marker = "{{*COMMENT*}}";
  for (int i = 0; i < 27; ++i) {
    SCOPED_TRACE(i);
    const HK_LStrEntry& entry = RK_G_zref->entries[i];
    ASSERT_NE(entry.keyAndText, nullptr);
    const std::string raw = entry.keyAndText;
    const std::string stored = KeyOf(i) + "=" + kTexts[i];
    EXPECT_EQ(raw.substr(0, stored.size()), stored);
    if (i < 21) {
      EXPECT_EQ(raw, stored);
    } else {
      EXPECT_GT(raw.size(), stored.size() + marker.size());
      EXPECT_EQ(raw.substr(stored.size(), marker.size()), marker);
    }
    EXPECT_EQ((std::vector<std::intptr_t>{entry.slots[0], entry.slots[1], entry.slots[2]}),
              (std::vector<std::intptr_t>{0, 0, 0}));
  }
  const HK_LStrEntry& terminator = RK_G_zref->entries[27];
  EXPECT_EQ(terminator.keyAndText, nullptr);
  EXPECT_EQ((std::vector<std::intptr_t>{terminator.slots[0], terminator.slots[1], terminator.slots[2]}),
            (std::vector<std::intptr_t>{-1, -1, 0}));

  // The host's string service hands back the text, markup unchanged, no note.
  for (int i = 0; i < 27; ++i) EXPECT_EQ(HK_ZLookupLStrCache(RK_G_zref, i, 0, 0), kTexts[i]) << i;
}

TEST(FrameErrors, UserErrorsAreReportedOnTheCurrentMainThreadOnly) {
  ctl::MakeCurrentThreadMain();
  rktest::TestStuffPtr item = rktest::TestStuff::Make();
  const auto notCheckedOut = [&] { RK_TEST_Access::ThrowIfCheckedOutLessThan(*item, 1); };
  ctl::ClearCaptured();
  EXPECT_EQ(ThrownCode(notCheckedOut), 0x3A04);
  EXPECT_EQ(rktest::ReportDetails(), std::vector<std::string>{kTexts[22]});
  EXPECT_FALSE(ctl::Snapshot().errorReports.at(0).suppressed);

  // Which thread is main is decided per call: once another thread is made
  // main, it reports and the test's thread no longer does.
  ctl::ClearCaptured();
  std::thread([&] {
    ctl::MakeCurrentThreadMain();
    ThrownCode(notCheckedOut);
  }).join();
  EXPECT_EQ(ThrownCode(notCheckedOut), 0x3A04);
  EXPECT_EQ(rktest::ReportDetails(), std::vector<std::string>{kTexts[22]});
}
