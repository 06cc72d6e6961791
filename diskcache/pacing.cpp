// Write pacing: whether a disk copy pays off, the disk-speed average it
// rests on, and the pause of background writes.
//
// The pause: RK_DeprioritizeBackgroundWrites suspends the background
// executor and records when; the resume queue runs the resume check a second
// later, which resumes the executor only once 3 seconds have passed since
// the last deprioritising and otherwise queues itself again. Both only try
// RK_G_writeControlLock: while a purge holds it, the purge owns suspension.
#include "diskcache/pacing.h"

#include <boost/thread/lock_types.hpp>

#include "frame/globals.h"
#include "host/hk.h"
#include "rkcache/lifecycle.h"
#include "rkcache/stuff.h"
#include "rkcache/testing.h"

std::atomic<double> RK_G_diskSpeedAverage{536870912.0};  // 2^29
std::atomic<std::int64_t> RK_G_diskSpeedSamples{0};
extern const double RK_G_diskSpeedWeight = 0.1;
std::atomic<double> RK_G_proclivityMultiplier{1.0};
std::atomic<double> RK_G_speedAverageCap{2147483648.0};  // 2^31
std::atomic<std::uint64_t> RK_G_lastDeprioritizeTime{0};

namespace {

// How long background writes stay paused after the last deprioritising.
constexpr std::uint64_t kQuietMs = 3000;
// The least a cache-file read is assumed to cost, seconds.
constexpr double kMinReadSeconds = 0.001;

std::uint64_t NowMs() {
  std::uint64_t ms = 0;
  if (const int status = HK_MillisecondsSinceBoot(&ms)) throw status;
  return ms;
}

}  // namespace

bool RK_Stuff::WorthWritingToDiskCache(const boost::posix_time::time_duration& computeTime) {
  const double bytes = static_cast<double>(GetSizeInBytes());
  const double estimate = bytes / RK_G_diskSpeedAverage.load(std::memory_order_relaxed) *
                          RK_G_proclivityMultiplier.load(std::memory_order_relaxed);
  const double threshold = estimate > kMinReadSeconds ? estimate : kMinReadSeconds;
  const double computeSeconds = static_cast<double>(computeTime.total_milliseconds()) / 1000.0;
  return computeSeconds > threshold;
}

void RKp_OfferDiskSpeedSample(bool isWrite, std::uint32_t bytes, double seconds) {
  if (!(seconds > 0.0)) return;
  const double w = RK_G_diskSpeedWeight;
  const std::int64_t n = RK_G_diskSpeedSamples.load(std::memory_order_relaxed);
  // Writes only seed the average; reads, which are what a disk copy costs
  // later, keep moving it.
  if (isWrite && !(static_cast<double>(n) < 2.0 / w)) return;
  const double speed = static_cast<double>(bytes) / seconds;
  if (!(speed < RK_G_speedAverageCap.load(std::memory_order_relaxed))) return;
  const double average = RK_G_diskSpeedAverage.load(std::memory_order_relaxed);
  RK_G_diskSpeedAverage.store((1.0 - w) * average + w * speed, std::memory_order_relaxed);
  RK_G_diskSpeedSamples.store(n + 1, std::memory_order_relaxed);
}

void RK_DeprioritizeBackgroundWrites() {
  boost::unique_lock<boost::recursive_mutex> lock(RK_G_writeControlLock, boost::try_to_lock);
  if (!lock.owns_lock()) return;
  RK_G_lastDeprioritizeTime.store(NowMs());
  if (const auto executor = RKp_BackgroundExecutor()) {
    executor->Suspend();
    if (const auto queue = RKp_ResumeWritesQueue()) queue->Queue();
  }
}

void RKp_CheckResumeBackgroundWrites() {
  boost::unique_lock<boost::recursive_mutex> lock(RK_G_writeControlLock, boost::try_to_lock);
  if (!lock.owns_lock()) return;
  const auto executor = RKp_BackgroundExecutor();
  if (!executor) return;
  const std::uint64_t now = NowMs();
  if (now - RK_G_lastDeprioritizeTime.load() < kQuietMs) {
    if (const auto queue = RKp_ResumeWritesQueue()) queue->Queue();
  } else {
    executor->Resume();
  }
}

// ---- Test hooks ----

void RK_TEST_CheckResumeBackgroundWrites() {
  RKp_CheckResumeBackgroundWrites();
}

void RK_TEST_OfferDiskSpeedSample(bool isWrite, std::uint32_t bytes, double seconds) {
  RKp_OfferDiskSpeedSample(isWrite, bytes, seconds);
}

double RK_TEST_DiskSpeedAverage() {
  return RK_G_diskSpeedAverage.load();
}
std::int64_t RK_TEST_DiskSpeedSamples() {
  return RK_G_diskSpeedSamples.load();
}
void RK_TEST_SetSpeedAverageCap(double cap) {
  RK_G_speedAverageCap.store(cap);
}
void RK_TEST_SetProclivityMultiplier(double multiplier) {
  RK_G_proclivityMultiplier.store(multiplier);
}
std::uint64_t RK_TEST_LastDeprioritizeTime() {
  return RK_G_lastDeprioritizeTime.load();
}
