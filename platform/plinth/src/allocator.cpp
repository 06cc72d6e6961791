#include "plinth/allocator.h"

#include <array>
#include <boost/pool/singleton_pool.hpp>
#include <utility>

namespace plinth {
namespace utility {

namespace {

// Size classes of 16 bytes: 16, 32, ..., 256. Each class is one
// process-wide Boost.Pool singleton (thread-safe through its own mutex;
// never destroyed, so frees during process exit stay valid).
constexpr std::size_t kGranule = 16;
constexpr std::size_t kClasses = SmallBlockAllocator::kMaxSmallBlock / kGranule;
static_assert(SmallBlockAllocator::kMaxSmallBlock % kGranule == 0, "size classes must cover the small range");

template <std::size_t Class>
struct PoolTag {};

template <std::size_t Class>
using ClassPool = boost::singleton_pool<PoolTag<Class>, (Class + 1) * kGranule>;

struct PoolOps {
  void* (*allocate)();
  void (*deallocate)(void*);
};

template <std::size_t Class>
void* AllocateIn() {
  return ClassPool<Class>::malloc();
}

template <std::size_t Class>
void DeallocateIn(void* p) {
  ClassPool<Class>::free(p);
}

template <std::size_t... Classes>
constexpr std::array<PoolOps, kClasses> MakeTable(std::index_sequence<Classes...>) {
  return {{PoolOps{&AllocateIn<Classes>, &DeallocateIn<Classes>}...}};
}

constexpr std::array<PoolOps, kClasses> kPools = MakeTable(std::make_index_sequence<kClasses>());

std::size_t ClassOf(std::size_t bytes) {
  return (bytes + kGranule - 1) / kGranule - 1;
}

}  // namespace

void* SmallBlockAllocator::Allocate(std::size_t bytes) {
  if (bytes == 0) bytes = 1;
  if (bytes > kMaxSmallBlock) return ::operator new(bytes);
  void* p = kPools[ClassOf(bytes)].allocate();
  if (p == nullptr) throw std::bad_alloc();
  return p;
}

void SmallBlockAllocator::Deallocate(void* p, std::size_t bytes) noexcept {
  if (p == nullptr) return;
  if (bytes == 0) bytes = 1;
  if (bytes > kMaxSmallBlock) {
    ::operator delete(p);
    return;
  }
  kPools[ClassOf(bytes)].deallocate(p);
}

}  // namespace utility
}  // namespace plinth
