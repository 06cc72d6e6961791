// Memory statistic 6: the bytes the host's items hold. Tracked allocation
// adds to it and tracked frees take from it, so it falls as items release
// memory; a test may also set it outright.
#include <atomic>
#include <new>

#include "host/control.h"
#include "host/hk.h"

namespace {

std::atomic<std::uint64_t> g_itemBytes{0};
std::atomic<int> g_failMemoryStat{0};

// Adds delta, stopping at 0 rather than wrapping round: a statistic set
// below what was allocated earlier must not jump to a huge value on free.
void AddBytes(std::int64_t delta) {
  if (delta >= 0) {
    g_itemBytes.fetch_add(static_cast<std::uint64_t>(delta), std::memory_order_relaxed);
    return;
  }
  const std::uint64_t take = static_cast<std::uint64_t>(-(delta + 1)) + 1;  // |delta| without overflow
  std::uint64_t current = g_itemBytes.load(std::memory_order_relaxed);
  while (!g_itemBytes.compare_exchange_weak(current, current > take ? current - take : 0,
                                            std::memory_order_relaxed)) {
  }
}

}  // namespace

int HK_GetMemoryStat(int selector, std::uint64_t* value) {
  const int forced = g_failMemoryStat.load();
  if (forced != 0) return forced;
  if (value == nullptr) return HK_ErrBadParameter;
  if (selector != HK_MemStatItemBytes) return HK_ErrUnknownSelector;
  *value = g_itemBytes.load(std::memory_order_relaxed);
  return 0;
}

void* HK_TrackedAlloc(std::size_t bytes) {
  void* p = ::operator new(bytes);
  AddBytes(static_cast<std::int64_t>(bytes));
  return p;
}

void HK_TrackedFree(void* p, std::size_t bytes) noexcept {
  if (p == nullptr) return;
  ::operator delete(p);
  AddBytes(-static_cast<std::int64_t>(bytes));
}

void HK_TrackBytes(std::int64_t delta) {
  AddBytes(delta);
}

void* HK_MemTrackedObject::operator new(std::size_t bytes) {
  return HK_TrackedAlloc(bytes);
}

void HK_MemTrackedObject::operator delete(void* p, std::size_t bytes) noexcept {
  HK_TrackedFree(p, bytes);
}

namespace rkhost {
namespace control {

void SetMemoryStat(std::uint64_t value) {
  g_itemBytes.store(value);
}

std::uint64_t MemoryStat() {
  return g_itemBytes.load();
}

void FailMemoryStat(int status) {
  g_failMemoryStat.store(status);
}

}  // namespace control
}  // namespace rkhost
