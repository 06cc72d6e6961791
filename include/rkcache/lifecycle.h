// Module lifecycle and the process-wide cache objects.
//
// The host's order: RK_Birth, normal use, RK_StopAllAsyncWork, RK_Death.
// These three calls must not overlap any other use of the module.
// States: not born -> alive -> stopped (no background work) -> dead.
#pragma once

#include <boost/date_time/posix_time/ptime.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/thread/lock_types.hpp>
#include <boost/thread/recursive_mutex.hpp>
#include <cstdint>

#include "rkcache/types.h"

// Starts the module: background executor, resume queue, global bag and sort
// directory. With scanWhileInBackground true, the disk cache scan runs even
// while the application is not frontmost and does not repeat.
RK_EXPORT void RK_Birth(bool scanWhileInBackground);
// Cancels background work (queued tasks are dropped) and returns when no
// task of the module runs any more. Safe to call twice.
RK_EXPORT void RK_StopAllAsyncWork();
// Drops the global bag and sort directory and discards the factory registry.
RK_EXPORT void RK_Death();

// New strong references to the globals; empty before RK_Birth and after RK_Death.
RK_EXPORT boost::shared_ptr<RK_Bag> RK_GlobalBag();
RK_EXPORT boost::shared_ptr<RK_SortDir> RK_GlobalSortDir();

// Pauses background disk writes for at least 3 seconds.
RK_EXPORT void RK_DeprioritizeBackgroundWrites();

// The module's clock: UTC, microsecond resolution.
RK_EXPORT boost::posix_time::ptime RK_Now();

// The scoped guard through which the cache lock is taken. The lock guards
// the bag, the sort directory and every item's counts, flags and links; it
// is recursive. While held, the global bag's lock-hold count is raised.
class RK_EXPORT RK_ScCacheLock {
 public:
  RK_ScCacheLock();
  ~RK_ScCacheLock();
  RK_ScCacheLock(const RK_ScCacheLock&) = delete;
  RK_ScCacheLock& operator=(const RK_ScCacheLock&) = delete;

 private:
  boost::unique_lock<boost::recursive_mutex> lock_;
  RK_Bag* bag_;             // the global bag when the lock was taken
  std::uint64_t bagEpoch_;  // and which one it was (see RK_Death)
};
