// The computer name and the millisecond clock: the host's two questions to
// the operating system.
#include <unistd.h>

#include <atomic>
#include <climits>
#include <ctime>
#include <mutex>
#include <optional>
#include <string>

#include "host/control.h"
#include "host/hk.h"

namespace {

std::mutex g_nameMutex;
std::optional<std::string> g_nameOverride;  // guarded by g_nameMutex
std::atomic<int> g_failComputerName{0};

std::atomic<bool> g_useTestClock{false};
std::atomic<std::uint64_t> g_testClockMs{0};

// The system's name for this machine; empty if it has none it will tell.
std::string SystemComputerName() {
#ifdef HOST_NAME_MAX
  char name[HOST_NAME_MAX + 1] = {};
#else
  char name[256] = {};
#endif
  if (gethostname(name, sizeof name - 1) != 0) return std::string();
  return std::string(name);
}

}  // namespace

int HK_GetComputerName(int bufferSize, char* buffer) {
  const int forced = g_failComputerName.load();
  if (forced != 0) return forced;
  std::optional<std::string> name;
  {
    std::lock_guard<std::mutex> lock(g_nameMutex);
    name = g_nameOverride;
  }
  // An override may be empty on purpose: a machine without a name.
  if (!name) name = SystemComputerName();
  return HK_CopyString(name->c_str(), bufferSize, buffer);
}

int HK_MillisecondsSinceBoot(std::uint64_t* ms) {
  if (ms == nullptr) return HK_ErrBadParameter;
  if (g_useTestClock.load()) {
    *ms = g_testClockMs.load();
    return 0;
  }
  timespec now{};
  if (clock_gettime(CLOCK_MONOTONIC, &now) != 0) return HK_ErrClock;
  *ms = static_cast<std::uint64_t>(now.tv_sec) * 1000u + static_cast<std::uint64_t>(now.tv_nsec) / 1000000u;
  return 0;
}

namespace rkhost {
namespace control {

void SetComputerName(const std::optional<std::string>& name) {
  std::lock_guard<std::mutex> lock(g_nameMutex);
  g_nameOverride = name;
}

void FailComputerName(int status) {
  g_failComputerName.store(status);
}

void UseTestClock(bool on) {
  g_useTestClock.store(on);
}

void SetTestClock(std::uint64_t ms) {
  g_testClockMs.store(ms);
}

void AdvanceTestClock(std::uint64_t ms) {
  g_testClockMs.fetch_add(ms);
}

}  // namespace control
}  // namespace rkhost
