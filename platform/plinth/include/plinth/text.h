// Text conversions, number parsing and the binary-to-text encoding.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "plinth/allocator.h"
#include "plinth/export.h"
#include "plinth/types.h"

namespace plinth {
namespace utility {

// UTF-16 <-> UTF-8. Ill-formed input (a lone surrogate, a bad UTF-8
// sequence) throws std::invalid_argument; nothing is silently dropped.
PLINTH_API std::string UTF16to8(const ustring& text);
PLINTH_API ustring UTF8to16(const std::string& text);
// REQUIRES: text is 7-bit ASCII (non-null); other bytes throw std::invalid_argument.
PLINTH_API ustring AsciiToUTF16(const char* text);

// Reads a whole string of hexadecimal digits (either case, no prefix, no
// sign) as an unsigned 32-bit value. Empty text, any other character, or a
// value above 0xFFFFFFFF throws std::invalid_argument.
PLINTH_API std::uint32_t HexStringToNumber(const ustring& text);

// Flags for StringToNumber.
inline constexpr unsigned kNumberSkipLeadingSpace = 1;
inline constexpr unsigned kNumberLeadingOnly = 2;  // trailing text is allowed and ignored

// Parses the decimal number at the start of text (optional sign). With
// kNumberLeadingOnly the rest of the text is ignored; without it the whole
// text must be the number. Returns false and sets out to 0 when there is no
// number, or on overflow of int.
PLINTH_API bool StringToNumber(int& out, const ustring& text, Flags<unsigned> flags);

// Standard Base64 (RFC 4648 alphabet with '+' and '/', '=' padding). The
// decoder rejects characters outside the alphabet, bad padding and bad length
// with std::invalid_argument.
PLINTH_API std::string EncodeBinaryDataToUTF8String(const unsigned char* data, std::size_t size);
PLINTH_API std::string EncodeBinaryDataToUTF8String(const ByteVector& data);
PLINTH_API ByteVector DecodeBinaryDataFromUTF8String(const std::string& text);

}  // namespace utility
}  // namespace plinth
