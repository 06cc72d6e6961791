// Text conversions, number parsing, Base64 and GUID text.
#include <gtest/gtest.h>

#include <climits>
#include <set>
#include <stdexcept>
#include <vector>

#include "plinth/guid.h"
#include "plinth/text.h"

namespace {

using plinth::ustring;
using namespace plinth::utility;

TEST(PlinthText, UtfConversionsRoundTripAndRejectIllFormedInput) {
  const ustring mixed = u"Disk Cache - \u00e9\u4e2d\U0001F600";
  const std::string utf8 = UTF16to8(mixed);
  EXPECT_EQ(utf8, "Disk Cache - \xc3\xa9\xe4\xb8\xad\xf0\x9f\x98\x80");
  EXPECT_EQ(UTF8to16(utf8), mixed);
  EXPECT_EQ(UTF16to8(u""), "");

  EXPECT_THROW(UTF16to8(ustring(1, char16_t(0xD800))), std::invalid_argument);  // lone high surrogate
  EXPECT_THROW(UTF16to8(u"a" + ustring(1, char16_t(0xDC00))), std::invalid_argument);
  EXPECT_THROW(UTF8to16("\xc3"), std::invalid_argument);  // truncated sequence
  EXPECT_THROW(UTF8to16("a\xff"
                        "b"),
               std::invalid_argument);  // never valid

  EXPECT_EQ(AsciiToUTF16("RK_Stuff 09"), u"RK_Stuff 09");
  EXPECT_THROW(AsciiToUTF16("caf\xc3\xa9"), std::invalid_argument);
  EXPECT_THROW(AsciiToUTF16(nullptr), std::invalid_argument);
}

TEST(PlinthText, HexStringToNumberReadsWholeTextOnly) {
  EXPECT_EQ(HexStringToNumber(u"0"), 0u);
  EXPECT_EQ(HexStringToNumber(u"1A2b"), 0x1A2Bu);
  EXPECT_EQ(HexStringToNumber(u"FFFFFFFF"), 0xFFFFFFFFu);
  EXPECT_EQ(HexStringToNumber(u"00000000FF"), 0xFFu);  // leading zeros do not overflow
  for (const char16_t* bad : {u"", u"100000000", u"12G", u"0x12", u" 12"})
    EXPECT_THROW(HexStringToNumber(bad), std::invalid_argument) << UTF16to8(bad);
}

TEST(PlinthText, StringToNumberHonoursFlagsAndOverflow) {
  struct Case {
    const char16_t* text;
    unsigned flags;
    bool ok;
    int value;  // 0 after every failure
  } const cases[] = {
      {u"42", 0, true, 42},
      {u"-2147483648", 0, true, INT_MIN},
      {u"+2147483647", 0, true, INT_MAX},
      {u"2147483648", 0, false, 0},
      {u"-2147483649", kNumberLeadingOnly, false, 0},
      {u"", kNumberLeadingOnly, false, 0},
      {u"-", kNumberLeadingOnly, false, 0},
      {u"v12", kNumberLeadingOnly, false, 0},
      // Trailing text: refused by default, ignored when leading only (a
      // version string's major number).
      {u"12.5", 0, false, 0},
      {u"7.0x3", kNumberLeadingOnly, true, 7},
      {u"  9", 0, false, 0},
      {u"  9", kNumberSkipLeadingSpace, true, 9},
  };
  for (const Case& c : cases) {
    int v = 77;
    EXPECT_EQ(StringToNumber(v, c.text, c.flags), c.ok) << UTF16to8(c.text) << " flags " << c.flags;
    EXPECT_EQ(v, c.value) << UTF16to8(c.text) << " flags " << c.flags;
  }
}

TEST(PlinthText, Base64RoundTripsAndUsesTheStandardAlphabet) {
  EXPECT_EQ(EncodeBinaryDataToUTF8String(ByteVector()), "");
  EXPECT_TRUE(DecodeBinaryDataFromUTF8String("").empty());
  // RFC 4648 test vectors.
  const std::pair<const char*, const char*> vectors[] = {{"f", "Zg=="},         {"fo", "Zm8="},
                                                         {"foo", "Zm9v"},       {"foob", "Zm9vYg=="},
                                                         {"fooba", "Zm9vYmE="}, {"foobar", "Zm9vYmFy"}};
  for (const auto& [plain, encoded] : vectors) {
    const std::string s(plain);
    EXPECT_EQ(EncodeBinaryDataToUTF8String(reinterpret_cast<const unsigned char*>(s.data()), s.size()),
              encoded);
    const ByteVector back = DecodeBinaryDataFromUTF8String(encoded);
    EXPECT_EQ(std::string(back.begin(), back.end()), s);
  }
  // The sextets 0..63 in turn encode to the whole standard alphabet, in order.
  ByteVector ramp;
  for (unsigned v = 0; v < 64; v += 4) {
    for (unsigned byte :
         {(v << 2) | ((v + 1) >> 4), ((v + 1) << 4) | ((v + 2) >> 2), ((v + 2) << 6) | (v + 3)})
      ramp.push_back(static_cast<unsigned char>(byte));
  }
  const std::string alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  EXPECT_EQ(EncodeBinaryDataToUTF8String(ramp), alphabet);
  EXPECT_EQ(DecodeBinaryDataFromUTF8String(alphabet), ramp);
}

TEST(PlinthText, Base64DecoderRejectsMalformedText) {
  const char* bad[] = {
      "Zg=",       // length not a multiple of 4
      "Zm9",       // length not a multiple of 4
      "Zm-v",      // '-' is not in the alphabet (the file name form must be undone first)
      "Zm9v.AAA",  // '.'
      "Z===",      // too much padding
      "=m9v",      // padding first
      "Zg==Zm9v",  // padding before the end
      "Zm=v",      // data after padding
      "Zh==",      // non-zero bits under the padding
      "Zm9\n",     // whitespace
  };
  for (const char* text : bad) {
    EXPECT_THROW(DecodeBinaryDataFromUTF8String(text), std::invalid_argument) << text;
  }
}

TEST(PlinthGuid, TextFormRoundTripsExactly) {
  const Guid g(0x0123456789abcdefull, 0xfedcba9876543210ull);
  EXPECT_EQ(g.AsString(), u"01234567-89ab-cdef-fedc-ba9876543210");
  EXPECT_EQ(Guid::StringToGUID(g.AsString()), g);
  EXPECT_EQ(Guid().AsString(), u"00000000-0000-0000-0000-000000000000");
  EXPECT_TRUE(Guid::StringToGUID(Guid().AsString()).IsNil());

  const auto bytes = g.GuidToBytes();
  EXPECT_EQ(bytes[0], 0x01);
  EXPECT_EQ(bytes[15], 0x10);
  EXPECT_EQ(Guid::FromBytes(bytes), g);

  std::set<Guid> seen;
  for (int i = 0; i < 200; ++i) {
    const Guid u = Guid::CreateUnique();
    EXPECT_FALSE(u.IsNil());
    EXPECT_EQ((u.GuidToBytes()[6] >> 4), 4);  // random (version 4)
    const ustring text = u.AsString();
    EXPECT_EQ(text.size(), 36u);
    EXPECT_EQ(text.find(u'.'), ustring::npos);
    EXPECT_EQ(Guid::StringToGUID(text), u);
    seen.insert(u);
  }
  EXPECT_EQ(seen.size(), 200u);
}

TEST(PlinthGuid, MalformedTextThrows) {
  const ustring bad[] = {
      u"",
      u"01234567-89ab-cdef-fedc-ba987654321",     // one digit short
      u"01234567-89ab-cdef-fedc-ba98765432100",   // one digit long
      u"01234567-89ab-cdef-fedc-ba987654321g",    // bad hex digit
      u"01234567-89AB-cdef-fedc-ba9876543210",    // upper case: not the text form
      u"{01234567-89ab-cdef-fedc-ba9876543210}",  // braces
      u"01234567.89ab.cdef.fedc.ba9876543210",    // '.' separators
      u"012345678-9ab-cdef-fedc-ba9876543210",    // dash misplaced, right length
      u"0123456789abcdeffedcba9876543210",        // no dashes
  };
  for (const ustring& text : bad) {
    EXPECT_THROW(Guid::StringToGUID(text), std::invalid_argument) << UTF16to8(text);
  }
}

}  // namespace
