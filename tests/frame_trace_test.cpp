// Trace sites: lines appear only for enabled categories and levels, a change
// takes effect once the trace change count moves, and the line has its
// fixed form.
#include <gtest/gtest.h>

#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "plinth/debug.h"
#include "plinth/threads.h"
#include "rkcache/rkcache.h"
#include "rkcache/testing.h"

namespace {

class TraceCapture {
 public:
  TraceCapture() {
    plinth::debug::SetTraceSink([this](const std::string& text) {
      std::lock_guard<std::mutex> lock(mutex_);
      lines_.push_back(text);
    });
  }
  ~TraceCapture() { plinth::debug::SetTraceSink({}); }

  std::vector<std::string> Take() {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<std::string> out;
    out.swap(lines_);
    return out;
  }

 private:
  std::mutex mutex_;
  std::vector<std::string> lines_;
};

std::string Line(std::uint64_t thread, const std::string& category, int level, const char* operation,
                 const char* text) {
  return "<" + std::to_string(thread) + "> <" + category + "> <" + std::to_string(level) + "> " +
         JOT_convertMesg(operation, "%s", text) + "\r\n";
}

}  // namespace

TEST(FrameTrace, SitesFollowTheSettingsOnceTheChangeCountMoves) {
  TraceCapture capture;
  const std::uint64_t self = plinth::threads::GetCurrentThreadID();
  RK_TEST_TraceSite(RK_TEST_Trace_Stuff10, "RK_Stuff::EnsureInMemory", "pre-prep");
  EXPECT_TRUE(capture.Take().empty());

  // Sites inherit the "*" setting for categories without their own.
  plinth::debug::SetTraceLevel("*", 10);
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache6, "op", "inherited");
  EXPECT_EQ(capture.Take(), std::vector<std::string>{Line(self, "DiskCache", 6, "op", "inherited")});
  plinth::debug::SetTraceLevel("*", -1);

  // Switched on while running: the very next call sees it.
  const std::uint64_t countBefore = plinth::debug::TraceChangeCount();
  plinth::debug::SetTraceLevel("RK_Stuff", 10);
  ASSERT_NE(plinth::debug::TraceChangeCount(), countBefore);
  RK_TEST_TraceSite(RK_TEST_Trace_Stuff10, "RK_Stuff::EnsureInMemory", "pre-prep");
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "RK_Bag::PurgeDiskCaches", "start");
  EXPECT_EQ(capture.Take(),
            std::vector<std::string>{Line(self, "RK_Stuff", 10, "RK_Stuff::EnsureInMemory", "pre-prep")});

  // A category enabled at 5 takes level 5 but not 6; lowered, a site falls silent.
  plinth::debug::SetTraceLevel("DiskCache", 5);
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "purge", "five");
  RK_TEST_TraceSite(RK_TEST_Trace_DiskCache6, "purge", "six");
  plinth::debug::SetTraceLevel("RK_Stuff", 9);
  RK_TEST_TraceSite(RK_TEST_Trace_Stuff10, "op", "lowered");
  EXPECT_EQ(capture.Take(), std::vector<std::string>{Line(self, "DiskCache", 5, "purge", "five")});

  // Another thread's line names that thread.
  std::uint64_t other = 0;
  std::thread([&] {
    other = plinth::threads::GetCurrentThreadID();
    RK_TEST_TraceSite(RK_TEST_Trace_DiskCache5, "op", "elsewhere");
  }).join();
  ASSERT_NE(other, self);
  EXPECT_EQ(capture.Take(), std::vector<std::string>{Line(other, "DiskCache", 5, "op", "elsewhere")});
  plinth::debug::SetTraceLevel("DiskCache", -1);
  plinth::debug::SetTraceLevel("RK_Stuff", -1);
  EXPECT_THROW(RK_TEST_TraceSite(3, "op", "x"), std::invalid_argument);
}
