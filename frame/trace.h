// Trace sites (internal).
//
// RK_TRACE(category, level, operation, format, ...) writes a trace line when
// the category is enabled at that level. Each site caches the enable state
// and re-asks the platform only when its trace change count moved, so a
// disabled site costs a load, a compare and a branch.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>

struct RKp_TraceSite {
  const char* category;
  int level;
  std::atomic<std::uint64_t> seenCount{~std::uint64_t(0)};
  std::atomic<bool> enabled{false};
  bool Enabled();  // refreshes the cache when the change count moved
};

// Builds "<thread> <category> <level> message\r\n" and passes it to the
// platform's Trace.
void RKp_WriteTrace(const RKp_TraceSite& site, const std::string& message);

#define RK_TRACE(category, level, operation, ...)                                  \
  do {                                                                             \
    static RKp_TraceSite rk_trace_site_{(category), (level)};                      \
    if (rk_trace_site_.Enabled())                                                  \
      RKp_WriteTrace(rk_trace_site_, JOT_convertMesg((operation), __VA_ARGS__));   \
  } while (0)
