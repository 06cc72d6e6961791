// rkdemo: a small simulated render host that keeps its rendered frames in
// the cache, the way a real host does.
//
// The host renders frames of a few clips. Each frame is an item of the
// host's own RK_Stuff subclass, keyed by a GUID made from its clip and
// frame numbers. Render threads ask the cache first (a receipt's
// FindAndCheckout); on a miss they render the frame, a deliberately costly
// computation, and enter it with its compute time. The host counts the
// bytes its frames hold in the memory statistic and asks the cache to free
// memory whenever that exceeds the budget. A viewer's session is played:
// playback, scrubbing back and forth, and jumps.
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"

namespace {

using Clock = std::chrono::steady_clock;

// ---- Options ------------------------------------------------------------------
enum class Workload { kPlayback, kScrub, kJumps, kMixed };

struct Options {
  int frames = 240;  // distinct frames across all clips
  int width = 192;
  int height = 108;
  int budgetMB = 8;
  int threads = 2;
  Workload workload = Workload::kMixed;
  unsigned seed = 1;
};

const char* const kUsage =
    "usage: rkdemo [options]\n"
    "\n"
    "A simulated render host: render threads ask the cache for frames, render\n"
    "and enter those it lacks, and keep within a memory budget.\n"
    "\n"
    "  --frames N           distinct frames, spread over 4 clips (default 240)\n"
    "  --frame-size WxH     frame size in pixels (default 192x108)\n"
    "  --budget MB          memory budget for frames (default 8)\n"
    "  --threads N          render threads, 1 to 64 (default 2)\n"
    "  --workload KIND      playback, scrub, jumps or mixed (default mixed)\n"
    "  --seed N             seed of the viewer's session (default 1)\n"
    "  --help               this text\n";

[[noreturn]] void BadOption(const std::string& message) {
  std::fprintf(stderr, "rkdemo: %s\nTry 'rkdemo --help'.\n", message.c_str());
  std::exit(2);
}

long ParseNumber(const std::string& option, const std::string& text, long low, long high) {
  char* end = nullptr;
  errno = 0;
  const long value = std::strtol(text.c_str(), &end, 10);
  if (text.empty() || *end != '\0' || errno != 0 || value < low || value > high) {
    BadOption(option + " needs a whole number from " + std::to_string(low) + " to " + std::to_string(high) +
              ", not '" + text + "'");
  }
  return value;
}

Options ParseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    std::string value;
    const std::size_t eq = arg.find('=');
    bool hasValue = false;
    if (arg.rfind("--", 0) == 0 && eq != std::string::npos) {
      value = arg.substr(eq + 1);
      arg = arg.substr(0, eq);
      hasValue = true;
    }
    auto next = [&]() -> std::string {
      if (hasValue) return value;
      if (i + 1 >= argc) BadOption(arg + " needs a value");
      return argv[++i];
    };
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      std::exit(0);
    } else if (arg == "--frames") {
      o.frames = static_cast<int>(ParseNumber(arg, next(), 4, 1000000));
    } else if (arg == "--frame-size") {
      const std::string size = next();
      const std::size_t x = size.find('x');
      if (x == std::string::npos) BadOption("--frame-size needs WIDTHxHEIGHT, not '" + size + "'");
      o.width = static_cast<int>(ParseNumber(arg, size.substr(0, x), 1, 8192));
      o.height = static_cast<int>(ParseNumber(arg, size.substr(x + 1), 1, 8192));
    } else if (arg == "--budget") {
      o.budgetMB = static_cast<int>(ParseNumber(arg, next(), 1, 1 << 20));
    } else if (arg == "--threads") {
      o.threads = static_cast<int>(ParseNumber(arg, next(), 1, 64));
    } else if (arg == "--workload") {
      const std::string kind = next();
      if (kind == "playback") {
        o.workload = Workload::kPlayback;
      } else if (kind == "scrub") {
        o.workload = Workload::kScrub;
      } else if (kind == "jumps") {
        o.workload = Workload::kJumps;
      } else if (kind == "mixed") {
        o.workload = Workload::kMixed;
      } else {
        BadOption("--workload must be playback, scrub, jumps or mixed, not '" + kind + "'");
      }
    } else if (arg == "--seed") {
      o.seed = static_cast<unsigned>(ParseNumber(arg, next(), 0, 2147483647));
    } else {
      BadOption("unknown option '" + arg + "'");
    }
  }
  return o;
}

// ---- The host's item: a rendered frame ---------------------------------------------
constexpr int kClips = 4;

plinth::utility::Guid FrameGuid(int clip, int frame) {
  // "RKDEMO" in the high word marks the demo's frames; clip and frame fill the rest.
  return plinth::utility::Guid(0x524B44454D4F0000ULL | static_cast<std::uint64_t>(clip),
                               static_cast<std::uint64_t>(frame));
}

class Frame : public RK_Stuff {
 public:
  // A request (no pixels) or, once Render has run, a rendered frame.
  Frame(int clip, int frame, int width, int height)
      : clip_(clip), frame_(frame), width_(width), height_(height) {
    SetGuid(FrameGuid(clip, frame));
  }

  // The costly part: a few iterations of an escape-time fractal per pixel,
  // a stand-in for real rendering work.
  void Render() {
    std::vector<std::uint32_t> pixels(static_cast<std::size_t>(width_) * height_);
    const double zoom = 1.0 + 0.01 * frame_;
    const double cx = -0.743643 + 0.02 * clip_, cy = 0.131825;
    for (int y = 0; y < height_; ++y) {
      for (int x = 0; x < width_; ++x) {
        const double re = cx + (x - width_ / 2.0) / (width_ * zoom);
        const double im = cy + (y - height_ / 2.0) / (height_ * zoom);
        double zr = 0, zi = 0;
        int n = 0;
        while (n < 64 && zr * zr + zi * zi < 4.0) {
          const double t = zr * zr - zi * zi + re;
          zi = 2 * zr * zi + im;
          zr = t;
          ++n;
        }
        pixels[static_cast<std::size_t>(y) * width_ + x] =
            0xFF000000u | static_cast<std::uint32_t>(n * 0x020304);
      }
    }
    HK_TrackBytes(static_cast<std::int64_t>(Bytes()));
    pixels_ = std::move(pixels);
    inMemory_.store(true);
  }

  bool IdenticalRequest(const RK_Stuff* request) const override { return Matches(request); }
  bool CanSatisfyRequest(const RK_Stuff* request) const override { return Matches(request); }
  std::uint32_t GetSizeInBytes() override { return static_cast<std::uint32_t>(Bytes()); }
  bool FreeMemory() override {
    if (!inMemory_.exchange(false)) return false;
    std::vector<std::uint32_t>().swap(pixels_);
    HK_TrackBytes(-static_cast<std::int64_t>(Bytes()));
    return true;
  }
  bool IsInMemory() override { return inMemory_.load(); }

  // REQUIRES: the caller holds a check-out.
  std::uint32_t Pixel(int x, int y) const { return pixels_[static_cast<std::size_t>(y) * width_ + x]; }

 protected:
  ~Frame() override { FreeMemory(); }

 private:
  std::size_t Bytes() const { return static_cast<std::size_t>(width_) * height_ * sizeof(std::uint32_t); }
  bool Matches(const RK_Stuff* request) const {
    const auto* other = dynamic_cast<const Frame*>(request);
    return other && other->clip_ == clip_ && other->frame_ == frame_ && other->width_ == width_ &&
           other->height_ == height_;
  }

  const int clip_, frame_, width_, height_;
  std::atomic<bool> inMemory_{false};
  std::vector<std::uint32_t> pixels_;  // written before entering the cache or under its lock
};

// ---- The viewer's session ------------------------------------------------------------
struct Request {
  int clip;
  int frame;
};

std::vector<Request> MakeSession(const Options& o) {
  const int perClip = std::max(1, o.frames / kClips);
  const std::size_t total = static_cast<std::size_t>(o.frames) * 6;
  std::mt19937 rng(o.seed);
  std::vector<Request> out;
  out.reserve(total);
  int clip = 0, frame = 0;
  auto emit = [&](int f) { out.push_back({clip, std::clamp(f, 0, perClip - 1)}); };
  auto playback = [&](int length) {
    for (int i = 0; i < length && out.size() < total; ++i) emit((frame + i) % perClip);
    frame = (frame + length) % perClip;
  };
  auto scrub = [&](int length) {
    // Back and forth around the playhead, at changing speeds.
    int velocity = 1 + static_cast<int>(rng() % 4);
    for (int i = 0; i < length && out.size() < total; ++i) {
      if (rng() % 12 == 0) velocity = -velocity;
      frame = std::clamp(frame + velocity, 0, perClip - 1);
      emit(frame);
    }
  };
  auto jump = [&]() {
    clip = static_cast<int>(rng() % kClips);
    frame = static_cast<int>(rng() % perClip);
  };
  while (out.size() < total) {
    Workload w = o.workload;
    if (w == Workload::kMixed) w = static_cast<Workload>(rng() % 3);
    switch (w) {
      case Workload::kPlayback:
        playback(perClip / 2 + 1);
        break;
      case Workload::kScrub:
        scrub(40);
        break;
      case Workload::kJumps:
        jump();
        playback(8 + static_cast<int>(rng() % 24));
        break;
      case Workload::kMixed:
        break;
    }
  }
  return out;
}

// ---- Counters ---------------------------------------------------------------------------
struct Stats {
  std::atomic<std::uint64_t> requests{0}, hits{0}, rendered{0}, renderNanos{0}, freedBytes{0}, freeCalls{0};
};

std::uint64_t MemoryStat() {
  std::uint64_t value = 0;
  HK_GetMemoryStat(HK_MemStatItemBytes, &value);
  return value;
}

// Keeps the frames within the budget: frees a tenth more than the excess,
// so that the cache is not asked again at once.
void KeepWithinBudget(const boost::shared_ptr<RK_Bag>& bag, std::uint64_t budget, Stats& stats) {
  const std::uint64_t before = MemoryStat();
  if (before <= budget) return;
  bag->FreeUpSomeMemory(before - budget + budget / 10);
  const std::uint64_t after = MemoryStat();
  stats.freeCalls.fetch_add(1);
  if (after < before) stats.freedBytes.fetch_add(before - after);
}

// Shows the frame to the viewer: reads a few pixels, as a display would.
std::uint32_t Show(const Frame& frame, int width, int height) {
  return frame.Pixel(0, 0) ^ frame.Pixel(width / 2, height / 2) ^ frame.Pixel(width - 1, height - 1);
}

void RenderThread(const Options& o, const std::vector<Request>& session, std::atomic<std::size_t>& next,
                  const boost::shared_ptr<RK_Bag>& bag, std::uint64_t budget, Stats& stats) {
  rkhost::control::SetCurrentThreadIsRenderThread(true);
  std::uint32_t shown = 0;
  for (;;) {
    const std::size_t index = next.fetch_add(1);
    if (index >= session.size()) break;
    const Request& r = session[index];
    boost::intrusive_ptr<Frame> request(new Frame(r.clip, r.frame, o.width, o.height));
    stats.requests.fetch_add(1);
    {
      RK_ScCheckout receipt;
      if (receipt.FindAndCheckout(request.get(), RK_Checkout_ReadOnly | RK_Checkout_OnlyIfInMemory)) {
        stats.hits.fetch_add(1);
        shown ^= Show(*static_cast<Frame*>(receipt.GetStuff()), o.width, o.height);
        continue;
      }
    }
    // A miss: render, show, and keep the result for next time.
    const Clock::time_point start = Clock::now();
    request->Render();
    const auto nanos = std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count();
    stats.rendered.fetch_add(1);
    stats.renderNanos.fetch_add(static_cast<std::uint64_t>(nanos));
    shown ^= Show(*request, o.width, o.height);
    request->AddToBagAndSortDir(bag, boost::posix_time::microseconds(nanos / 1000));
    KeepWithinBudget(bag, budget, stats);
  }
  // Keeps the display reads from being optimised away.
  if (shown == 0x12345678u) std::fputs("", stdout);
}

std::string Megabytes(std::uint64_t bytes) {
  char text[32];
  std::snprintf(text, sizeof text, "%.1f MB", static_cast<double>(bytes) / (1024.0 * 1024.0));
  return text;
}

void ShowProgress(const Stats& stats, std::size_t total, bool tty, bool final) {
  const std::uint64_t requests = stats.requests.load(), hits = stats.hits.load();
  const double hitRate = requests ? 100.0 * static_cast<double>(hits) / static_cast<double>(requests) : 0.0;
  const int width = 24;
  const int filled = static_cast<int>(static_cast<double>(width) * static_cast<double>(requests) /
                                      static_cast<double>(std::max<std::size_t>(total, 1)));
  std::string bar(static_cast<std::size_t>(std::min(filled, width)), '#');
  bar.resize(width, '.');
  std::printf("%s[%s] %3d%%  requests %" PRIu64 "  hit rate %5.1f%%  rendered %" PRIu64 "  in memory %s%s",
              tty ? "\r" : "", bar.c_str(),
              static_cast<int>(100.0 * requests / std::max<std::size_t>(total, 1)), requests, hitRate,
              stats.rendered.load(), Megabytes(MemoryStat()).c_str(), tty ? "" : "\n");
  if (tty && final) std::printf("\n");
  std::fflush(stdout);
}

const char* WorkloadName(Workload w) {
  switch (w) {
    case Workload::kPlayback:
      return "playback";
    case Workload::kScrub:
      return "scrub";
    case Workload::kJumps:
      return "jumps";
    case Workload::kMixed:
      return "mixed";
  }
  return "?";
}

}  // namespace

int main(int argc, char** argv) {
  const Options o = ParseOptions(argc, argv);
  const bool tty = isatty(STDOUT_FILENO) != 0;
  // The host's log (the module's start and stop lines, reclamation
  // statistics) would interleave with the progress display; it is kept
  // quiet here.
  rkhost::control::SetLogSink([](const std::string&) {});

  rkhost::control::MakeCurrentThreadMain();
  RK_Birth(false);
  int exitCode = 0;
  {
    const boost::shared_ptr<RK_Bag> bag = RK_GlobalBag();
    const std::uint64_t budget = static_cast<std::uint64_t>(o.budgetMB) * 1024 * 1024;
    const std::vector<Request> session = MakeSession(o);
    const std::uint64_t frameBytes = static_cast<std::uint64_t>(o.width) * o.height * 4;
    std::printf(
        "rkdemo: %d frames of %dx%d (%s each) in %d clips, budget %d MB, %d render thread%s, "
        "workload %s, %zu requests\n",
        o.frames, o.width, o.height, Megabytes(frameBytes).c_str(), kClips, o.budgetMB, o.threads,
        o.threads == 1 ? "" : "s", WorkloadName(o.workload), session.size());

    Stats stats;
    std::atomic<std::size_t> next{0};
    const Clock::time_point start = Clock::now();
    std::vector<std::thread> threads;
    try {
      for (int t = 0; t < o.threads; ++t)
        threads.emplace_back(RenderThread, std::cref(o), std::cref(session), std::ref(next), std::cref(bag),
                             budget, std::ref(stats));
    } catch (const std::exception& e) {
      std::fprintf(stderr, "rkdemo: cannot start render threads: %s\n", e.what());
      exitCode = 1;
    }
    // Live progress: one updating line on a terminal, a line a second otherwise.
    const auto period = tty ? std::chrono::milliseconds(100) : std::chrono::milliseconds(1000);
    std::uint64_t shownRequests = ~std::uint64_t(0);
    while (stats.requests.load() < session.size() && exitCode == 0) {
      std::this_thread::sleep_for(period);
      shownRequests = stats.requests.load();
      ShowProgress(stats, session.size(), tty, false);
    }
    for (std::thread& t : threads) t.join();
    if (tty || shownRequests != stats.requests.load()) ShowProgress(stats, session.size(), tty, true);
    const double wall = std::chrono::duration<double>(Clock::now() - start).count();

    const std::uint64_t requests = stats.requests.load(), hits = stats.hits.load();
    const std::uint64_t rendered = stats.rendered.load();
    const double renderSeconds = static_cast<double>(stats.renderNanos.load()) / 1e9;
    const double perFrame = rendered ? renderSeconds / static_cast<double>(rendered) : 0.0;
    std::uint64_t memoryBytes = 0, diskBytes = 0;
    bag->GetCacheSizesInBytes(memoryBytes, diskBytes);

    std::printf("\nSummary\n");
    std::printf("  requests            %" PRIu64 "\n", requests);
    std::printf("  hits                %" PRIu64 "\n", hits);
    std::printf("  misses              %" PRIu64 "\n", requests - hits);
    std::printf("  hit rate            %.1f%%\n", requests ? 100.0 * hits / requests : 0.0);
    std::printf("  frames rendered     %" PRIu64 "\n", rendered);
    std::printf("  rendering time      %.2f s (%.2f ms a frame)\n", renderSeconds, perFrame * 1000.0);
    std::printf("  without a cache     %.2f s (every request rendered)\n",
                perFrame * static_cast<double>(requests));
    std::printf("  saved               %.2f s\n", perFrame * static_cast<double>(requests) - renderSeconds);
    std::printf("  items held          %zu\n", bag->GetStuffCount());
    std::printf("  bytes held          %s in memory, %s on disk\n", Megabytes(memoryBytes).c_str(),
                Megabytes(diskBytes).c_str());
    std::printf("  memory freed        %s in %" PRIu64 " calls\n", Megabytes(stats.freedBytes.load()).c_str(),
                stats.freeCalls.load());
    std::printf("  wall time           %.2f s on %d thread%s\n", wall, o.threads, o.threads == 1 ? "" : "s");
  }
  RK_StopAllAsyncWork();
  RK_Death();
  return exitCode;
}
