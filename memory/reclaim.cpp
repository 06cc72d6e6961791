// Memory reclamation: giving memory back, least recently used first,
// cheapest first.
//
// For one item that is not checked out:
//   in memory and on disk  -> its memory can be freed; it stays indexed and
//                             is read back by a later check-out;
//   in memory only         -> freeing it loses it, so it leaves bag and index;
//   neither                -> it holds nothing and leaves bag and index.
// A checked-out item is never freed or dropped here.
//
// The cache keeps no byte count for this: it measures each step through the
// host's memory statistic 6, which falls as items release memory.
#include <cstdint>
#include <exception>

#include "frame/globals.h"
#include "host/hk.h"
#include "rkcache/bag.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

namespace {

std::uint64_t ReadMemoryStat() {
  std::uint64_t value = 0;
  if (const int status = HK_GetMemoryStat(HK_MemStatItemBytes, &value)) throw status;
  return value;
}

}  // namespace

bool RK_Stuff::FreeUpAsMuchAsPossible() {
  RK_ScCacheLock lock;
  if (GetCheckoutCount() != 0) return false;
  bool freed = false;
  if (IsInMemory()) {
    freed = FreeMemory();
    if (freed) {
      if (const boost::shared_ptr<RK_SortDir> global = RK_GlobalSortDir()) global->changeCount.fetch_add(1);
    }
  }
  if (IsInMemory() || IsOnDisk()) return freed;
  // Nothing left to find it by: it leaves index and bag. The directory's
  // reference may be the last one, so hold one until both are done.
  const boost::intrusive_ptr<RK_Stuff> keep(this);
  if (const boost::shared_ptr<RK_SortDir> dir = sortDir.lock()) dir->RemoveStuff(this);
  if (const boost::shared_ptr<RK_Bag> b = bag.lock()) b->RemoveStuffGuts(this);
  return freed;
}

void RK_Stuff::RemoveFromBagAndSortDir() {
  RK_ScCacheLock lock;
  if (GetCheckoutCount() != 0) return;
  // Declared after the guard: if it is the last reference, the item dies
  // inside the lock, before the guard is released.
  const boost::intrusive_ptr<RK_Stuff> keep(this);
  if (const boost::shared_ptr<RK_SortDir> dir = sortDir.lock()) dir->RemoveStuff(this);
  if (const boost::shared_ptr<RK_Bag> b = bag.lock()) b->RemoveStuff(this);
  FreeMemory();
}

RK_Bag::FreeUpResult RK_Bag::FreeUpSomeMemory(std::uint64_t wanted) {
  const std::uint64_t start = ReadMemoryStat();
  std::uint64_t current = start;
  // Signed on purpose: the statistic may rise while we walk.
  const auto freedEnough = [&] {
    const std::int64_t dropped = static_cast<std::int64_t>(start - current);
    return dropped > 0 && static_cast<std::uint64_t>(dropped) > wanted;
  };

  RK_ScCacheLock lock;
  // The guard raised the global bag's count; above 1 means this thread held
  // the lock already (an item callback or an allocation inside a cache
  // operation). Freeing then could pull items out from under the caller.
  const boost::shared_ptr<RK_Bag> global = RK_GlobalBag();
  const bool nested = global && global->lockHoldCount > 1;
  if (!nested) {
    const std::size_t startCount = stuffByLastUse.size();
    int walked = 0;
    for (int pass = 1; pass <= 2 && !freedEnough(); ++pass) {
      for (auto it = stuffByLastUse.begin(); it != stuffByLastUse.end();) {
        if (freedEnough()) break;
        const boost::intrusive_ptr<RK_Stuff> stuff(*it);
        ++it;
        ++walked;
        if (!stuff->IsInMemory()) continue;
        if (pass == 1) {
          if (stuff->IsOnDisk() && stuff->FreeUpAsMuchAsPossible()) current = ReadMemoryStat();
        } else if (!stuff->IsOnDisk()) {
          try {
            stuff->RemoveFromBagAndSortDir();
          } catch (...) {
            // One item that cannot be dropped must not stop the rest.
          }
          current = ReadMemoryStat();
        }
      }
    }
    const std::size_t endCount = stuffByLastUse.size();
    JOT_sprintf(0, "RK", "PURGE_STATS", "numFreed:%d, numWalked:%d, Total: %d",
                static_cast<int>(startCount - endCount), walked, static_cast<int>(endCount));
  }

  const std::int64_t dropped = static_cast<std::int64_t>(start - current);
  if (dropped <= 0) return FreeUpResult_NothingFreed;
  if (static_cast<std::uint64_t>(dropped) > wanted) return FreeUpResult_FreedEnough;
  return FreeUpResult_FreedSome;
}

void RK_Bag::PurgeAllMemoryCaches() {
  RK_ScCacheLock lock;
  for (auto it = stuffByLastUse.begin(); it != stuffByLastUse.end();) {
    // A reference keeps the item alive while it may leave bag and index.
    const boost::intrusive_ptr<RK_Stuff> stuff(*it);
    ++it;
    stuff->FreeUpAsMuchAsPossible();
  }
}
