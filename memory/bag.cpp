// RK_Bag: every item the cache knows, ordered by last use (oldest first).
//
// An item is in at most one bag. While it is, its `bag` link names that bag
// and its `bagPosition` is its element, so removal needs no search. The
// ordering key (`lastUseTime`) is only ever written while the item is out of
// every bag's set: AddStuff stamps it before inserting, check-in removes the
// item, restamps it and puts it back.
//
// Insertion is hinted at the young end: an item stamped now belongs after
// every element, and a hinted insert there costs amortised constant time;
// equal stamps land after the existing ones, so they keep insertion order.
// The node freed by the last removal is kept for the next insertion, so
// check-in's remove-then-add restamp allocates nothing.
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
  return *this;
}

void RK_Bag::AddStuff(boost::intrusive_ptr<RK_Stuff> stuff) {
  // The clock is read outside the lock; the stamp is written only after the
  // item passed the check, so a refused item keeps its key (and its place
  // in the bag that holds it).
  const boost::posix_time::ptime now = RK_Now();
  RK_ScCacheLock lock;
  if (stuff->bag.lock()) RKp_FailVerification(380, "stuff already in a bag");
  stuff->lastUseTime = now;
  AddStuffGuts(std::move(stuff));
}

void RK_Bag::AddStuffGuts(boost::intrusive_ptr<RK_Stuff> stuff) {
  if (stuff->bag.lock()) RKp_FailVerification(380, "stuff already in a bag");
  RK_StuffByLastUse::iterator position;
  if (!spareNode.empty()) {
    spareNode.value() = stuff.get();
    position = stuffByLastUse.insert(stuffByLastUse.end(), std::move(spareNode));
  } else {
    position = stuffByLastUse.insert(stuffByLastUse.end(), stuff.get());
  }
  stuff->bagPosition = position;
  stuff->bag = weak_from_this();
}

void RK_Bag::RemoveStuff(RK_Stuff* stuff) {
  RK_ScCacheLock lock;
  RemoveStuffGuts(stuff);
}

void RK_Bag::RemoveStuffGuts(RK_Stuff* stuff) {
  if (stuff->bag.lock().get() != this) RKp_FailVerification(402, "stuff not in the right bag");
  stuff->bag.reset();
  spareNode = stuffByLastUse.extract(stuff->bagPosition);
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
