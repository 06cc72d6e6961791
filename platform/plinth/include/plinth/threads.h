// Executors: a process-wide I/O thread pool, sub-executors with a
// concurrency limit, and a queue that runs a job at most once at a time.
//
// Thread safety: every operation may be called from any thread, including
// from a task running on the executor itself (except WaitUntilIdle, which a
// task must not call on its own executor).
#pragma once

#include <boost/enable_shared_from_this.hpp>
#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <vector>

#include "plinth/export.h"

namespace plinth {
namespace threads {

class PLINTH_API AsyncExecutor {
 public:
  virtual ~AsyncExecutor();
  // Runs task on the executor's threads, no earlier than delayMs
  // milliseconds from now (0: as soon as possible). An exception that
  // escapes a task is caught and reported to the trace facility.
  virtual void Submit(const boost::function<void()>& task, std::uint32_t delayMs) = 0;
};

// What an executor holds and does, for tests and diagnostics.
struct ExecutorSnapshot {
  std::size_t running = 0;               // tasks running now
  std::size_t ready = 0;                 // tasks whose delay has passed, waiting to start
  std::vector<std::uint32_t> delayedMs;  // delays (as submitted) of tasks still waiting for their time
  bool suspended = false;
  bool cancelled = false;
};

class PLINTH_API AsyncThreadedExecutor : public AsyncExecutor {
 public:
  // From now on the executor reports itself cancelled and starts no task:
  // every task that is queued or delayed and not yet started is dropped
  // (destroyed without running). Running tasks finish. Later submissions
  // are dropped too.
  virtual void Cancel() = 0;
  virtual bool IsCancelled() const = 0;
  // Returns when none of this executor's tasks is running. Tasks that are
  // queued while the executor is suspended do not count.
  virtual void WaitUntilIdle() = 0;
  // Running tasks finish; no queued task starts until Resume.
  virtual void Suspend() = 0;
  virtual void Resume() = 0;

  // Introspection.
  virtual ExecutorSnapshot Snapshot() const = 0;
  // Makes every delayed task due now; returns how many were moved. Lets a
  // test run a 60-second rescan without waiting for it.
  virtual std::size_t ExpediteDelayed() = 0;
};

// A new executor over the process-wide pool of threads for work that waits
// on I/O. Tasks run as soon as a pool thread is free.
PLINTH_API boost::shared_ptr<AsyncExecutor> CreateIOBoundExecutor();

// An executor that runs its tasks on parent's threads, never more than
// maxConcurrent of its own at a time. REQUIRES: parent non-null, maxConcurrent >= 1.
PLINTH_API boost::shared_ptr<AsyncThreadedExecutor> CreateSubExecutor(
    const boost::shared_ptr<AsyncExecutor>& parent, int maxConcurrent);

// Runs a job on an executor after a delay, at most one run pending at a time.
// Must be owned by a boost::shared_ptr (a pending run holds a weak pointer;
// a run after the queue's destruction does nothing).
class PLINTH_API QueueOnlyOnce : public boost::enable_shared_from_this<QueueOnlyOnce> {
 public:
  QueueOnlyOnce(const boost::function<void()>& job, const boost::shared_ptr<AsyncExecutor>& executor,
                std::uint32_t delayMs);
  // Submits one run unless one is already pending.
  void Queue();
  bool IsPending() const;

 private:
  void Run();
  boost::function<void()> job_;
  boost::shared_ptr<AsyncExecutor> executor_;
  std::uint32_t delayMs_;
  mutable std::mutex mutex_;
  bool pending_ = false;  // guarded by mutex_
};

// A number identifying the calling thread (stable for the thread's life).
PLINTH_API std::uint64_t GetCurrentThreadID();

}  // namespace threads
}  // namespace plinth
