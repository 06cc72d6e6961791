// The memory side of the cache: entering items, freeing memory, size totals,
// at cache sizes of ten thousand and a million items.
//
// Items report memory through the host's statistic 6 as a real host's items
// do, so reclamation is measured the way it runs.
#include <benchmark/benchmark.h>

#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <cstdint>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"

namespace {

constexpr std::uint32_t kItemBytes = 100;

class BenchStuff : public RK_Stuff {
 public:
  explicit BenchStuff(bool onDisk) : onDisk_(onDisk) { SetInMemory(true); }

  void SetInMemory(bool in) {
    if (in == inMemory_) return;
    inMemory_ = in;
    HK_TrackBytes(in ? kItemBytes : -static_cast<std::int64_t>(kItemBytes));
  }

  std::uint32_t GetSizeInBytes() override { return kItemBytes; }
  bool FreeMemory() override {
    if (!inMemory_) return false;
    SetInMemory(false);
    return true;
  }
  bool IsInMemory() override { return inMemory_; }
  bool IsOnDisk() const override { return onDisk_; }

 protected:
  ~BenchStuff() override { SetInMemory(false); }

 private:
  bool inMemory_ = false;
  bool onDisk_;
};

using BenchPtr = boost::intrusive_ptr<BenchStuff>;

std::vector<BenchPtr> MakeItems(std::size_t n, bool onDisk) {
  std::vector<BenchPtr> items;
  items.reserve(n);
  for (std::size_t i = 0; i < n; ++i) items.emplace_back(new BenchStuff(onDisk));
  return items;
}

void Enter(const std::vector<BenchPtr>& items) {
  const auto bag = RK_GlobalBag();
  for (const BenchPtr& item : items) item->AddToBagAndSortDir(bag, {});
}

// Fills the global cache with n items; the cache holds the only references.
void Fill(std::size_t n, bool onDisk) {
  Enter(MakeItems(n, onDisk));
}

void Empty() {
  RK_GlobalBag()->ClearBagAndSortDir();
  rkhost::control::ClearCaptured();
}

// Entering a batch of new items into a cache of range(0) items; the batch
// leaves again (untimed) so the size stays put.
void BM_AddToBagAndSortDir(benchmark::State& state) {
  const auto cacheSize = static_cast<std::size_t>(state.range(0));
  constexpr std::size_t kBatch = 1000;
  Fill(cacheSize, false);
  for (auto _ : state) {
    state.PauseTiming();
    std::vector<BenchPtr> batch = MakeItems(kBatch, false);
    state.ResumeTiming();
    Enter(batch);
    state.PauseTiming();
    for (const BenchPtr& item : batch) item->RemoveFromBagAndSortDir();
    batch.clear();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kBatch));
  Empty();
}
BENCHMARK(BM_AddToBagAndSortDir)->Arg(10000)->Iterations(200)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_AddToBagAndSortDir)->Arg(1000000)->Iterations(50)->Unit(benchmark::kMicrosecond);

// How many items' worth each FreeUpSomeMemory call is asked to free.
constexpr std::size_t kFreed = 1000;

// Times FreeUpSomeMemory on the global bag, asked for kFreed items' worth;
// `refill` puts back (untimed) what a call freed.
template <class Refill>
void TimeFreeing(benchmark::State& state, Refill refill) {
  const auto bag = RK_GlobalBag();
  for (auto _ : state) {
    const auto result = bag->FreeUpSomeMemory(kFreed * kItemBytes - 1);
    benchmark::DoNotOptimize(result);
    state.PauseTiming();
    if (result != RK_Bag::FreeUpResult_FreedEnough) state.SkipWithError("did not free enough");
    refill();
    rkhost::control::ClearCaptured();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * kFreed));
}

// Freeing a thousand items' worth out of range(0) items that live in memory
// only: pass 1 (disk-backed memory) finds nothing and walks the whole bag,
// pass 2 drops the oldest thousand. The thousand are replaced (untimed).
void BM_FreeUpSomeMemory_MemoryOnly(benchmark::State& state) {
  Fill(static_cast<std::size_t>(state.range(0)), false);
  TimeFreeing(state, [] { Fill(kFreed, false); });
  Empty();
}
BENCHMARK(BM_FreeUpSomeMemory_MemoryOnly)->Arg(10000)->Iterations(200)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_FreeUpSomeMemory_MemoryOnly)->Arg(1000000)->Iterations(8)->Unit(benchmark::kMicrosecond);

// The same when every item is also on disk: pass 1 frees the oldest
// thousand and stops. Their memory comes back (untimed) for the next round.
void BM_FreeUpSomeMemory_DiskBacked(benchmark::State& state) {
  std::vector<BenchPtr> items = MakeItems(static_cast<std::size_t>(state.range(0)), true);
  Enter(items);
  TimeFreeing(state, [&items] {
    for (std::size_t i = 0; i < kFreed; ++i) items[i]->SetInMemory(true);
  });
  items.clear();
  Empty();
}
BENCHMARK(BM_FreeUpSomeMemory_DiskBacked)->Arg(10000)->Iterations(200)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_FreeUpSomeMemory_DiskBacked)->Arg(1000000)->Iterations(200)->Unit(benchmark::kMicrosecond);

void BM_GetCacheSizesInBytes(benchmark::State& state) {
  const auto cacheSize = static_cast<std::size_t>(state.range(0));
  Fill(cacheSize, false);
  const auto bag = RK_GlobalBag();
  for (auto _ : state) {
    std::uint64_t memory = 0, disk = 0;
    bag->GetCacheSizesInBytes(memory, disk);
    benchmark::DoNotOptimize(memory);
    benchmark::DoNotOptimize(disk);
  }
  state.SetItemsProcessed(static_cast<std::int64_t>(state.iterations() * cacheSize));
  Empty();
}
BENCHMARK(BM_GetCacheSizesInBytes)->Arg(10000)->Iterations(500)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_GetCacheSizesInBytes)->Arg(1000000)->Iterations(5)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
  // The reclamation log line would otherwise go to stderr once per call.
  rkhost::control::SetLogSink([](const std::string&) {});
  rkhost::control::SetMemoryStat(std::uint64_t(1) << 40);
  RK_Birth(false);
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  RK_StopAllAsyncWork();
  RK_Death();
  return 0;
}
