// The cache hit path (find, check out, check in) against the simplest
// correct alternative: a hash map from GUID to node plus a recency list
// under one std::mutex, doing lookup, pin and unpin.
//
// Both hold the same number of items (10 thousand, then 1 million; the
// larger set is built once, by growing the smaller one) and are probed with
// the same random sequence of keys. Run on one and on two threads.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/functional/hash.hpp>
#include <cstdint>
#include <list>
#include <mutex>
#include <random>
#include <unordered_map>
#include <vector>

#include "rkcache/rkcache.h"

namespace {

using boost::posix_time::time_duration;
using plinth::utility::Guid;

// An item that is always in memory; the cache's own bookkeeping is what is measured.
class BenchStuff : public RK_Stuff {
 public:
  std::uint32_t GetSizeInBytes() override { return 1000; }
  bool FreeMemory() override { return false; }
  bool IsInMemory() override { return true; }

 protected:
  ~BenchStuff() override = default;
};

Guid KeyOf(std::size_t i) {
  return Guid(0x9e3779b97f4a7c15ULL * (i + 1), i + 1);
}

// ---- The baseline -----------------------------------------------------------
struct GuidHash {
  std::size_t operator()(const Guid& g) const {
    std::size_t seed = 0;
    boost::hash_combine(seed, g.High());
    boost::hash_combine(seed, g.Low());
    return seed;
  }
};

class Baseline {
 public:
  struct Node {
    Guid key;
    int pins = 0;
    std::list<Node*>::iterator position;
  };

  void Add(const Guid& key) {
    std::lock_guard<std::mutex> lock(mutex_);
    Node* node = new Node;
    node->key = key;
    recency_.push_front(node);
    node->position = recency_.begin();
    map_.emplace(key, node);
  }
  // Lookup and pin: the node becomes the most recently used.
  Node* Pin(const Guid& key) {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = map_.find(key);
    if (it == map_.end()) return nullptr;
    Node* node = it->second;
    ++node->pins;
    recency_.splice(recency_.begin(), recency_, node->position);
    return node;
  }
  void Unpin(Node* node) {
    std::lock_guard<std::mutex> lock(mutex_);
    --node->pins;
  }
  std::size_t Size() {
    std::lock_guard<std::mutex> lock(mutex_);
    return map_.size();
  }

 private:
  std::mutex mutex_;
  std::unordered_map<Guid, Node*, GuidHash> map_;
  std::list<Node*> recency_;
};

// ---- Shared set-up ------------------------------------------------------------
struct World {
  World() {
    RK_Birth(false);
    bag = RK_GlobalBag();
  }
  // Grows both caches to n items; bounded work, done once per size. Each
  // cache is grown in a loop of its own, so that neither's memory is
  // interleaved with the other's.
  void EnsureItems(std::size_t n) {
    std::lock_guard<std::mutex> lock(mutex);
    for (std::size_t i = count; i < n; ++i) {
      boost::intrusive_ptr<RK_Stuff> item(new BenchStuff);
      item->SetGuid(KeyOf(i));
      item->AddToBagAndSortDir(bag, time_duration());
    }
    for (std::size_t i = count; i < n; ++i) baseline.Add(KeyOf(i));
    count = std::max(count, n);
  }
  std::mutex mutex;
  std::size_t count = 0;
  boost::shared_ptr<RK_Bag> bag;
  Baseline baseline;
};

World& TheWorld() {
  static World* world = new World;  // lives until the process ends
  return *world;
}

constexpr std::size_t kProbes = 1 << 16;

// A random probe sequence over the first n keys, per thread.
std::vector<Guid> Probes(std::size_t n, int thread) {
  std::mt19937_64 rng(1234 + thread);
  std::uniform_int_distribution<std::size_t> pick(0, n - 1);
  std::vector<Guid> out(kProbes);
  for (Guid& g : out) g = KeyOf(pick(rng));
  return out;
}

// The same probes as request objects, built before timing starts: a host
// describes what it wants once and then asks the cache, as the baseline is
// handed its key.
std::vector<boost::intrusive_ptr<RK_Stuff>> Requests(std::size_t n, int thread) {
  std::vector<boost::intrusive_ptr<RK_Stuff>> out;
  out.reserve(kProbes);
  for (const Guid& g : Probes(n, thread)) {
    out.emplace_back(new BenchStuff);
    out.back()->SetGuid(g);
  }
  return out;
}

// ---- Benchmarks -----------------------------------------------------------------
// The host's hit path: a receipt looks the request up, checks it out
// read-only, and checks it in.
void BM_HitPath(benchmark::State& state) {
  const auto n = static_cast<std::size_t>(state.range(0));
  TheWorld().EnsureItems(n);
  const auto requests = Requests(n, state.thread_index());
  std::size_t i = 0;
  for (auto _ : state) {
    RK_ScCheckout receipt;
    if (!receipt.FindAndCheckout(requests[i++ % kProbes].get(), RK_Checkout_ReadOnly))
      state.SkipWithError("miss");
    receipt.Checkin(0, time_duration());
  }
  state.SetItemsProcessed(state.iterations());
}

// The same without a receipt: the sort directory and the item directly.
void BM_HitPathDirect(benchmark::State& state) {
  const auto n = static_cast<std::size_t>(state.range(0));
  TheWorld().EnsureItems(n);
  const boost::shared_ptr<RK_SortDir> dir = RK_GlobalSortDir();
  const auto requests = Requests(n, state.thread_index());
  std::size_t i = 0;
  for (auto _ : state) {
    RK_Stuff* found = nullptr;
    if (!dir->FindAndCheckout(requests[i++ % kProbes].get(), RK_Checkout_ReadOnly, &found, nullptr))
      state.SkipWithError("miss");
    found->Checkin(0, time_duration());
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_Baseline(benchmark::State& state) {
  const auto n = static_cast<std::size_t>(state.range(0));
  TheWorld().EnsureItems(n);
  Baseline& baseline = TheWorld().baseline;
  const std::vector<Guid> probes = Probes(n, state.thread_index());
  std::size_t i = 0;
  for (auto _ : state) {
    Baseline::Node* node = baseline.Pin(probes[i++ % kProbes]);
    if (!node) state.SkipWithError("miss");
    benchmark::DoNotOptimize(node);
    baseline.Unpin(node);
  }
  state.SetItemsProcessed(state.iterations());
}

// A request whose GUID has no group.
void BM_MissPath(benchmark::State& state) {
  const auto n = static_cast<std::size_t>(state.range(0));
  TheWorld().EnsureItems(n);
  boost::intrusive_ptr<RK_Stuff> request(new BenchStuff);
  std::uint64_t k = 1;
  for (auto _ : state) {
    request->SetGuid(Guid(0xdeadbeefULL, k++));
    RK_ScCheckout receipt;
    if (receipt.FindAndCheckout(request.get(), RK_Checkout_ReadOnly)) state.SkipWithError("hit");
  }
  state.SetItemsProcessed(state.iterations());
}

// Check-out and check-in of an item already in hand (no lookup).
void BM_CheckoutCheckinInHand(benchmark::State& state) {
  const auto n = static_cast<std::size_t>(state.range(0));
  TheWorld().EnsureItems(n);
  boost::intrusive_ptr<RK_Stuff> request(new BenchStuff);
  request->SetGuid(KeyOf(static_cast<std::size_t>(state.thread_index())));
  RK_Stuff* item = nullptr;
  if (!RK_GlobalSortDir()->FindAndCheckout(request.get(), RK_Checkout_ReadOnly, &item, nullptr)) {
    state.SkipWithError("miss");
    return;
  }
  for (auto _ : state) {
    if (!item->Checkout(RK_Checkout_ReadOnly)) state.SkipWithError("refused");
    item->Checkin(0, time_duration());
  }
  item->Checkin(RK_Checkin_KeepLastUse, time_duration());
  state.SetItemsProcessed(state.iterations());
}

// Registered in size order: the 1M runs grow the 10k set once.
#define RK_SIZES(b) b->Arg(10000)->Threads(1)->Threads(2)->UseRealTime()
#define RK_BIG(b) b->Arg(1000000)->Threads(1)->Threads(2)->UseRealTime()
BENCHMARK(BM_HitPath)->Apply([](benchmark::internal::Benchmark* b) { RK_SIZES(b); });
BENCHMARK(BM_HitPathDirect)->Apply([](benchmark::internal::Benchmark* b) { RK_SIZES(b); });
BENCHMARK(BM_Baseline)->Apply([](benchmark::internal::Benchmark* b) { RK_SIZES(b); });
BENCHMARK(BM_MissPath)->Apply([](benchmark::internal::Benchmark* b) { RK_SIZES(b); });
BENCHMARK(BM_CheckoutCheckinInHand)->Apply([](benchmark::internal::Benchmark* b) { RK_SIZES(b); });
BENCHMARK(BM_HitPath)->Apply([](benchmark::internal::Benchmark* b) { RK_BIG(b); });
BENCHMARK(BM_HitPathDirect)->Apply([](benchmark::internal::Benchmark* b) { RK_BIG(b); });
BENCHMARK(BM_Baseline)->Apply([](benchmark::internal::Benchmark* b) { RK_BIG(b); });
BENCHMARK(BM_MissPath)->Apply([](benchmark::internal::Benchmark* b) { RK_BIG(b); });

}  // namespace

BENCHMARK_MAIN();
