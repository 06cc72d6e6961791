// Text conversions, Base64 and GUID text.
#include <gtest/gtest.h>

#include <set>
#include <stdexcept>

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

  EXPECT_THROW(UTF16to8(u"a" + ustring(1, char16_t(0xDC00))), std::invalid_argument);  // lone surrogate
  EXPECT_THROW(UTF8to16("\xc3"), std::invalid_argument);                               // truncated sequence
  EXPECT_THROW(UTF8to16("a\xff"), std::invalid_argument);                              // never valid
}

TEST(PlinthText, Base64RoundTripsWithTheStandardAlphabet) {
  // RFC 4648 test vectors: no, one and two padding characters.
  const std::pair<const char*, const char*> vectors[] = {
      {"foo", "Zm9v"}, {"foob", "Zm9vYg=="}, {"fooba", "Zm9vYmE="}};
  for (const auto& [plain, encoded] : vectors) {
    const std::string s(plain);
    EXPECT_EQ(EncodeBinaryDataToUTF8String(reinterpret_cast<const unsigned char*>(s.data()), s.size()),
              encoded);
    const ByteVector back = DecodeBinaryDataFromUTF8String(encoded);
    EXPECT_EQ(std::string(back.begin(), back.end()), s);
  }
  // Bytes whose sextets are 62 and 63 encode to '+' and '/', not a URL-safe form.
  const ByteVector high{0xFB, 0xFF};
  EXPECT_EQ(EncodeBinaryDataToUTF8String(high), "+/8=");
  EXPECT_EQ(DecodeBinaryDataFromUTF8String("+/8="), high);
}

TEST(PlinthText, Base64DecoderRejectsMalformedText) {
  const char* bad[] = {
      "Zm9",       // length not a multiple of 4
      "Zm-v",      // '-' is not in the alphabet
      "Z===",      // too much padding
      "Zg==Zm9v",  // padding before the end
      "Zh==",      // non-zero bits under the padding
      "Zm9\n",     // whitespace
  };
  for (const char* text : bad) {
    EXPECT_THROW(DecodeBinaryDataFromUTF8String(text), std::invalid_argument) << text;
  }
}

TEST(PlinthGuid, OneCanonicalTextFormAndByteRoundTrip) {
  const Guid g(0x0123456789abcdefull, 0xfedcba9876543210ull);
  EXPECT_EQ(g.AsString(), u"01234567-89ab-cdef-fedc-ba9876543210");
  EXPECT_EQ(Guid::StringToGUID(g.AsString()), g);

  const auto bytes = g.GuidToBytes();
  EXPECT_EQ(bytes[0], 0x01);
  EXPECT_EQ(bytes[15], 0x10);
  EXPECT_EQ(Guid::FromBytes(bytes), g);

  std::set<Guid> seen;
  for (int i = 0; i < 100; ++i) {
    const Guid u = Guid::CreateUnique();
    EXPECT_EQ((u.GuidToBytes()[6] >> 4), 4);  // random (version 4)
    EXPECT_EQ(Guid::StringToGUID(u.AsString()), u);
    seen.insert(u);
  }
  EXPECT_EQ(seen.size(), 100u);
}

TEST(PlinthGuid, OtherTextFormsAreRejected) {
  const ustring bad[] = {
      u"01234567-89ab-cdef-fedc-ba987654321",     // one digit short
      u"01234567-89ab-cdef-fedc-ba987654321g",    // bad hex digit
      u"01234567-89AB-cdef-fedc-ba9876543210",    // upper case
      u"{01234567-89ab-cdef-fedc-ba9876543210}",  // braces
      u"012345678-9ab-cdef-fedc-ba9876543210",    // dash misplaced, right length
      u"0123456789abcdeffedcba9876543210",        // no dashes
  };
  for (const ustring& text : bad) {
    EXPECT_THROW(Guid::StringToGUID(text), std::invalid_argument) << UTF16to8(text);
  }
}

}  // namespace
