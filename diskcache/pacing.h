// Write pacing and the disk-speed average (internal).
//
// The speed values are read by the write-worthiness test and updated by
// writers and readers on any thread without a lock; they are relaxed
// atomics, so a lost update between two simultaneous samples is tolerated.
#pragma once

#include <atomic>
#include <cstdint>

// Running average of the disk speed seen in cache-file writes and reads, bytes/s.
extern std::atomic<double> RK_G_diskSpeedAverage;
// Number of samples taken into the average.
extern std::atomic<std::int64_t> RK_G_diskSpeedSamples;
// Weight of a new sample in the average (never changed).
extern const double RK_G_diskSpeedWeight;
// Scales the estimated read-back time in the write-worthiness test.
extern std::atomic<double> RK_G_proclivityMultiplier;
// Samples at or above this speed are not taken into the average, bytes/s.
extern std::atomic<double> RK_G_speedAverageCap;
// When background writes were last deprioritised (host milliseconds).
extern std::atomic<std::uint64_t> RK_G_lastDeprioritizeTime;

// Offers one speed sample: `bytes` moved in `seconds` (millisecond
// resolution). Write samples only seed the average (the first 20); read
// samples always count; a sample of 0 seconds is ignored.
void RKp_OfferDiskSpeedSample(bool isWrite, std::uint32_t bytes, double seconds);

// The job of the resume queue: resumes background writes once 3 seconds
// have passed since the last RK_DeprioritizeBackgroundWrites, else checks
// again a second later.
void RKp_CheckResumeBackgroundWrites();
