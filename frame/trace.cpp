// Trace sites: the cached enable state and the line format.
#include "frame/trace.h"

#include <sstream>

#include "plinth/debug.h"
#include "plinth/threads.h"

bool RKp_TraceSite::Enabled() {
  const std::uint64_t count = plinth::debug::TraceChangeCount();
  const std::uint64_t tag = (count + 1) << 1;
  const std::uint64_t cached = state.load(std::memory_order_relaxed);
  if ((cached & ~std::uint64_t(1)) == tag) return (cached & 1) != 0;
  // Two threads may re-evaluate at once; both store a consistent pair, and a
  // pair that is already stale makes the next call evaluate again.
  const bool enabled = plinth::debug::TraceEnabled(category, level, true);
  state.store(tag | (enabled ? 1 : 0), std::memory_order_relaxed);
  return enabled;
}

void RKp_WriteTrace(const RKp_TraceSite& site, const std::string& message) {
  std::ostringstream line;
  line << "<" << plinth::threads::GetCurrentThreadID() << "> "
       << "<" << site.category << "> "
       << "<" << site.level << "> " << message << "\r\n";
  line.flush();
  plinth::debug::Trace(line.str());
}
