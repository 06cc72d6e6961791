// The control API of the host services: what a host program or a test sets
// and inspects. The module never calls these.
#pragma once

#include <boost/function.hpp>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "host/export.h"

namespace rkhost {
namespace control {

// --- Threads ---------------------------------------------------------------
// Makes the calling thread the main thread.
HK_API void MakeCurrentThreadMain();
// Marks or unmarks the calling thread as a render thread.
HK_API void SetCurrentThreadIsRenderThread(bool isRender);

// --- Memory statistic 6 -----------------------------------------------------
HK_API void SetMemoryStat(std::uint64_t value);
HK_API std::uint64_t MemoryStat();
// A non-zero status makes HK_GetMemoryStat fail with it; 0 restores success.
HK_API void FailMemoryStat(int status);

// --- Clock ------------------------------------------------------------------
// With the test clock on, HK_MillisecondsSinceBoot returns a value that
// moves only through SetTestClock/AdvanceTestClock.
HK_API void UseTestClock(bool on);
HK_API void SetTestClock(std::uint64_t ms);
HK_API void AdvanceTestClock(std::uint64_t ms);

// --- Preferences ------------------------------------------------------------
// Loads preferences from an INI file ([section] / key=value). Returns false
// (and keeps the previous values) if the file cannot be read or parsed.
HK_API bool LoadPreferencesFile(const std::string& path);
HK_API void SetPreference(const std::string& section, const std::string& key, const std::string& value);
HK_API void ClearPreferences();

// --- Machine ----------------------------------------------------------------
// Overrides the computer name (std::nullopt: the system's name again).
HK_API void SetComputerName(const std::optional<std::string>& name);
// A non-zero status makes HK_GetComputerName fail with it.
HK_API void FailComputerName(int status);
// A non-zero status makes HK_StartQuietErrorsOnCurrentThread fail with it.
HK_API void FailStartQuietErrors(int status);

// --- Logging ----------------------------------------------------------------
// Lines at or below level are written (default 10).
HK_API void SetLogLevel(int level);
// Routes log lines to sink (an empty function restores stderr).
HK_API void SetLogSink(const boost::function<void(const std::string&)>& sink);

// --- Capture of what the services were asked to do ----------------------------
struct ErrorReport {
  std::int32_t group;
  std::int32_t number;
  std::string detail;
  bool suppressed;  // errors were quiet on the reporting thread
};
struct Verification {
  int number;
  std::string message;
};
struct LogLine {
  int level;
  std::string module;
  std::string tag;
  std::string text;
};
struct Captured {
  std::vector<ErrorReport> errorReports;
  std::vector<Verification> verifications;
  std::vector<std::string> exceptions;  // what() of translated exceptions
  std::vector<LogLine> logLines;        // every JOT_Log / JOT_sprintf line, filtered or not
};
// A copy of everything captured since the last ClearCaptured.
HK_API Captured Snapshot();
HK_API void ClearCaptured();

}  // namespace control
}  // namespace rkhost
