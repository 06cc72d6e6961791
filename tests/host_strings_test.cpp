// Message table lookups, text conversion, string copies and the computer
// name.
#include <gtest/gtest.h>
#include <unistd.h>

#include <optional>
#include <stdexcept>
#include <string>

#include "host/control.h"
#include "host/hk.h"

namespace ctl = rkhost::control;

namespace {

// A small message table laid out as a module lays out its own: entries,
// then a terminator with a null text and slots -1, -1, 0.
HK_LStrEntry g_entries[] = {
    {"$$$/T/LStr/0000=zero", {0, 0, 0}},
    {"$$$/T/LStr/0001=a=b keeps its second equals sign", {0, 0, 0}},
    {"$$$/T/LStr/0002=disk full{{*COMMENT*}}Shown when the cache folder has no room", {0, 0, 0}},
    {"$$$/T/LStr/0003=", {0, 0, 0}},
    {nullptr, {-1, -1, 0}},
    // Beyond the terminator: not part of the table even if a count says so.
    {"$$$/T/LStr/0005=stale", {0, 0, 0}},
};
HK_LStrCacheRec g_table{"T", 5, g_entries};
HK_LStrCacheRec g_overcounted{"T", 6, g_entries};

TEST(HostStrings, MessageTableLookup) {
  EXPECT_EQ("a=b keeps its second equals sign", HK_ZLookupLStrCache(&g_table, 1, 0, 0));
  EXPECT_EQ("disk full", HK_ZLookupLStrCache(&g_table, 2, 0, 0));  // the comment is cut off
  // The terminator and anything outside the table give "".
  for (int i : {4, -1, 1 << 30}) EXPECT_EQ("", HK_ZLookupLStrCache(&g_table, i, 0, 0)) << i;
  EXPECT_EQ("", HK_ZLookupLStrCache(&g_overcounted, 5, 0, 0));
}

TEST(HostStrings, Utf8AndUtf16ConversionsThrowingAndReplacing) {
  EXPECT_EQ(u"Match", plinth::ustring(HK_AsciiToUTF16String("Match").c_str()));
  EXPECT_THROW(HK_AsciiToUTF16String("caf\xC3\xA9"), std::invalid_argument);

  // A bad byte becomes U+FFFD and the characters after it are kept.
  EXPECT_EQ(u"a\uFFFDb", plinth::ustring(HK_MBToUTF16String((std::string("a\xFF") + "b").c_str()).c_str()));
  EXPECT_EQ(u"\uFFFD(x", plinth::ustring(HK_MBToUTF16String("\xC3(x").c_str()));

  HK_UTF16String lone(u"ab");
  lone.insert(lone.begin() + 1, char16_t(0xD800));
  EXPECT_THROW(HK_UTF16ToMBString(lone, false), std::invalid_argument);
  EXPECT_EQ(std::string("a\xEF\xBF\xBD") + "b", HK_UTF16ToMBString(lone, true));
}

TEST(HostStrings, CopyStringCutsToFitWithoutSplittingACharacter) {
  char buffer[8];
  EXPECT_EQ(0, HK_CopyString("This Computer", 8, buffer));
  EXPECT_STREQ("This Co", buffer);
  // "Ab" + two-byte "\u00e9" into 4 bytes: the half character is left out.
  EXPECT_EQ(0, HK_CopyString("Ab\xC3\xA9", 4, buffer));
  EXPECT_STREQ("Ab", buffer);
  EXPECT_EQ(HK_ErrBadParameter, HK_CopyString("abc", 0, buffer));
}

TEST(HostStrings, ComputerNameFromSystemOrOverride) {
  char system[256] = {};
  ASSERT_EQ(0, gethostname(system, sizeof system - 1));
  char name[64];
  ASSERT_EQ(0, HK_GetComputerName(sizeof name, name));
  EXPECT_EQ(std::string(system).substr(0, 63), name);

  ctl::SetComputerName(std::string("WS-07"));
  ASSERT_EQ(0, HK_GetComputerName(sizeof name, name));
  EXPECT_STREQ("WS-07", name);
  ASSERT_EQ(0, HK_GetComputerName(3, name));
  EXPECT_STREQ("WS", name);
  ctl::SetComputerName(std::nullopt);
  ASSERT_EQ(0, HK_GetComputerName(sizeof name, name));
  EXPECT_EQ(std::string(system).substr(0, 63), name);
}

}  // namespace
