// vx::rk::ReadAheadInfo from many threads: one instance, whole display
// times, and callbacks registered while another thread switches off.
#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"

using vx::rk::ReadAheadInfo;

TEST(ReadAheadMt, ConcurrentFirstGetYieldsOneInstance) {
  constexpr int kThreads = 8;
  std::atomic<bool> go{false};
  std::vector<ReadAheadInfo*> seen(kThreads, nullptr);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      while (!go.load()) std::this_thread::yield();
      seen[t] = ReadAheadInfo::Get().get();
    });
  }
  go = true;
  for (std::thread& t : threads) t.join();
  for (ReadAheadInfo* p : seen) EXPECT_EQ(p, ReadAheadInfo::Get().get());
}

// The display time is copied without a lock; under ThreadSanitizer this
// shows that the copy is race-free, everywhere that no copy is torn.
TEST(ReadAheadMt, DisplayTimeCopiesWhileAnotherThreadSetsIt) {
  boost::shared_ptr<ReadAheadInfo> info = ReadAheadInfo::Get();
  // Two values whose halves differ: a torn copy would mix them.
  const T_Time a{0x1111111122222222LL};
  const T_Time b{0x3333333344444444LL};
  info->SetActualDisplayTime(&a);
  std::atomic<bool> stop{false};
  std::thread writer([&] {
    for (int i = 0; i < 20000; ++i) info->SetActualDisplayTime(i % 2 ? &a : &b);
    stop = true;
  });
  int torn = 0;
  while (!stop.load()) {
    T_Time read{0};
    info->GetActualDisplayTime(&read);
    if (read.value != a.value && read.value != b.value) ++torn;
  }
  writer.join();
  EXPECT_EQ(torn, 0);
}

TEST(ReadAheadMt, RegistrationsWaitWhileCallbacksRun) {
  boost::shared_ptr<ReadAheadInfo> info = ReadAheadInfo::Get();
  constexpr int kOwners = 4;
  constexpr int kRounds = 300;
  char keys[kOwners] = {};
  std::atomic<int> calls{0};
  std::atomic<bool> stop{false};

  std::vector<std::thread> owners;
  for (int t = 0; t < kOwners; ++t) {
    owners.emplace_back([&, t] {
      for (int i = 0; i < kRounds; ++i) {
        info->RegisterCancelOutstandingRequestsCallback(&keys[t], [&calls] { ++calls; });
        info->UnRegisterCancelOutstandingRequestsCallback(&keys[t]);
      }
      info->RegisterCancelOutstandingRequestsCallback(&keys[t], [&calls] { ++calls; });
    });
  }
  std::thread switcher([&] {
    while (!stop.load()) {
      info->SetDoReadAhead(true);
      info->SetDoReadAhead(false);
    }
  });
  for (std::thread& t : owners) t.join();
  stop = true;
  switcher.join();

  // All owners ended registered: one more switch off calls each once.
  calls = 0;
  info->SetDoReadAhead(false);
  EXPECT_EQ(calls.load(), kOwners);
  for (char& key : keys) info->UnRegisterCancelOutstandingRequestsCallback(&key);
}
