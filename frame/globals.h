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
// The argument of RK_Birth.
extern RK_INTERNAL std::atomic<bool> RK_G_birthFlag;

// Copies of the global executors; empty before RK_Birth and after RK_StopAllAsyncWork.
RK_INTERNAL boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RKp_BackgroundExecutor();
RK_INTERNAL boost::shared_ptr<plinth::threads::QueueOnlyOnce> RKp_ResumeWritesQueue();
