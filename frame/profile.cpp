// Profiler scopes: names, volumes and their once-created logs.
#include "frame/profile.h"

#include <atomic>
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

// A log is created once, inside its call_once, and lives until the process
// ends. boost::call_once marks its flag done inside libboost_thread, which a
// ThreadSanitizer build does not instrument, so the log is also published
// through `log` (release here, acquire in RKp_ProfileLogForVolume): that pair is
// the ordering every build can see.
struct ScopeLog {
  boost::once_flag once = BOOST_ONCE_INIT;
  boost::intrusive_ptr<plinth::debug::ProfileDataLog> owner;
  std::atomic<plinth::debug::ProfileDataLog*> log{nullptr};
};
ScopeLog S_logs[RKp_Profile_Count];

void CreateLog(RKp_ProfileScopeId id) {
  S_logs[id].owner =
      plinth::debug::CodeProfilerManager::Get().CreateNewProfileDataLog(kScopes[id].name, kScopes[id].volume);
  S_logs[id].log.store(S_logs[id].owner.get(), std::memory_order_release);
}

}  // namespace

boost::intrusive_ptr<plinth::debug::ProfileDataLog> RKp_ProfileLogForVolume(RKp_ProfileScopeId id) {
  if (plinth::debug::CodeProfilerManager::GetProfilingVolume() < kScopes[id].volume) return {};
  boost::call_once(S_logs[id].once, [id] { CreateLog(id); });
  return boost::intrusive_ptr<plinth::debug::ProfileDataLog>(S_logs[id].log.load(std::memory_order_acquire));
}
