// Small-block allocator for short-lived strings and byte vectors.
//
// Blocks of up to kMaxSmallBlock bytes come from process-wide, thread-safe
// size-class pools; larger blocks go to the global operator new. Any thread
// may allocate and any thread may free.
#pragma once

#include <cstddef>
#include <new>
#include <string>
#include <vector>

#include "plinth/export.h"

namespace plinth {
namespace utility {

class PLINTH_API SmallBlockAllocator {
 public:
  static constexpr std::size_t kMaxSmallBlock = 256;

  // REQUIRES: bytes > 0. Throws std::bad_alloc when memory is exhausted.
  static void* Allocate(std::size_t bytes);
  // REQUIRES: p came from Allocate(bytes) with the same byte count.
  static void Deallocate(void* p, std::size_t bytes) noexcept;

  template <class T>
  class STLAllocator {
   public:
    using value_type = T;
    STLAllocator() noexcept = default;
    template <class U>
    STLAllocator(const STLAllocator<U>&) noexcept {}  // NOLINT: rebind
    T* allocate(std::size_t n) { return static_cast<T*>(SmallBlockAllocator::Allocate(n * sizeof(T))); }
    void deallocate(T* p, std::size_t n) noexcept { SmallBlockAllocator::Deallocate(p, n * sizeof(T)); }
    template <class U>
    bool operator==(const STLAllocator<U>&) const noexcept {
      return true;
    }
    template <class U>
    bool operator!=(const STLAllocator<U>&) const noexcept {
      return false;
    }
  };
};

// The byte vector used for item headers and encoded data.
using ByteVector = std::vector<unsigned char, SmallBlockAllocator::STLAllocator<unsigned char>>;

// The host's UTF-16 string type with the small-block allocator.
using SmallUString =
    std::basic_string<char16_t, std::char_traits<char16_t>, SmallBlockAllocator::STLAllocator<char16_t>>;

}  // namespace utility
}  // namespace plinth
