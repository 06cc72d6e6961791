// 128-bit identifiers.
//
// Text form: 36 characters, lower-case hexadecimal in 8-4-4-4-12 groups
// joined by '-' (never '.'); StringToGUID reads it back exactly and throws
// std::invalid_argument for anything else.
#pragma once

#include <array>
#include <cstdint>

#include "plinth/export.h"
#include "plinth/types.h"

namespace plinth {
namespace utility {

class PLINTH_API Guid {
 public:
  Guid() = default;  // the nil GUID (all zero)
  Guid(std::uint64_t high, std::uint64_t low) : high_(high), low_(low) {}

  // A new random (version 4) GUID. Thread-safe.
  static Guid CreateUnique();
  // Throws std::invalid_argument for text that is not a GUID's text form.
  static Guid StringToGUID(const ustring& text);

  ustring AsString() const;
  std::array<unsigned char, 16> GuidToBytes() const;
  static Guid FromBytes(const std::array<unsigned char, 16>& bytes);

  bool IsNil() const { return high_ == 0 && low_ == 0; }
  std::uint64_t High() const { return high_; }
  std::uint64_t Low() const { return low_; }

  friend bool operator==(const Guid& a, const Guid& b) { return a.high_ == b.high_ && a.low_ == b.low_; }
  friend bool operator!=(const Guid& a, const Guid& b) { return !(a == b); }
  friend bool operator<(const Guid& a, const Guid& b) {
    return a.high_ != b.high_ ? a.high_ < b.high_ : a.low_ < b.low_;
  }

 private:
  std::uint64_t high_ = 0;
  std::uint64_t low_ = 0;
};

}  // namespace utility
}  // namespace plinth
