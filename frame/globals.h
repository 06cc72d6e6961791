// The module's process-wide objects (internal).
//
// The global pointers are written only by RK_Birth, RK_StopAllAsyncWork and
// RK_Death, which the host never overlaps with other calls; readers on other
// threads take a copy through the accessors below, which load the
// shared_ptrs atomically.
#pragma once

#include <atomic>
#include <boost/shared_ptr.hpp>
#include <boost/thread/recursive_mutex.hpp>
#include <boost/weak_ptr.hpp>
#include <cstdint>

#include "plinth/threads.h"
#include "rkcache/bag.h"
#include "rkcache/sortdir.h"

// The main lock; taken only through RK_ScCacheLock.
extern RK_INTERNAL boost::recursive_mutex RK_G_cacheLock;
// Serialises suspending and resuming background writes; taken before
// RK_G_cacheLock when both are needed.
extern RK_INTERNAL boost::recursive_mutex RK_G_writeControlLock;
// 1 while a disk cache purge holds background writes suspended.
extern RK_INTERNAL std::atomic<int> RK_G_writesSuspended;
// The global bag and sort directory as a holder of RK_G_cacheLock sees
// them. Written only under that lock, by RK_Birth and RK_Death, which set
// them while the shared globals hold their references; so a holder of the
// lock may use them without taking a reference of its own. The hit path
// thereby avoids the atomic shared_ptr loads. The epoch moves on every
// change, so a guard can tell whether the bag it raised is still the one.
struct RKp_LockedGlobals {
  RK_Bag* bag = nullptr;
  boost::weak_ptr<RK_Bag> bagLink;  // names bag's owner, to recognise links to it
  RK_SortDir* sortDir = nullptr;
  std::uint64_t epoch = 0;
};
extern RK_INTERNAL RKp_LockedGlobals RK_G_locked;

// REQUIRES: the caller holds RK_G_cacheLock. The bag that `link` names,
// usable until the lock is released, or null if it names none. A link to
// the global bag is answered without touching reference counts; for any
// other bag a reference is taken into `keep`.
RK_INTERNAL RK_Bag* RKp_BagUnderLock(const boost::weak_ptr<RK_Bag>& link, boost::shared_ptr<RK_Bag>& keep);
// The argument of RK_Birth.
extern RK_INTERNAL std::atomic<bool> RK_G_birthFlag;

// Copies of the global executors; empty before RK_Birth and after RK_StopAllAsyncWork.
RK_INTERNAL boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RKp_BackgroundExecutor();
RK_INTERNAL boost::shared_ptr<plinth::threads::QueueOnlyOnce> RKp_ResumeWritesQueue();
