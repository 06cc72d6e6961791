// Many threads reporting, logging and tracking memory at once: nothing is
// lost, nothing is counted twice, and each thread's quietness stays its own.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "host/hk.h"

namespace ctl = rkhost::control;

namespace {

struct Chunk : HK_MemTrackedObject {
  char payload[48];
};

constexpr int kThreads = 8;
constexpr int kRounds = 1500;

TEST(HostServicesConcurrency, ReportsAndTrackedMemoryFromManyThreads) {
  ctl::ClearCaptured();
  ctl::SetLogLevel(-1);  // keep the captured lines, write none
  std::uint64_t start = 0;
  ASSERT_EQ(0, HK_GetMemoryStat(HK_MemStatItemBytes, &start));

  std::atomic<int> ready{0};
  std::vector<std::vector<Chunk*>> kept(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([t, &ready, &kept] {
      const bool quiet = t % 2 == 1;
      if (quiet) {
        EXPECT_EQ(0, HK_StartQuietErrorsOnCurrentThread(true));
      }
      ++ready;
      while (ready.load() < kThreads) std::this_thread::yield();
      for (int i = 0; i < kRounds; ++i) {
        HKp_ReportErrString(0x3A0000, t, std::to_string(i).c_str());
        // Keep every third chunk; free the rest at once.
        auto* chunk = new Chunk;
        if (i % 3 == 0) {
          kept[t].push_back(chunk);
        } else {
          delete chunk;
        }
        EXPECT_EQ(quiet, HK_AreErrorsQuietOnCurrentThread());
      }
      if (quiet) HK_EndQuietErrorsOnCurrentThread();
    });
  }
  for (std::thread& th : threads) th.join();

  const std::size_t keptPerThread = (kRounds + 2) / 3;
  std::uint64_t value = 0;
  ASSERT_EQ(0, HK_GetMemoryStat(HK_MemStatItemBytes, &value));
  EXPECT_EQ(start + kThreads * keptPerThread * sizeof(Chunk), value);

  const ctl::Captured c = ctl::Snapshot();
  ASSERT_EQ(static_cast<std::size_t>(kThreads * kRounds), c.errorReports.size());
  // Per thread: every report present once, in order, with the thread's quietness.
  std::vector<int> next(kThreads, 0);
  for (const ctl::ErrorReport& r : c.errorReports) {
    ASSERT_GE(r.number, 0);
    ASSERT_LT(r.number, kThreads);
    EXPECT_EQ(std::to_string(next[r.number]), r.detail);
    EXPECT_EQ(r.number % 2 == 1, r.suppressed);
    ++next[r.number];
  }
  for (int t = 0; t < kThreads; ++t) EXPECT_EQ(kRounds, next[t]);

  for (const auto& chunks : kept)
    for (Chunk* chunk : chunks) delete chunk;
  ASSERT_EQ(0, HK_GetMemoryStat(HK_MemStatItemBytes, &value));
  EXPECT_EQ(start, value);
  ctl::SetLogLevel(10);
}

TEST(HostServicesConcurrency, ControlsChangeWhileServicesAreUsed) {
  ctl::ClearCaptured();
  ctl::ClearPreferences();
  ctl::SetLogLevel(10);
  char systemName[64];
  ASSERT_EQ(0, HK_GetComputerName(sizeof systemName, systemName));

  std::atomic<bool> stop{false};
  std::thread changer([&] {
    for (int i = 0; i < 300; ++i) {
      ctl::SetComputerName(std::string("host-") + std::to_string(i));
      ctl::SetPreference("S", "K", std::to_string(i));
      ctl::SetLogSink([](const std::string&) {});
      ctl::MakeCurrentThreadMain();
    }
    stop = true;
  });
  std::atomic<int> badReads{0};
  std::atomic<int> logged{0};
  std::vector<std::thread> users;
  for (int t = 0; t < 4; ++t) {
    users.emplace_back([&] {
      char name[64];
      do {
        // A reader sees the system's name or one whole override, never a mix.
        if (HK_GetComputerName(sizeof name, name) != 0 ||
            (std::string(name) != systemName && std::string(name).rfind("host-", 0) != 0))
          ++badReads;
        std::int32_t v = -2;
        if (ST_GetTextPrefLong(ST_GetPrefHandle(0), "S", "K", -1, &v) != 0 || v < -1 || v >= 300) ++badReads;
        JOT_Log(10, "RK", "T", "line");
        ++logged;
        EXPECT_FALSE(HK_IsOnMainThread());
      } while (!stop.load());
    });
  }
  changer.join();
  for (std::thread& th : users) th.join();

  EXPECT_EQ(0, badReads.load());
  EXPECT_EQ(static_cast<std::size_t>(logged.load()), ctl::Snapshot().logLines.size());
  ctl::SetLogSink({});
  ctl::SetComputerName(std::nullopt);
  ctl::ClearPreferences();
}

}  // namespace
