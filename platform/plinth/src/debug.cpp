#include "plinth/debug.h"

#include <atomic>
#include <cstdio>
#include <map>
#include <sstream>

namespace plinth {
namespace debug {

namespace {

struct TraceState {
  std::mutex mutex;
  std::map<std::string, int> levels;               // guarded by mutex
  boost::function<void(const std::string&)> sink;  // guarded by mutex; empty: stderr
  std::atomic<std::uint64_t> changeCount{1};
};

TraceState& State() {
  // Never destroyed: tasks on pool threads may trace while the process exits.
  static TraceState* state = new TraceState;
  return *state;
}

}  // namespace

void Trace(const std::string& text) {
  TraceState& s = State();
  boost::function<void(const std::string&)> sink;
  {
    std::lock_guard<std::mutex> lock(s.mutex);
    sink = s.sink;
  }
  // The sink runs without the lock, so it may itself change trace settings.
  if (sink) {
    sink(text);
  } else {
    std::fwrite(text.data(), 1, text.size(), stderr);  // one call: lines do not interleave
  }
}

bool TraceEnabled(const char* category, int level, bool inherit) {
  if (category == nullptr || level < 0) return false;
  TraceState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  auto it = s.levels.find(category);
  if (it == s.levels.end() && inherit) it = s.levels.find("*");
  return it != s.levels.end() && it->second >= level;
}

std::uint64_t TraceChangeCount() {
  return State().changeCount.load(std::memory_order_acquire);
}

void SetTraceLevel(const std::string& category, int level) {
  TraceState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  // A negative level is kept as the category's own "off" setting, so that
  // "*" does not stand in for a category switched off on purpose.
  s.levels[category] = level < 0 ? -1 : level;
  s.changeCount.fetch_add(1, std::memory_order_acq_rel);
}

void SetTraceSink(const boost::function<void(const std::string&)>& sink) {
  TraceState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.sink = sink;
  s.changeCount.fetch_add(1, std::memory_order_acq_rel);
}

// ---------------------------------------------------------------------------

ProfileDataLog::ProfileDataLog(std::string name, int volume) : name_(std::move(name)), volume_(volume) {}

void ProfileDataLog::Record(std::chrono::nanoseconds interval) {
  std::lock_guard<std::mutex> lock(mutex_);
  ++count_;
  total_ += interval;
  if (interval > max_) max_ = interval;
  if (recent_.size() < kKeep) {
    recent_.push_back(interval);
  } else {
    recent_[next_] = interval;
  }
  next_ = (next_ + 1) % kKeep;
}

std::uint64_t ProfileDataLog::Count() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return count_;
}

std::chrono::nanoseconds ProfileDataLog::Total() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return total_;
}

std::chrono::nanoseconds ProfileDataLog::Max() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return max_;
}

std::vector<std::chrono::nanoseconds> ProfileDataLog::Intervals() const {
  std::lock_guard<std::mutex> lock(mutex_);
  if (recent_.size() < kKeep) return recent_;
  // Full ring: the oldest entry is the one written next.
  std::vector<std::chrono::nanoseconds> ordered(recent_.begin() + next_, recent_.end());
  ordered.insert(ordered.end(), recent_.begin(), recent_.begin() + next_);
  return ordered;
}

// ---------------------------------------------------------------------------

std::atomic<bool> CodeProfilerManager::conditionalProfiling_{false};
std::atomic<int> CodeProfilerManager::profilingVolume_{0};

CodeProfilerManager& CodeProfilerManager::Get() {
  // Never destroyed: module-wide logs live until the process ends.
  static CodeProfilerManager* manager = new CodeProfilerManager;
  return *manager;
}

void CodeProfilerManager::SetConditionalProfiling(bool on) {
  conditionalProfiling_.store(on);
}
void CodeProfilerManager::SetProfilingVolume(int volume) {
  profilingVolume_.store(volume);
}

boost::intrusive_ptr<ProfileDataLog> CodeProfilerManager::CreateNewProfileDataLog(const std::string& name,
                                                                                  int volume) {
  boost::intrusive_ptr<ProfileDataLog> log(new ProfileDataLog(name, volume));
  std::lock_guard<std::mutex> lock(mutex_);
  logs_.push_back(log);
  return log;
}

std::vector<boost::intrusive_ptr<ProfileDataLog>> CodeProfilerManager::Logs() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return logs_;
}

std::string CodeProfilerManager::Report() const {
  std::ostringstream out;
  for (const auto& log : Logs()) {
    const std::uint64_t count = log->Count();
    const auto total = log->Total();
    const long long mean =
        count == 0 ? 0 : static_cast<long long>(total.count() / static_cast<long long>(count));
    out << log->Name() << " volume=" << log->Volume() << " count=" << count << " total_ns=" << total.count()
        << " mean_ns=" << mean << " max_ns=" << log->Max().count() << '\n';
  }
  return out.str();
}

void CodeProfiler::Finish() {
  log_->Record(
      std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now() - start_));
}

}  // namespace debug
}  // namespace plinth
