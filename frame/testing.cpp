// The test hooks of include/rkcache/testing.h. They run the same trace and
// profiler code the module's own call sites run.
#include "rkcache/testing.h"

#include <stdexcept>

#include "frame/globals.h"
#include "frame/profile.h"
#include "frame/trace.h"

void RK_TEST_TraceSite(int site, const char* operation, const char* text) {
  switch (site) {
    case RK_TEST_Trace_Stuff10:
      RK_TRACE("RK_Stuff", 10, operation, "%s", text);
      return;
    case RK_TEST_Trace_DiskCache5:
      RK_TRACE("DiskCache", 5, operation, "%s", text);
      return;
    case RK_TEST_Trace_DiskCache6:
      RK_TRACE("DiskCache", 6, operation, "%s", text);
      return;
    default:
      throw std::invalid_argument("RK_TEST_TraceSite: unknown site");
  }
}

void RK_TEST_ProfileScope(int scope) {
  if (scope < 0 || scope >= RKp_Profile_Count)
    throw std::invalid_argument("RK_TEST_ProfileScope: unknown scope");
  RK_PROFILE_SCOPE(static_cast<RKp_ProfileScopeId>(scope));
}

boost::shared_ptr<plinth::threads::AsyncThreadedExecutor> RK_TEST_BackgroundExecutor() {
  return RKp_BackgroundExecutor();
}
