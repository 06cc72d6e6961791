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

ByteVector Bytes(std::initializer_list<unsigned char> b) {
  return ByteVector(b.begin(), b.end());
}

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
  EXPECT_THROW(HexStringToNumber(u""), std::invalid_argument);
  EXPECT_THROW(HexStringToNumber(u"100000000"), std::invalid_argument);
  EXPECT_THROW(HexStringToNumber(u"12G"), std::invalid_argument);
  EXPECT_THROW(HexStringToNumber(u"0x12"), std::invalid_argument);
  EXPECT_THROW(HexStringToNumber(u" 12"), std::invalid_argument);
}

TEST(PlinthText, StringToNumberHonoursFlagsAndOverflow) {
  int v = 77;
  EXPECT_TRUE(StringToNumber(v, u"42", 0));
  EXPECT_EQ(v, 42);
  EXPECT_TRUE(StringToNumber(v, u"-2147483648", 0));
  EXPECT_EQ(v, INT_MIN);
  EXPECT_TRUE(StringToNumber(v, u"+2147483647", 0));
  EXPECT_EQ(v, INT_MAX);

  v = 77;
  EXPECT_FALSE(StringToNumber(v, u"2147483648", 0));
  EXPECT_EQ(v, 0);
  v = 77;
  EXPECT_FALSE(StringToNumber(v, u"-2147483649", kNumberLeadingOnly));
  EXPECT_EQ(v, 0);
  v = 77;
  EXPECT_FALSE(StringToNumber(v, u"", kNumberLeadingOnly));
  EXPECT_EQ(v, 0);
  EXPECT_FALSE(StringToNumber(v, u"-", kNumberLeadingOnly));
  EXPECT_FALSE(StringToNumber(v, u"v12", kNumberLeadingOnly));

  // Trailing text: refused by default, ignored under flag 2 (a version
  // string's major number).
  EXPECT_FALSE(StringToNumber(v, u"12.5", 0));
  EXPECT_TRUE(StringToNumber(v, u"12.5", kNumberLeadingOnly));
  EXPECT_EQ(v, 12);
  EXPECT_TRUE(StringToNumber(v, u"7.0x3", 2));
  EXPECT_EQ(v, 7);

  EXPECT_FALSE(StringToNumber(v, u"  9", 0));
  EXPECT_TRUE(StringToNumber(v, u"  9", kNumberSkipLeadingSpace));
  EXPECT_EQ(v, 9);
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
  // Bytes that produce '/' and '+' (the characters a cache file name must
  // rewrite or may keep).
  const ByteVector slashy = Bytes({0xFF, 0xFF, 0xFF, 0xFB, 0xEF, 0xBE});
  const std::string text = EncodeBinaryDataToUTF8String(slashy);
  EXPECT_EQ(text, "////++++");
  EXPECT_EQ(DecodeBinaryDataFromUTF8String(text), slashy);

  ByteVector all;
  for (int i = 0; i < 256; ++i) all.push_back(static_cast<unsigned char>(i));
  for (std::size_t n = 0; n <= all.size(); n += 37) {
    const ByteVector part(all.begin(), all.begin() + n);
    const std::string enc = EncodeBinaryDataToUTF8String(part);
    EXPECT_EQ(enc.find('.'), std::string::npos);
    EXPECT_EQ(enc.find('-'), std::string::npos);
    EXPECT_EQ(DecodeBinaryDataFromUTF8String(enc), part);
  }
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
