#include "plinth/guid.h"

#include <boost/uuid/random_generator.hpp>
#include <boost/uuid/uuid.hpp>
#include <stdexcept>

namespace plinth {
namespace utility {

Guid Guid::CreateUnique() {
  // One generator per thread: random_generator is not safe to share.
  thread_local boost::uuids::random_generator generator;
  const boost::uuids::uuid id = generator();
  std::array<unsigned char, 16> bytes;
  std::copy(id.begin(), id.end(), bytes.begin());
  return FromBytes(bytes);
}

std::array<unsigned char, 16> Guid::GuidToBytes() const {
  std::array<unsigned char, 16> bytes;
  for (int i = 0; i < 8; ++i) {
    bytes[i] = static_cast<unsigned char>(high_ >> (56 - 8 * i));
    bytes[8 + i] = static_cast<unsigned char>(low_ >> (56 - 8 * i));
  }
  return bytes;
}

Guid Guid::FromBytes(const std::array<unsigned char, 16>& bytes) {
  std::uint64_t high = 0;
  std::uint64_t low = 0;
  for (int i = 0; i < 8; ++i) {
    high = (high << 8) | bytes[i];
    low = (low << 8) | bytes[8 + i];
  }
  return Guid(high, low);
}

namespace {

constexpr std::size_t kTextLength = 36;

bool IsDashPosition(std::size_t i) {
  return i == 8 || i == 13 || i == 18 || i == 23;
}

}  // namespace

ustring Guid::AsString() const {
  static constexpr char16_t kDigits[] = u"0123456789abcdef";
  const auto bytes = GuidToBytes();
  ustring text;
  text.reserve(kTextLength);
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text.push_back(u'-');
    text.push_back(kDigits[bytes[i] >> 4]);
    text.push_back(kDigits[bytes[i] & 0xF]);
  }
  return text;
}

Guid Guid::StringToGUID(const ustring& text) {
  // Only the exact form AsString writes: one GUID has one text, so one
  // cache file name (and one sub-folder) per GUID.
  if (text.size() != kTextLength) throw std::invalid_argument("StringToGUID: wrong length");
  std::array<unsigned char, 16> bytes{};
  std::size_t nibble = 0;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char16_t c = text[i];
    if (IsDashPosition(i)) {
      if (c != u'-') throw std::invalid_argument("StringToGUID: '-' expected");
      continue;
    }
    unsigned digit;
    if (c >= u'0' && c <= u'9') {
      digit = c - u'0';
    } else if (c >= u'a' && c <= u'f') {
      digit = c - u'a' + 10;
    } else {
      throw std::invalid_argument("StringToGUID: not a lower-case hexadecimal digit");
    }
    bytes[nibble / 2] =
        static_cast<unsigned char>(bytes[nibble / 2] | (nibble % 2 == 0 ? digit << 4 : digit));
    ++nibble;
  }
  return FromBytes(bytes);
}

}  // namespace utility
}  // namespace plinth
