// Profiler scopes: names, volumes and their once-created logs.
#include "frame/profile.h"

#include <boost/thread/once.hpp>

namespace {

struct ScopeDef {
  const char* name;
  int volume;
};

// Indexed by RKp_ProfileScopeId.
constexpr ScopeDef kScopes[RKp_Profile_Count] = {
    {"VX.render.RK_SortDir::AddStuff", 6},   {"VX.render.RK_Stuff::Checkin", 6},
    {"VX.render.RK_Stuff::Checkout", 6},     {"VX.render.RK_SortDir::FindAndCheckout", 7},
    {"VX.RK_Bag::GetCacheSizesInBytes", 9},  {"VX.render.RK_Stuff::PrepAndRead", 6},
    {"VX.render.RK_Stuff::PrepAndWrite", 6}, {"VX.render.RK_SortDir::RemoveStuff", 6},
};

// A log is written once, inside its call_once, and only read afterwards; it
// lives until the process ends.
struct ScopeLog {
  boost::once_flag once = BOOST_ONCE_INIT;
  boost::intrusive_ptr<plinth::debug::ProfileDataLog> log;
};
ScopeLog S_logs[RKp_Profile_Count];

void CreateLog(RKp_ProfileScopeId id) {
  S_logs[id].log =
      plinth::debug::CodeProfilerManager::Get().CreateNewProfileDataLog(kScopes[id].name, kScopes[id].volume);
}

}  // namespace

boost::intrusive_ptr<plinth::debug::ProfileDataLog> RKp_ProfileLogFor(RKp_ProfileScopeId id) {
  plinth::debug::CodeProfilerManager& manager = plinth::debug::CodeProfilerManager::Get();
  if (!manager.IsConditionalProfiling() || manager.GetProfilingVolume() < kScopes[id].volume) return {};
  boost::call_once(S_logs[id].once, [id] { CreateLog(id); });
  return S_logs[id].log;
}
