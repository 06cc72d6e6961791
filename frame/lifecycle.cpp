// Module lifecycle: the process-wide objects, the cache lock guard and the
// clock.
//
// States: not born (no globals) -> alive (RK_Birth: executors, resume queue,
// bag, sort directory) -> stopped (RK_StopAllAsyncWork: executors gone, bag
// and sort directory still usable) -> dead (RK_Death: bag and sort directory
// dropped, factory registry discarded). A host reference may keep the bag or
// sort directory alive past death; everything that fetches a global copes
// with an empty pointer.
//
// The global pointers are written only by the three lifecycle calls and read
// by any thread without a lock, so every access goes through
// boost::atomic_load / boost::atomic_store.
#include "rkcache/lifecycle.h"

#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/make_shared.hpp>
#include <boost/thread/lock_guard.hpp>
#include <chrono>

#include "diskcache/pacing.h"
#include "frame/globals.h"
#include "host/hk.h"
#include "rkcache/stuff.h"

boost::recursive_mutex RK_G_cacheLock;
boost::recursive_mutex RK_G_writeControlLock;
std::atomic<int> RK_G_writesSuspended{0};
std::atomic<bool> RK_G_birthFlag{false};
RKp_LockedGlobals RK_G_locked;

namespace {

boost::shared_ptr<RK_Bag> RK_G_bag;
boost::shared_ptr<RK_SortDir> RK_G_sortDir;
boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RK_G_backgroundExecutor;
boost::shared_ptr<plinth::threads::QueueOnlyOnce> RK_G_resumeWritesQueue;
// Runs the resume queue's job. A sub-executor (limit 1) over its own I/O
// pool, rather than the pool itself, so that RK_StopAllAsyncWork can cancel
// a pending resume check and wait for one that is running.
boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RK_G_resumeExecutor;

void PublishUnderLock(const boost::shared_ptr<RK_Bag>& bag, RK_SortDir* sortDir) {
  boost::lock_guard<boost::recursive_mutex> lock(RK_G_cacheLock);
  RK_G_locked.bag = bag.get();
  RK_G_locked.bagLink = bag;
  RK_G_locked.sortDir = sortDir;
  ++RK_G_locked.epoch;
}

// Cancel drops what has not started; resume lets a suspended executor
// finish what it runs; then wait until nothing of ours runs.
void StopExecutor(boost::shared_ptr<plinth::threads::AsyncThreadedExecutor>* global) {
  boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> executor = boost::atomic_load(global);
  if (!executor) return;
  executor->Cancel();
  executor->Resume();
  executor->WaitUntilIdle();
  boost::atomic_store(global, boost::shared_ptr<plinth::threads::AsyncThreadedExecutor>());
}

}  // namespace

void RK_Birth(bool scanWhileInBackground) {
  JOT_Log(10, "RK", "Birth", "RK Birth");
  RK_G_birthFlag.store(scanWhileInBackground);

  // Executors first: anything the bag starts may already submit work.
  boost::atomic_store(&RK_G_backgroundExecutor,
                      plinth::threads::CreateSubExecutor(plinth::threads::CreateIOBoundExecutor(), 2));

  boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> resumeExecutor =
      plinth::threads::CreateSubExecutor(plinth::threads::CreateIOBoundExecutor(), 1);
  boost::atomic_store(&RK_G_resumeExecutor, resumeExecutor);
  boost::atomic_store(&RK_G_resumeWritesQueue, boost::make_shared<plinth::threads::QueueOnlyOnce>(
                                                   &RKp_CheckResumeBackgroundWrites, resumeExecutor, 1000));

  // Plain new: both derive from HK_MemTrackedObject, so this is the tracked
  // allocation, and a throwing constructor frees through the tracked delete.
  boost::shared_ptr<RK_Bag> bag(new RK_Bag());
  boost::shared_ptr<RK_SortDir> sortDir(new RK_SortDir());
  // A second birth replaces the objects of the first. They are kept alive
  // until the new ones are published under the lock, so that no guard can
  // meet a published bag that is already gone; then the directory goes
  // before the bag, as in RK_Death.
  boost::shared_ptr<RK_Bag> oldBag = boost::atomic_exchange(&RK_G_bag, bag);
  boost::shared_ptr<RK_SortDir> oldSortDir = boost::atomic_exchange(&RK_G_sortDir, sortDir);
  PublishUnderLock(bag, sortDir.get());
  oldSortDir.reset();
}

void RK_StopAllAsyncWork() {
  JOT_Log(10, "RK", "RK_StopAllAsyncWork", "RK_StopAllAsyncWork");
  StopExecutor(&RK_G_backgroundExecutor);
  // A resume check that is running may queue the next one; the cancelled
  // executor drops it, and a run that finds the queue gone does nothing.
  StopExecutor(&RK_G_resumeExecutor);
  boost::atomic_store(&RK_G_resumeWritesQueue, boost::shared_ptr<plinth::threads::QueueOnlyOnce>());
}

void RK_Death() {
  JOT_Log(10, "RK", "Death", "RK Death");
  boost::shared_ptr<RK_Bag> bag = boost::atomic_load(&RK_G_bag);
  boost::shared_ptr<RK_SortDir> sortDir = boost::atomic_load(&RK_G_sortDir);
  PublishUnderLock(boost::shared_ptr<RK_Bag>(), nullptr);
  boost::atomic_store(&RK_G_bag, boost::shared_ptr<RK_Bag>());
  boost::atomic_store(&RK_G_sortDir, boost::shared_ptr<RK_SortDir>());
  // The directory goes first: it holds the references that keep the bag's
  // items alive. Either survives here if the host still holds it.
  sortDir.reset();
  bag.reset();
  RK_Stuff::Death();
}

RK_Bag* RKp_BagUnderLock(const boost::weak_ptr<RK_Bag>& link, boost::shared_ptr<RK_Bag>& keep) {
  // The global bag is alive while it is published: RK_Death unpublishes it
  // under the lock before dropping its reference.
  if (RK_G_locked.bag && !link.owner_before(RK_G_locked.bagLink) && !RK_G_locked.bagLink.owner_before(link))
    return RK_G_locked.bag;
  keep = link.lock();
  return keep.get();
}

boost::shared_ptr<RK_Bag> RK_GlobalBag() {
  return boost::atomic_load(&RK_G_bag);
}

boost::shared_ptr<RK_SortDir> RK_GlobalSortDir() {
  return boost::atomic_load(&RK_G_sortDir);
}

boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RKp_BackgroundExecutor() {
  return boost::atomic_load(&RK_G_backgroundExecutor);
}

boost::shared_ptr<plinth::threads::QueueOnlyOnce> RKp_ResumeWritesQueue() {
  return boost::atomic_load(&RK_G_resumeWritesQueue);
}

// UTC with microsecond resolution, as microsec_clock::universal_time gives,
// but by plain arithmetic from the epoch: that clock converts through
// gmtime_r, which takes the C library's process-wide time-zone lock on
// every call, and check-in reads the clock on every use of an item.
boost::posix_time::ptime RK_Now() {
  static const boost::posix_time::ptime epoch(boost::gregorian::date(1970, 1, 1));
  const auto sinceEpoch = std::chrono::system_clock::now().time_since_epoch();
  return epoch + boost::posix_time::microseconds(
                     std::chrono::duration_cast<std::chrono::microseconds>(sinceEpoch).count());
}

// The bag is read after the lock is taken: it and its lock-hold count are
// guarded by that lock, and the lock is released only after the destructor
// body lowered the count again. Should RK_Death or RK_Birth have replaced
// the bag meanwhile (on this thread, inside the guard), the old bag may be
// gone and is not touched.
RK_ScCacheLock::RK_ScCacheLock()
    : lock_(RK_G_cacheLock), bag_(RK_G_locked.bag), bagEpoch_(RK_G_locked.epoch) {
  if (bag_) ++bag_->lockHoldCount;
}

RK_ScCacheLock::~RK_ScCacheLock() {
  if (bag_ && bagEpoch_ == RK_G_locked.epoch) --bag_->lockHoldCount;
}
