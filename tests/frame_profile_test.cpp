// Profiler scopes: a scope records only when conditional profiling is on at
// or above its volume, and its log is created once.
#include <gtest/gtest.h>

#include <map>
#include <stdexcept>
#include <string>

#include "plinth/debug.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"
#include "support/test_stuff.h"

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

  // At 6 the volume-6 scopes record once; at 9 all record, into the same logs.
  manager.SetProfilingVolume(6);
  OpenEveryScope();
  EXPECT_EQ(LogsByName().size(), 6u);
  manager.SetProfilingVolume(9);
  OpenEveryScope();
  auto logs = LogsByName();
  ASSERT_EQ(logs.size(), 8u);
  for (const Scope& scope : kScopes) {
    SCOPED_TRACE(scope.name);
    EXPECT_EQ(logs[scope.name].logs, 1);
    EXPECT_EQ(logs[scope.name].count, scope.volume <= 6 ? 2u : 1u);
    EXPECT_EQ(logs[scope.name].volume, scope.volume);
  }

  // Switched off again: the logs stay but record nothing more.
  manager.SetConditionalProfiling(false);
  OpenEveryScope();
  EXPECT_EQ(LogsByName()["VX.render.RK_Stuff::Checkout"].count, 2u);
  EXPECT_THROW(RK_TEST_ProfileScope(8), std::invalid_argument);
}

TEST(FrameProfile, TheHitPathRecordsIntoItsScopes) {
  RK_Birth(false);
  plinth::debug::CodeProfilerManager& manager = plinth::debug::CodeProfilerManager::Get();
  manager.SetConditionalProfiling(true);
  manager.SetProfilingVolume(7);
  auto item = rktest::TestStuff::Make();
  item->AddToBagAndSortDir(RK_GlobalBag(), {});
  {
    RK_ScCheckout receipt;
    ASSERT_EQ(receipt.FindAndCheckout(item.get(), RK_Checkout_ReadOnly), RK_CheckoutResult_CheckedOut);
  }
  manager.SetConditionalProfiling(false);
  auto logs = LogsByName();
  for (const char* name : {"VX.render.RK_SortDir::AddStuff", "VX.render.RK_SortDir::FindAndCheckout",
                           "VX.render.RK_Stuff::Checkout", "VX.render.RK_Stuff::Checkin"})
    EXPECT_EQ(logs[name].count, 1u) << name;
  item.reset();
  RK_StopAllAsyncWork();
  RK_Death();
}
