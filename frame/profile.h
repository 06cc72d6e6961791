// Profiler scopes (internal). Eight operations open one for their whole
// duration; the scope records only when conditional profiling is on at or
// above its volume, and its log is created once, on first use.
#pragma once

#include "plinth/debug.h"
#include "rkcache/export.h"

enum RKp_ProfileScopeId {
  RKp_Profile_SortDirAddStuff,         // "VX.render.RK_SortDir::AddStuff", 6
  RKp_Profile_StuffCheckin,            // "VX.render.RK_Stuff::Checkin", 6
  RKp_Profile_StuffCheckout,           // "VX.render.RK_Stuff::Checkout", 6
  RKp_Profile_SortDirFindAndCheckout,  // "VX.render.RK_SortDir::FindAndCheckout", 7
  RKp_Profile_BagGetCacheSizes,        // "VX.RK_Bag::GetCacheSizesInBytes", 9
  RKp_Profile_StuffPrepAndRead,        // "VX.render.RK_Stuff::PrepAndRead", 6
  RKp_Profile_StuffPrepAndWrite,       // "VX.render.RK_Stuff::PrepAndWrite", 6
  RKp_Profile_SortDirRemoveStuff,      // "VX.render.RK_SortDir::RemoveStuff", 6
  RKp_Profile_Count
};

// The log for a scope if profiling is on at its volume (created once).
RK_INTERNAL boost::intrusive_ptr<plinth::debug::ProfileDataLog> RKp_ProfileLogForVolume(
    RKp_ProfileScopeId id);

// The same, or an empty pointer: the common "profiling is off" answer is
// given inline, as scopes open on the hit path.
inline boost::intrusive_ptr<plinth::debug::ProfileDataLog> RKp_ProfileLogFor(RKp_ProfileScopeId id) {
  if (!plinth::debug::CodeProfilerManager::IsConditionalProfiling()) return {};
  return RKp_ProfileLogForVolume(id);
}

#define RK_PROFILE_SCOPE(id) plinth::debug::CodeProfiler rk_profile_scope_(RKp_ProfileLogFor(id))
