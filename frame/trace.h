// Trace sites (internal).
//
// RK_TRACE(category, level, operation, format, ...) writes a trace line when
// the category is enabled at that level. Each site caches the enable state
// and re-asks the platform only when the platform's trace change count
// moved, so a disabled site costs a load, a compare and a branch.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>

#include "host/hk.h"
#include "rkcache/export.h"

struct RK_INTERNAL RKp_TraceSite {
  const char* category;
  int level;
  // The change count the cached answer belongs to and the answer, in one
  // word so that no thread sees a count with another count's answer:
  // (count + 1) << 1 | enabled; 0 until the first evaluation.
  std::atomic<std::uint64_t> state{0};
  bool Enabled();  // refreshes the cache when the change count moved
};

// Builds "<thread> <category> <level> message\r\n" and passes it to the
// platform's Trace.
RK_INTERNAL void RKp_WriteTrace(const RKp_TraceSite& site, const std::string& message);

#define RK_TRACE(category, level, operation, ...)                                                            \
  do {                                                                                                       \
    static RKp_TraceSite rk_trace_site_{(category), (level)};                                                \
    if (rk_trace_site_.Enabled()) RKp_WriteTrace(rk_trace_site_, JOT_convertMesg((operation), __VA_ARGS__)); \
  } while (0)
