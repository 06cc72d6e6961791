// Profiler scopes: a scope records only when conditional profiling is on at
// or above its volume, and its log is created once.
#include <gtest/gtest.h>

#include <map>
#include <stdexcept>
#include <string>

#include "plinth/debug.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"

namespace {

struct Scope {
  const char* name;
  int volume;
};
// In the order of RK_TEST_ProfileScope's indices.
const Scope kScopes[8] = {
    {"VX.render.RK_SortDir::AddStuff", 6},   {"VX.render.RK_Stuff::Checkin", 6},
    {"VX.render.RK_Stuff::Checkout", 6},     {"VX.render.RK_SortDir::FindAndCheckout", 7},
    {"VX.RK_Bag::GetCacheSizesInBytes", 9},  {"VX.render.RK_Stuff::PrepAndRead", 6},
    {"VX.render.RK_Stuff::PrepAndWrite", 6}, {"VX.render.RK_SortDir::RemoveStuff", 6},
};

struct LogInfo {
  int logs = 0;             // how many logs carry the name
  std::uint64_t count = 0;  // intervals recorded in them
  int volume = -1;
};

std::map<std::string, LogInfo> LogsByName() {
  std::map<std::string, LogInfo> out;
  for (const auto& log : plinth::debug::CodeProfilerManager::Get().Logs()) {
    LogInfo& info = out[log->Name()];
    ++info.logs;
    info.count += log->Count();
    info.volume = log->Volume();
  }
  return out;
}

void OpenEveryScope() {
  for (int i = 0; i < 8; ++i) RK_TEST_ProfileScope(i);
}

}  // namespace

TEST(FrameProfile, ScopesRecordAtOrAboveTheirVolumeIntoOneLogEach) {
  plinth::debug::CodeProfilerManager& manager = plinth::debug::CodeProfilerManager::Get();
  // Off, or on but below every scope's volume: no log is made.
  manager.SetConditionalProfiling(false);
  manager.SetProfilingVolume(9);
  OpenEveryScope();
  manager.SetConditionalProfiling(true);
  manager.SetProfilingVolume(5);
  OpenEveryScope();
  EXPECT_TRUE(LogsByName().empty());

  // Each scope at or below the volume has one log of its own volume with
  // `count(scope)` intervals; the others have none.
  const auto check = [](int volume, auto count) {
    auto logs = LogsByName();
    for (const Scope& scope : kScopes) {
      SCOPED_TRACE(scope.name);
      ASSERT_EQ(logs.count(scope.name), scope.volume <= volume ? 1u : 0u);
      if (scope.volume > volume) continue;
      EXPECT_EQ(logs[scope.name].logs, 1);
      EXPECT_EQ(logs[scope.name].count, count(scope));
      EXPECT_EQ(logs[scope.name].volume, scope.volume);
    }
  };
  manager.SetProfilingVolume(6);
  OpenEveryScope();
  check(6, [](const Scope&) { return 1u; });
  // At 9 all eight record; the logs made at 6 are reused, not made again.
  manager.SetProfilingVolume(9);
  OpenEveryScope();
  OpenEveryScope();
  check(9, [](const Scope& scope) { return scope.volume <= 6 ? 3u : 2u; });

  // Switched off again: the logs stay but record nothing more.
  manager.SetConditionalProfiling(false);
  OpenEveryScope();
  auto logs = LogsByName();
  EXPECT_EQ(logs["VX.RK_Bag::GetCacheSizesInBytes"].count, 2u);
  EXPECT_EQ(logs["VX.render.RK_Stuff::Checkout"].count, 3u);

  EXPECT_THROW(RK_TEST_ProfileScope(8), std::invalid_argument);
  EXPECT_THROW(RK_TEST_ProfileScope(-1), std::invalid_argument);
}
