// Basic vocabulary of the platform library: UTF-16 text and flag sets.
//
// Every name and path crosses the platform interface as UTF-16 (`ustring`);
// conversion to the operating system's UTF-8 happens at the system-call
// boundary inside the platform library.
#pragma once

#include <string>

namespace plinth {

using ustring = std::u16string;

// Native path separator. Code that builds paths by appending folder names
// uses this instead of a literal, so that the same code works on every OS.
inline constexpr char16_t kPathSeparator = u'/';

namespace utility {

// A set of option bits passed to platform calls. The meaning of each bit is
// documented at the call that takes the flags.
template <class T>
class Flags {
 public:
  constexpr Flags(T bits = T()) : bits_(bits) {}  // NOLINT: implicit by design
  constexpr T Value() const { return bits_; }
  constexpr bool Has(T bit) const { return (bits_ & bit) == bit; }

 private:
  T bits_;
};

}  // namespace utility
}  // namespace plinth
