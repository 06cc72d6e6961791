// RK_Bag: every item the cache knows, ordered by last use (oldest first).
//
// An item is in at most one bag. While it is, its `bag` link names that bag
// and its `bagPosition` is its element, so removal needs no search.
//
// The items form a list sorted by `lastUseTime`; equal stamps keep the order
// in which the items came in. Whoever stamps an item as used now (AddStuff,
// check-in) stamps it no earlier than the latest stamp at the young end: the clock
// is read before the lock, so a thread that read it a moment earlier may
// arrive second, and a wall clock set back would otherwise file fresh uses
// as the oldest, to be evicted first. The stamp thus always belongs at the
// young end: entering is an append and a use is a splice there, constant
// time with no allocation and no rebalancing, which keeps the hit path
// short. AddStuffGuts still places an item with any stamp correctly, by
// stepping back from the young end past the items stamped later.
#include "rkcache/bag.h"

#include <exception>
#include <iterator>
#include <utility>

#include "frame/globals.h"
#include "frame/report.h"
#include "rkcache/errors.h"
#include "rkcache/lifecycle.h"

RK_Bag::RK_Bag() = default;

RK_Bag::~RK_Bag() {
  // Only the links that still name this bag are cleared: a bag filled by
  // copy assignment holds items that belong to another bag. The per-item
  // removal with its verification would fail for every item here (our weak
  // self-reference has expired), so the elements are released directly.
  try {
    RK_ScCacheLock lock;
    const boost::weak_ptr<RK_Bag> self = weak_from_this();
    for (RK_Stuff* stuff : stuffByLastUse) {
      if (!stuff->bag.owner_before(self) && !self.owner_before(stuff->bag)) stuff->bag.reset();
    }
    stuffByLastUse.clear();
  } catch (int) {
  } catch (const std::exception& e) {
    HK_TranslateAndReportException(e);
  } catch (...) {
  }
}

RK_Bag& RK_Bag::operator=(const RK_Bag& other) {
  if (this == &other) return *this;
  // The element pointers are copied; the items are not told and keep their
  // links and positions in the bag they are in.
  stuffByLastUse = other.stuffByLastUse;
  lockHoldCount = other.lockHoldCount;
  diskCacheEnabled.store(other.diskCacheEnabled.load());
  diskCacheDir = other.diskCacheDir;
  diskCacheRootPath = other.diskCacheRootPath;
  diskCacheSizeLimit = other.diskCacheSizeLimit;
  diskCacheSize = other.diskCacheSize;
  appVersion = other.appVersion;
  youngestStamp = other.youngestStamp;
  return *this;
}

void RK_Bag::AddStuff(boost::intrusive_ptr<RK_Stuff> stuff) {
  // The clock is read outside the lock; the stamp is written only after the
  // item passed the check, so a refused item keeps its key (and its place
  // in the bag that holds it).
  const boost::posix_time::ptime now = RK_Now();
  RK_ScCacheLock lock;
  if (stuff->bag.lock()) RKp_FailVerification(380, "stuff already in a bag");
  stuff->lastUseTime = StampFor(now);
  AddStuffGuts(std::move(stuff));
}

void RK_Bag::AddStuffGuts(boost::intrusive_ptr<RK_Stuff> stuff) {
  if (stuff->bag.lock()) RKp_FailVerification(380, "stuff already in a bag");
  auto position = stuffByLastUse.end();
  while (position != stuffByLastUse.begin() && (*std::prev(position))->lastUseTime > stuff->lastUseTime)
    --position;
  stuff->bagPosition = stuffByLastUse.insert(position, stuff.get());
  if (position == stuffByLastUse.end() && stuff->lastUseTime > youngestStamp)
    youngestStamp = stuff->lastUseTime;
  stuff->bag = weak_from_this();
}

boost::posix_time::ptime RK_Bag::StampFor(const boost::posix_time::ptime& now) const {
  return youngestStamp > now ? youngestStamp : now;
}

void RK_Bag::MarkUsed(RK_Stuff* stuff, const boost::posix_time::ptime& now) {
  stuff->lastUseTime = youngestStamp = StampFor(now);
  stuffByLastUse.splice(stuffByLastUse.end(), stuffByLastUse, stuff->bagPosition);
}

void RK_Bag::RemoveStuff(RK_Stuff* stuff) {
  RK_ScCacheLock lock;
  RemoveStuffGuts(stuff);
}

void RK_Bag::RemoveStuffGuts(RK_Stuff* stuff) {
  if (stuff->bag.lock().get() != this) RKp_FailVerification(402, "stuff not in the right bag");
  stuff->bag.reset();
  stuffByLastUse.erase(stuff->bagPosition);
}

void RK_Bag::ClearBagAndSortDir() {
  RK_ScCacheLock lock;
  for (auto it = stuffByLastUse.begin(); it != stuffByLastUse.end();) {
    RK_Stuff* stuff = *it;
    ++it;
    stuff->RemoveFromBagAndSortDir();
  }
}

std::size_t RK_Bag::GetStuffCount() const {
  RK_ScCacheLock lock;
  return stuffByLastUse.size();
}
