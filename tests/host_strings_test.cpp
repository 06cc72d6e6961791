// Message table lookups, key-and-text strings, text conversion, string
// copies and the computer name.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>

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
  const char* const expected[] = {"zero", "a=b keeps its second equals sign", "disk full", ""};
  for (int i = 0; i < 4; ++i) EXPECT_EQ(expected[i], HK_ZLookupLStrCache(&g_table, i, 0, 0)) << i;
  // The terminator and anything outside the table give "".
  for (int i : {4, 5, -1, 1 << 30}) EXPECT_EQ("", HK_ZLookupLStrCache(&g_table, i, 0, 0)) << i;
  EXPECT_EQ("", HK_ZLookupLStrCache(&g_overcounted, 5, 0, 0));
  EXPECT_EQ("", HK_ZLookupLStrCache(nullptr, 0, 0, 0));
}

TEST(HostStrings, Utf8AndUtf16Conversions) {
  EXPECT_EQ(u"Match", plinth::ustring(HK_AsciiToUTF16String("Match").c_str()));
  EXPECT_THROW(HK_AsciiToUTF16String("caf\xC3\xA9"), std::invalid_argument);
  EXPECT_TRUE(HK_AsciiToUTF16String(nullptr).empty());

  EXPECT_EQ(u"caf\u00E9", plinth::ustring(HK_MBToUTF16String("caf\xC3\xA9").c_str()));
  // A bad byte becomes U+FFFD and the characters after it are kept, also
  // where the byte announced a sequence that the next byte does not continue.
  EXPECT_EQ(u"a\uFFFDb", plinth::ustring(HK_MBToUTF16String((std::string("a\xFF") + "b").c_str()).c_str()));
  EXPECT_EQ(u"\uFFFD(x", plinth::ustring(HK_MBToUTF16String("\xC3(x").c_str()));
  EXPECT_EQ(u"\uFFFD\uFFFD", plinth::ustring(HK_MBToUTF16String("\xE2\x82").c_str()));

  const HK_UTF16String good(u"WS-07 \u00E9\U0001F600");
  EXPECT_EQ("WS-07 \xC3\xA9\xF0\x9F\x98\x80", HK_UTF16ToMBString(good, false));
  HK_UTF16String lone(u"ab");
  lone.insert(lone.begin() + 1, char16_t(0xD800));
  EXPECT_THROW(HK_UTF16ToMBString(lone, false), std::invalid_argument);
  EXPECT_EQ(std::string("a\xEF\xBF\xBD") + "b", HK_UTF16ToMBString(lone, true));
  // A high surrogate at the very end is cut off, not waiting for a partner.
  lone.erase(2);
  EXPECT_EQ("a\xEF\xBF\xBD", HK_UTF16ToMBString(lone, true));
}

TEST(HostStrings, CopyStringCutsToFitAndTerminates) {
  char buffer[8];
  std::memset(buffer, 'z', sizeof buffer);
  EXPECT_EQ(0, HK_CopyString("This Computer", 8, buffer));
  EXPECT_STREQ("This Co", buffer);
  EXPECT_EQ(0, HK_CopyString("abc", 8, buffer));
  EXPECT_STREQ("abc", buffer);
  EXPECT_EQ(0, HK_CopyString("abc", 1, buffer));
  EXPECT_STREQ("", buffer);
  // A cut never leaves half a UTF-8 character: "Ab" + two-byte "é" into 4 bytes.
  EXPECT_EQ(0, HK_CopyString("Ab\xC3\xA9", 4, buffer));
  EXPECT_STREQ("Ab", buffer);
  EXPECT_EQ(0, HK_CopyString("Ab\xC3\xA9", 5, buffer));
  EXPECT_STREQ("Ab\xC3\xA9", buffer);

  std::memset(buffer, 'z', sizeof buffer);
  EXPECT_EQ(HK_ErrBadParameter, HK_CopyString("abc", 0, buffer));
  EXPECT_EQ(HK_ErrBadParameter, HK_CopyString("abc", -4, buffer));
  EXPECT_EQ(HK_ErrBadParameter, HK_CopyString("abc", 8, nullptr));
  EXPECT_EQ(HK_ErrBadParameter, HK_CopyString(nullptr, 8, buffer));
  EXPECT_EQ('z', buffer[0]);
}

// The status and the text of a computer-name read into `size` bytes of a
// buffer filled with 'z' (so a missing terminator shows).
std::pair<int, std::string> ComputerName(int size = 64) {
  char buffer[65];
  std::memset(buffer, 'z', 64);
  buffer[64] = '\0';
  const int status = HK_GetComputerName(size, buffer);
  return {status, buffer};
}

TEST(HostStrings, ComputerNameFromSystemOrOverride) {
  char system[256] = {};
  ASSERT_EQ(0, gethostname(system, sizeof system - 1));
  using Read = std::pair<int, std::string>;
  EXPECT_EQ(Read(0, std::string(system).substr(0, 63)), ComputerName());

  ctl::SetComputerName(std::string("WS-07"));
  EXPECT_EQ(Read(0, "WS-07"), ComputerName());
  EXPECT_EQ(Read(0, "WS"), ComputerName(3));
  EXPECT_EQ(HK_ErrBadParameter, ComputerName(0).first);
  EXPECT_EQ(HK_ErrBadParameter, HK_GetComputerName(64, nullptr));
  ctl::SetComputerName(std::string(100, 'n'));
  EXPECT_EQ(Read(0, std::string(63, 'n')), ComputerName());
  ctl::SetComputerName(std::string());
  EXPECT_EQ(Read(0, ""), ComputerName());
  ctl::FailComputerName(0x77);
  EXPECT_EQ(0x77, ComputerName().first);
  ctl::FailComputerName(0);

  ctl::SetComputerName(std::nullopt);
  EXPECT_EQ(Read(0, std::string(system).substr(0, 63)), ComputerName());
}

}  // namespace
