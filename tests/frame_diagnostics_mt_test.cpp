// Trace sites and profiler scopes used from many threads at once: one log
// per scope, no lost intervals, and trace caches that settle on the last
// setting.
#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "plinth/debug.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"

TEST(FrameDiagnosticsMt, ConcurrentFirstUseCreatesOneLogPerScope) {
  plinth::debug::CodeProfilerManager& manager = plinth::debug::CodeProfilerManager::Get();
  manager.SetConditionalProfiling(true);
  manager.SetProfilingVolume(9);
  constexpr int kThreads = 4;
  constexpr int kRounds = 200;
  std::atomic<bool> go{false};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&] {
      while (!go.load()) std::this_thread::yield();
      for (int r = 0; r < kRounds; ++r)
        for (int s = 0; s < 8; ++s) RK_TEST_ProfileScope(s);
    });
  }
  go = true;
  for (std::thread& t : threads) t.join();

  std::map<std::string, std::pair<int, std::uint64_t>> byName;  // logs, intervals
  for (const auto& log : manager.Logs()) {
    auto& entry = byName[log->Name()];
    ++entry.first;
    entry.second += log->Count();
  }
  ASSERT_EQ(byName.size(), 8u);
  for (const auto& [name, entry] : byName) {
    EXPECT_EQ(entry.first, 1) << name;
    EXPECT_EQ(entry.second, std::uint64_t(kThreads) * kRounds) << name;
  }
}

TEST(FrameDiagnosticsMt, TraceCachesSettleOnTheLastSetting) {
  std::mutex mutex;
  std::vector<std::string> lines;
  plinth::debug::SetTraceSink([&](const std::string& text) {
    std::lock_guard<std::mutex> lock(mutex);
    lines.push_back(text);
  });

  std::atomic<bool> stop{false};
  std::vector<std::thread> threads;
  for (int t = 0; t < 3; ++t) {
    threads.emplace_back([&] {
      while (!stop.load()) RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "busy");
    });
  }
  for (int i = 0; i < 200; ++i) plinth::debug::SetTraceLevel("DiskCache", i % 2 ? 5 : -1);
  plinth::debug::SetTraceLevel("DiskCache", -1);
  stop = true;
  for (std::thread& t : threads) t.join();

  {
    std::lock_guard<std::mutex> lock(mutex);
    for (const std::string& line : lines) ASSERT_NE(line.find("> <DiskCache> <5> "), std::string::npos);
    lines.clear();
  }
  // Off at the end: however the threads raced, no site stays on.
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "after");
  std::thread([] { RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "after"); }).join();
  {
    std::lock_guard<std::mutex> lock(mutex);
    EXPECT_TRUE(lines.empty());
  }
  // On again: every thread sees it.
  plinth::debug::SetTraceLevel("DiskCache", 5);
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "after");
  std::thread([] { RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "after"); }).join();
  {
    std::lock_guard<std::mutex> lock(mutex);
    EXPECT_EQ(lines.size(), 2u);
  }
  plinth::debug::SetTraceSink({});
}
