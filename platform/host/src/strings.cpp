// Localised strings and text conversion. The host ships no translations, so
// a localised text is the default text that follows the key.
#include <boost/locale/utf.hpp>
#include <cstring>
#include <iterator>
#include <stdexcept>

#include "host/hk.h"
#include "plinth/text.h"

namespace {

constexpr const char kTranslatorNote[] = "{{*COMMENT*}}";

// The message part of "key=text{{*COMMENT*}}note".
std::string MessageOf(const char* keyAndText) {
  if (keyAndText == nullptr) return std::string();
  const char* text = std::strchr(keyAndText, '=');
  text = text != nullptr ? text + 1 : keyAndText;
  const char* note = std::strstr(text, kTranslatorNote);
  return note != nullptr ? std::string(text, note) : std::string(text);
}

// The length of text cut to at most limit bytes, moved back so that it does
// not end inside a UTF-8 sequence (continuation bytes are 10xxxxxx).
std::size_t CutLength(const char* text, std::size_t length, std::size_t limit) {
  if (length <= limit) return length;
  std::size_t cut = limit;
  while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) --cut;
  return cut;
}

// Re-encodes text of the given unit type, replacing each unit that does not
// start a well-formed sequence with U+FFFD. The decoder may have consumed
// the unit after a bad one (a high surrogate's partner, a lead byte's
// continuation); decoding goes on right after the bad unit so that no good
// character is lost.
template <class Out, class In>
std::basic_string<Out> ReplaceInvalid(const std::basic_string<In>& text) {
  using namespace boost::locale::utf;
  std::basic_string<Out> out;
  out.reserve(text.size());
  auto it = text.begin();
  while (it != text.end()) {
    const auto start = it;
    code_point c = utf_traits<In>::decode(it, text.end());
    if (c == illegal || c == incomplete) {
      c = 0xFFFD;
      it = start + 1;
    }
    utf_traits<Out>::encode(c, std::back_inserter(out));
  }
  return out;
}

HK_UTF16String ToSmall(const plinth::ustring& text) {
  return HK_UTF16String(text.begin(), text.end());
}

}  // namespace

std::string HK_ZLookupLStrCache(HK_ZRef table, int index, int /*reserved1*/, int /*reserved2*/) {
  if (table == nullptr || table->entries == nullptr || index < 0 || index >= table->count)
    return std::string();
  // Entries past the terminating one are not part of the table, whatever
  // the count says.
  for (int i = 0; i <= index; ++i) {
    if (table->entries[i].keyAndText == nullptr) return std::string();
  }
  return MessageOf(table->entries[index].keyAndText);
}

std::string HK_ZStringToMBString(const char* keyAndText) {
  return MessageOf(keyAndText);
}

int HK_CopyString(const char* text, int bufferSize, char* buffer) {
  if (text == nullptr || buffer == nullptr || bufferSize <= 0) return HK_ErrBadParameter;
  const std::size_t length = CutLength(text, std::strlen(text), static_cast<std::size_t>(bufferSize) - 1);
  std::memcpy(buffer, text, length);
  buffer[length] = '\0';
  return 0;
}

HK_UTF16String HK_AsciiToUTF16String(const char* text) {
  if (text == nullptr) return HK_UTF16String();
  return ToSmall(plinth::utility::AsciiToUTF16(text));
}

HK_UTF16String HK_MBToUTF16String(const char* text) {
  if (text == nullptr) return HK_UTF16String();
  const std::string bytes(text);
  try {
    return ToSmall(plinth::utility::UTF8to16(bytes));
  } catch (const std::invalid_argument&) {
    // A name from the system (the computer name) need not be valid UTF-8;
    // keep what can be read.
    return ToSmall(ReplaceInvalid<char16_t>(bytes));
  }
}

std::string HK_UTF16ToMBString(const HK_UTF16String& text, bool replaceInvalid) {
  const plinth::ustring wide(text.begin(), text.end());
  if (!replaceInvalid) return plinth::utility::UTF16to8(wide);
  try {
    return plinth::utility::UTF16to8(wide);
  } catch (const std::invalid_argument&) {
    return plinth::utility::UTF16to8(ReplaceInvalid<char16_t>(wide));
  }
}
