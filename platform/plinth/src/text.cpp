#include "plinth/text.h"

#include <boost/locale/encoding_utf.hpp>
#include <climits>
#include <stdexcept>

#include "posix_util.h"

namespace plinth {
namespace utility {

namespace conv = boost::locale::conv;

std::string UTF16to8(const ustring& text) {
  try {
    return conv::utf_to_utf<char>(text, conv::stop);
  } catch (const conv::conversion_error&) {
    throw std::invalid_argument("UTF16to8: ill-formed UTF-16 text");
  }
}

ustring UTF8to16(const std::string& text) {
  try {
    return conv::utf_to_utf<char16_t>(text, conv::stop);
  } catch (const conv::conversion_error&) {
    throw std::invalid_argument("UTF8to16: ill-formed UTF-8 text");
  }
}

ustring AsciiToUTF16(const char* text) {
  if (text == nullptr) throw std::invalid_argument("AsciiToUTF16: null text");
  ustring out;
  for (const char* p = text; *p != '\0'; ++p) {
    const auto c = static_cast<unsigned char>(*p);
    if (c >= 0x80) throw std::invalid_argument("AsciiToUTF16: byte outside 7-bit ASCII");
    out.push_back(static_cast<char16_t>(c));
  }
  return out;
}

std::uint32_t HexStringToNumber(const ustring& text) {
  if (text.empty()) throw std::invalid_argument("HexStringToNumber: empty text");
  std::uint64_t value = 0;
  for (char16_t c : text) {
    unsigned digit;
    if (c >= u'0' && c <= u'9') {
      digit = c - u'0';
    } else if (c >= u'a' && c <= u'f') {
      digit = c - u'a' + 10;
    } else if (c >= u'A' && c <= u'F') {
      digit = c - u'A' + 10;
    } else {
      throw std::invalid_argument("HexStringToNumber: not a hexadecimal digit");
    }
    value = value * 16 + digit;
    if (value > 0xFFFFFFFFull) throw std::invalid_argument("HexStringToNumber: value above 32 bits");
  }
  return static_cast<std::uint32_t>(value);
}

bool StringToNumber(int& out, const ustring& text, Flags<unsigned> flags) {
  out = 0;
  std::size_t i = 0;
  if (flags.Has(kNumberSkipLeadingSpace)) {
    while (i < text.size() && (text[i] == u' ' || (text[i] >= u'\t' && text[i] <= u'\r'))) ++i;
  }
  bool negative = false;
  if (i < text.size() && (text[i] == u'+' || text[i] == u'-')) {
    negative = text[i] == u'-';
    ++i;
  }
  const std::size_t firstDigit = i;
  // Accumulate as a negative value so that INT_MIN is representable.
  long long value = 0;
  for (; i < text.size() && text[i] >= u'0' && text[i] <= u'9'; ++i) {
    value = value * 10 - (text[i] - u'0');
    if (value < static_cast<long long>(INT_MIN)) return false;
  }
  if (i == firstDigit) return false;
  if (!negative) {
    if (-value > static_cast<long long>(INT_MAX)) return false;
    value = -value;
  }
  if (i != text.size() && !flags.Has(kNumberLeadingOnly)) return false;
  out = static_cast<int>(value);
  return true;
}

namespace {

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

int DecodeChar(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

}  // namespace

std::string EncodeBinaryDataToUTF8String(const unsigned char* data, std::size_t size) {
  std::string out;
  out.reserve((size + 2) / 3 * 4);
  std::size_t i = 0;
  for (; i + 3 <= size; i += 3) {
    const std::uint32_t v = (data[i] << 16) | (data[i + 1] << 8) | data[i + 2];
    out.push_back(kAlphabet[(v >> 18) & 63]);
    out.push_back(kAlphabet[(v >> 12) & 63]);
    out.push_back(kAlphabet[(v >> 6) & 63]);
    out.push_back(kAlphabet[v & 63]);
  }
  if (size - i == 1) {
    const std::uint32_t v = data[i] << 16;
    out.push_back(kAlphabet[(v >> 18) & 63]);
    out.push_back(kAlphabet[(v >> 12) & 63]);
    out += "==";
  } else if (size - i == 2) {
    const std::uint32_t v = (data[i] << 16) | (data[i + 1] << 8);
    out.push_back(kAlphabet[(v >> 18) & 63]);
    out.push_back(kAlphabet[(v >> 12) & 63]);
    out.push_back(kAlphabet[(v >> 6) & 63]);
    out.push_back('=');
  }
  return out;
}

std::string EncodeBinaryDataToUTF8String(const ByteVector& data) {
  return EncodeBinaryDataToUTF8String(data.data(), data.size());
}

ByteVector DecodeBinaryDataFromUTF8String(const std::string& text) {
  if (text.size() % 4 != 0) throw std::invalid_argument("Base64: length is not a multiple of 4");
  ByteVector out;
  out.reserve(text.size() / 4 * 3);
  for (std::size_t i = 0; i < text.size(); i += 4) {
    const bool last = i + 4 == text.size();
    int v[4];
    int padding = 0;
    for (int k = 0; k < 4; ++k) {
      const char c = text[i + k];
      if (c == '=') {
        // Padding only in the last quantum, only in its last two places,
        // and nothing but padding after it.
        if (!last || k < 2) throw std::invalid_argument("Base64: misplaced padding");
        ++padding;
        v[k] = 0;
      } else {
        if (padding != 0) throw std::invalid_argument("Base64: data after padding");
        v[k] = DecodeChar(c);
        if (v[k] < 0) throw std::invalid_argument("Base64: character outside the alphabet");
      }
    }
    const std::uint32_t bits = (v[0] << 18) | (v[1] << 12) | (v[2] << 6) | v[3];
    // Canonical form: the bits that padding leaves unused must be zero, so
    // that every text has exactly one decoding and encodes back to itself.
    if ((padding == 1 && (bits & 0xFF) != 0) || (padding == 2 && (bits & 0xFFFF) != 0)) {
      throw std::invalid_argument("Base64: non-zero bits in padding");
    }
    out.push_back(static_cast<unsigned char>(bits >> 16));
    if (padding < 2) out.push_back(static_cast<unsigned char>(bits >> 8));
    if (padding < 1) out.push_back(static_cast<unsigned char>(bits));
  }
  return out;
}

}  // namespace utility
}  // namespace plinth
