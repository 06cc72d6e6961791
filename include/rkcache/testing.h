// Test hooks of the module: reach internal trace sites, profiler scopes and
// the background executor from the project's own test suites. Not part of
// the host interface: rkcache.h does not include this header and it is not
// installed.
#pragma once

#include <boost/shared_ptr.hpp>
#include <cstdint>

#include "plinth/threads.h"
#include "rkcache/export.h"

// The module's trace sites, one per category and level it traces at.
enum RK_TEST_TraceSiteId {
  RK_TEST_Trace_Stuff10 = 0,     // "RK_Stuff", level 10
  RK_TEST_Trace_DiskCache5 = 1,  // "DiskCache", level 5
  RK_TEST_Trace_DiskCache6 = 2,  // "DiskCache", level 6
};

// Passes `text` through the given site as a trace of `operation`, exactly as
// the module's own sites do. Throws std::invalid_argument for an unknown site.
RK_EXPORT void RK_TEST_TraceSite(int site, const char* operation, const char* text);

// Opens and closes the profiler scope with the given index (the order of the
// eight scopes: SortDir::AddStuff, Stuff::Checkin, Stuff::Checkout,
// SortDir::FindAndCheckout, Bag::GetCacheSizesInBytes, Stuff::PrepAndRead,
// Stuff::PrepAndWrite, SortDir::RemoveStuff). Throws std::invalid_argument
// for an index outside 0..7.
RK_EXPORT void RK_TEST_ProfileScope(int scope);

// The module's background executor; empty before RK_Birth and after
// RK_StopAllAsyncWork.
RK_EXPORT boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RK_TEST_BackgroundExecutor();

// ---- Write pacing and the disk-speed average ----
// Runs the resume check of paused background writes once, as the resume
// queue's job does.
RK_EXPORT void RK_TEST_CheckResumeBackgroundWrites();
// Offers one disk-speed sample, as a cache-file write or read does.
RK_EXPORT void RK_TEST_OfferDiskSpeedSample(bool isWrite, std::uint32_t bytes, double seconds);
RK_EXPORT double RK_TEST_DiskSpeedAverage();
RK_EXPORT std::int64_t RK_TEST_DiskSpeedSamples();
RK_EXPORT void RK_TEST_SetSpeedAverageCap(double cap);
RK_EXPORT void RK_TEST_SetProclivityMultiplier(double multiplier);
// When background writes were last deprioritised (host milliseconds).
RK_EXPORT std::uint64_t RK_TEST_LastDeprioritizeTime();
