// The module's process-wide objects (internal).
//
// The global pointers are written only by RK_Birth, RK_StopAllAsyncWork and
// RK_Death, which the host never overlaps with other calls; readers take a
// copy through the accessors below (atomic shared_ptr loads).
#pragma once

#include <atomic>
#include <boost/shared_ptr.hpp>
#include <boost/thread/recursive_mutex.hpp>

#include "plinth/threads.h"
#include "rkcache/bag.h"
#include "rkcache/sortdir.h"

// The main lock; taken only through RK_ScCacheLock.
extern boost::recursive_mutex RK_G_cacheLock;
// Serialises suspending and resuming background writes; taken before
// RK_G_cacheLock when both are needed.
extern boost::recursive_mutex RK_G_writeControlLock;
// 1 while a disk cache purge holds background writes suspended.
extern std::atomic<int> RK_G_writesSuspended;
// The argument of RK_Birth.
extern std::atomic<bool> RK_G_birthFlag;

// Copies of the global executors; empty before RK_Birth and after RK_StopAllAsyncWork.
boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RKp_BackgroundExecutor();
boost::shared_ptr<plinth::threads::QueueOnlyOnce> RKp_ResumeWritesQueue();
