// Executors over one process-wide Boost.Asio thread pool.
//
// A sub-executor's task is in exactly one of these states:
//   delayed  - waiting for its steady_timer (in delayed_, keyed by id)
//   ready    - due, waiting for a free slot (in ready_)
//   running  - handed to the parent; counted in running_ until it has run
//              (or the parent dropped it) and its function was destroyed
//   gone     - run and destroyed, or dropped by Cancel without running
// Invariants, under mutex_: running_ <= limit_; while neither suspended nor
// cancelled, ready_ is empty or running_ == limit_ (Pump keeps it so);
// after Cancel, ready_ and delayed_ stay empty.
#include "plinth/threads.h"

#include <algorithm>
#include <atomic>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>
#include <boost/asio/thread_pool.hpp>
#include <boost/make_shared.hpp>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <map>
#include <memory>

#include "plinth/debug.h"

namespace plinth {
namespace threads {

namespace {

constexpr std::size_t kPoolThreads = 4;

thread_local bool t_onPoolThread = false;

// Created on first use; at exit it is stopped (queued work is abandoned,
// pending timers with it) and joined, unless exit happens on a pool thread,
// which cannot join itself. The pool object is kept, not destroyed: handlers
// it still holds may own executors whose timers refer to it.
struct PoolHolder {
  boost::asio::thread_pool* pool = new boost::asio::thread_pool(kPoolThreads);
  ~PoolHolder() {
    pool->stop();
    if (!t_onPoolThread) pool->join();
  }
};

boost::asio::thread_pool& Pool() {
  static PoolHolder holder;
  return *holder.pool;
}

void RunGuarded(const boost::function<void()>& task) {
  t_onPoolThread = true;
  try {
    task();
  } catch (const std::exception& e) {
    debug::Trace(std::string("plinth: an executor task threw: ") + e.what() + "\n");
  } catch (...) {
    debug::Trace("plinth: an executor task threw a non-standard exception\n");
  }
}

class IOExecutor final : public AsyncExecutor {
 public:
  void Submit(const boost::function<void()>& task, std::uint32_t delayMs) override {
    if (!task) return;
    boost::asio::thread_pool& pool = Pool();
    if (delayMs == 0) {
      boost::asio::post(pool, [task] { RunGuarded(task); });
      return;
    }
    // The handler owns its timer; both go when the handler has run.
    auto timer = std::make_shared<boost::asio::steady_timer>(pool, std::chrono::milliseconds(delayMs));
    timer->async_wait([timer, task](const boost::system::error_code& ec) {
      if (!ec) RunGuarded(task);
    });
  }
};

class SubExecutor final : public AsyncThreadedExecutor, public boost::enable_shared_from_this<SubExecutor> {
 public:
  SubExecutor(const boost::shared_ptr<AsyncExecutor>& parent, int maxConcurrent)
      : parent_(parent), limit_(static_cast<std::size_t>(maxConcurrent < 1 ? 1 : maxConcurrent)) {}

  void Submit(const boost::function<void()>& task, std::uint32_t delayMs) override {
    if (!task) return;
    std::unique_lock<std::mutex> lock(mutex_);
    if (cancelled_) return;  // dropped: the task is never copied, never run
    if (delayMs == 0) {
      ready_.push_back(task);
      Pump(lock);
      return;
    }
    const std::uint64_t id = ++nextId_;
    Delayed& d = delayed_[id];
    d.delayMs = delayMs;
    d.task = task;
    d.timer = std::make_unique<boost::asio::steady_timer>(Pool(), std::chrono::milliseconds(delayMs));
    boost::weak_ptr<SubExecutor> weak = shared_from_this();
    d.timer->async_wait([weak, id](const boost::system::error_code& ec) {
      if (ec) return;  // cancelled or expedited: the entry is gone already
      if (auto self = weak.lock()) self->OnTimer(id);
    });
  }

  void Cancel() override {
    std::deque<boost::function<void()>> dropReady;
    std::map<std::uint64_t, Delayed> dropDelayed;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      cancelled_ = true;
      dropReady.swap(ready_);
      dropDelayed.swap(delayed_);
      for (auto& entry : dropDelayed) entry.second.timer->cancel();
      idle_.notify_all();
    }
    // The dropped tasks (and what they bind) are destroyed here, outside the
    // lock: their destructors may call back into this executor.
  }

  bool IsCancelled() const override {
    std::lock_guard<std::mutex> lock(mutex_);
    return cancelled_;
  }

  void WaitUntilIdle() override {
    std::unique_lock<std::mutex> lock(mutex_);
    idle_.wait(lock, [this] { return running_ == 0 && (ready_.empty() || suspended_ || cancelled_); });
  }

  void Suspend() override {
    std::lock_guard<std::mutex> lock(mutex_);
    suspended_ = true;
    idle_.notify_all();
  }

  void Resume() override {
    std::unique_lock<std::mutex> lock(mutex_);
    suspended_ = false;
    Pump(lock);
  }

  ExecutorSnapshot Snapshot() const override {
    std::lock_guard<std::mutex> lock(mutex_);
    ExecutorSnapshot s;
    s.running = running_;
    s.ready = ready_.size();
    for (const auto& entry : delayed_) s.delayedMs.push_back(entry.second.delayMs);
    s.suspended = suspended_;
    s.cancelled = cancelled_;
    return s;
  }

  std::size_t ExpediteDelayed() override {
    std::unique_lock<std::mutex> lock(mutex_);
    const std::size_t moved = delayed_.size();
    for (auto& entry : delayed_) {  // in submission order
      entry.second.timer->cancel();
      ready_.push_back(std::move(entry.second.task));
    }
    delayed_.clear();
    Pump(lock);
    return moved;
  }

 private:
  struct Delayed {
    std::uint32_t delayMs = 0;
    boost::function<void()> task;
    std::unique_ptr<boost::asio::steady_timer> timer;
  };

  // One task handed to the parent. Whether the parent runs it or drops it,
  // the slot it holds is given back exactly once.
  class Slot {
   public:
    Slot(boost::shared_ptr<SubExecutor> owner, boost::function<void()> task)
        : owner_(std::move(owner)), task_(std::move(task)) {}
    ~Slot() {
      if (!done_) owner_->Finished();
    }
    void Run() {
      boost::function<void()> task;
      task.swap(task_);
      RunGuarded(task);
      task.clear();  // destroyed before the slot counts as free
      done_ = true;
      owner_->Finished();
    }

   private:
    boost::shared_ptr<SubExecutor> owner_;
    boost::function<void()> task_;
    bool done_ = false;
  };

  void OnTimer(std::uint64_t id) {
    std::unique_lock<std::mutex> lock(mutex_);
    auto it = delayed_.find(id);
    if (it == delayed_.end()) return;
    ready_.push_back(std::move(it->second.task));
    delayed_.erase(it);
    Pump(lock);
  }

  // Starts ready tasks while slots are free. Called with the lock held;
  // releases it while handing tasks to the parent.
  void Pump(std::unique_lock<std::mutex>& lock) {
    for (;;) {
      std::vector<boost::function<void()>> launch;
      while (!cancelled_ && !suspended_ && running_ < limit_ && !ready_.empty()) {
        launch.push_back(std::move(ready_.front()));
        ready_.pop_front();
        ++running_;
      }
      if (launch.empty()) return;
      boost::shared_ptr<SubExecutor> self = shared_from_this();
      lock.unlock();
      {
        // A parent that drops a task (it was cancelled) frees the slot inside
        // its Submit; Finished then leaves the next start to this loop
        // instead of recursing once per queued task.
        PumpingMark mark(this);
        for (auto& task : launch) {
          auto slot = std::make_shared<Slot>(self, std::move(task));
          parent_->Submit([slot] { slot->Run(); }, 0);
        }
      }
      lock.lock();
    }
  }

  void Finished() {
    std::unique_lock<std::mutex> lock(mutex_);
    --running_;
    idle_.notify_all();
    if (!PumpingMark::IsPumping(this)) Pump(lock);
  }

  // Which executors the calling thread is handing tasks to right now.
  class PumpingMark {
   public:
    explicit PumpingMark(const SubExecutor* ex) { Stack().push_back(ex); }
    ~PumpingMark() { Stack().pop_back(); }
    static bool IsPumping(const SubExecutor* ex) {
      const auto& s = Stack();
      return std::find(s.begin(), s.end(), ex) != s.end();
    }

   private:
    static std::vector<const SubExecutor*>& Stack() {
      thread_local std::vector<const SubExecutor*> stack;
      return stack;
    }
  };

  const boost::shared_ptr<AsyncExecutor> parent_;
  const std::size_t limit_;
  mutable std::mutex mutex_;
  std::condition_variable idle_;               // signalled when running_ drops or a wait may end
  std::size_t running_ = 0;                    // guarded by mutex_
  std::deque<boost::function<void()>> ready_;  // guarded by mutex_
  std::map<std::uint64_t, Delayed> delayed_;   // guarded by mutex_ (timers touched only under it)
  std::uint64_t nextId_ = 0;                   // guarded by mutex_
  bool suspended_ = false;                     // guarded by mutex_
  bool cancelled_ = false;                     // guarded by mutex_
};

}  // namespace

AsyncExecutor::~AsyncExecutor() = default;

boost::shared_ptr<AsyncExecutor> CreateIOBoundExecutor() {
  return boost::make_shared<IOExecutor>();
}

boost::shared_ptr<AsyncThreadedExecutor> CreateSubExecutor(const boost::shared_ptr<AsyncExecutor>& parent,
                                                           int maxConcurrent) {
  if (!parent) throw std::invalid_argument("CreateSubExecutor: no parent executor");
  if (maxConcurrent < 1) throw std::invalid_argument("CreateSubExecutor: limit below 1");
  return boost::make_shared<SubExecutor>(parent, maxConcurrent);
}

// ---------------------------------------------------------------------------

QueueOnlyOnce::QueueOnlyOnce(const boost::function<void()>& job,
                             const boost::shared_ptr<AsyncExecutor>& executor, std::uint32_t delayMs)
    : job_(job), executor_(executor), delayMs_(delayMs) {}

void QueueOnlyOnce::Queue() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (pending_) return;
    pending_ = true;
  }
  // If the executor drops the run (cancelled) it must not leave the queue
  // pending for ever: the run's last copy clears the mark unless it ran.
  struct PendingRun {
    boost::weak_ptr<QueueOnlyOnce> owner;
    std::atomic<bool> ran{false};
    ~PendingRun() {
      if (ran.load()) return;
      if (auto q = owner.lock()) {
        std::lock_guard<std::mutex> lock(q->mutex_);
        q->pending_ = false;
      }
    }
  };
  auto run = std::make_shared<PendingRun>();
  run->owner = shared_from_this();
  executor_->Submit(
      [run] {
        run->ran.store(true);
        if (auto q = run->owner.lock()) q->Run();
      },
      delayMs_);
}

bool QueueOnlyOnce::IsPending() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return pending_;
}

void QueueOnlyOnce::Run() {
  {
    // Cleared before the job runs, so a Queue during the job schedules the
    // next run instead of being lost.
    std::lock_guard<std::mutex> lock(mutex_);
    pending_ = false;
  }
  job_();
}

std::uint64_t GetCurrentThreadID() {
  static std::atomic<std::uint64_t> next{0};
  thread_local const std::uint64_t id = ++next;
  return id;
}

}  // namespace threads
}  // namespace plinth
