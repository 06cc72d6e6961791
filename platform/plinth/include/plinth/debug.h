// Traces and the code profiler.
//
// Traces: a trace line is written only when its category is enabled at the
// requested level; the enable settings carry a change count so that callers
// can cache the answer and re-ask only when the count moved.
// Profiler: when conditional profiling is on, profile data logs record the
// intervals that CodeProfiler objects measure.
// Thread safety: everything here may be called from any thread.
#pragma once

#include <atomic>
#include <boost/function.hpp>
#include <boost/intrusive_ptr.hpp>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "plinth/export.h"
#include "plinth/refcounted.h"

namespace plinth {
namespace debug {

// Writes text to the trace sink (stderr unless the host set one).
PLINTH_API void Trace(const std::string& text);
// True when category is enabled at level or above (a category enabled at
// level L accepts trace levels 0..L). `inherit` lets the category "*" stand
// for every category without its own setting.
PLINTH_API bool TraceEnabled(const char* category, int level, bool inherit);
// Moves whenever any trace setting changes.
PLINTH_API std::uint64_t TraceChangeCount();

// Control: enable a category up to a level (a negative level disables it),
// and route trace text to a sink (an empty function restores stderr).
PLINTH_API void SetTraceLevel(const std::string& category, int level);
PLINTH_API void SetTraceSink(const boost::function<void(const std::string&)>& sink);

// One named log of measured intervals.
class PLINTH_API ProfileDataLog : public utility::RefCountedObject {
 public:
  ProfileDataLog(std::string name, int volume);
  const std::string& Name() const { return name_; }
  int Volume() const { return volume_; }
  void Record(std::chrono::nanoseconds interval);
  std::uint64_t Count() const;
  std::chrono::nanoseconds Total() const;
  std::chrono::nanoseconds Max() const;
  std::vector<std::chrono::nanoseconds> Intervals() const;  // the most recent ones, at most kKeep

  static constexpr std::size_t kKeep = 1024;

 private:
  std::string name_;
  int volume_;
  mutable std::mutex mutex_;
  std::uint64_t count_ = 0;                       // guarded by mutex_
  std::chrono::nanoseconds total_{0};             // guarded by mutex_
  std::chrono::nanoseconds max_{0};               // guarded by mutex_
  std::vector<std::chrono::nanoseconds> recent_;  // guarded by mutex_ (ring of kKeep)
  std::size_t next_ = 0;                          // guarded by mutex_
};

class PLINTH_API CodeProfilerManager {
 public:
  static CodeProfilerManager& Get();

  // Inline: profiled code asks on every call, almost always to hear "off".
  static bool IsConditionalProfiling() { return conditionalProfiling_.load(std::memory_order_relaxed); }
  static int GetProfilingVolume() { return profilingVolume_.load(std::memory_order_relaxed); }
  void SetConditionalProfiling(bool on);
  void SetProfilingVolume(int volume);

  // A new log, kept by the manager for reporting.
  boost::intrusive_ptr<ProfileDataLog> CreateNewProfileDataLog(const std::string& name, int volume);
  std::vector<boost::intrusive_ptr<ProfileDataLog>> Logs() const;
  // One line per log: name, volume, count, total, mean and max.
  std::string Report() const;

 private:
  CodeProfilerManager() = default;
  static std::atomic<bool> conditionalProfiling_;
  static std::atomic<int> profilingVolume_;
  mutable std::mutex mutex_;
  std::vector<boost::intrusive_ptr<ProfileDataLog>> logs_;  // guarded by mutex_
};

// Measures the interval from construction to destruction into its log; with
// an empty log it does nothing (and reads no clock).
class PLINTH_API CodeProfiler {
 public:
  explicit CodeProfiler(boost::intrusive_ptr<ProfileDataLog> log) : log_(std::move(log)) {
    if (log_) start_ = std::chrono::steady_clock::now();
  }
  ~CodeProfiler() {
    if (log_) Finish();
  }
  CodeProfiler(const CodeProfiler&) = delete;
  CodeProfiler& operator=(const CodeProfiler&) = delete;

 private:
  void Finish();

  boost::intrusive_ptr<ProfileDataLog> log_;
  std::chrono::steady_clock::time_point start_;
};

}  // namespace debug
}  // namespace plinth
