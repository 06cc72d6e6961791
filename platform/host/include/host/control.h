// The control API of the host services: what a host program or a test sets
// and inspects. The module never calls these.
#pragma once

#include <boost/function.hpp>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "host/export.h"

namespace rkhost {
namespace control {

// --- Threads ---------------------------------------------------------------
// Until a host calls this, the main thread is the thread that loaded the
// library: a static initialiser of rkhost records it, so for a program linked
// against rkhost it is the process's initial thread.
// Makes the calling thread the main thread.
HK_API void MakeCurrentThreadMain();
// Marks or unmarks the calling thread as a render thread (a per-thread
// flag; a new thread starts unmarked).
HK_API void SetCurrentThreadIsRenderThread(bool isRender);

// --- Memory statistic 6 -----------------------------------------------------
// The statistic is a process-wide byte count that tracked allocation moves
// (hk.h). SetMemoryStat overwrites it; later tracked frees subtract from the
// new value and stop at 0.
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
// The store starts empty; if the environment variable RKHOST_PREFERENCES
// names a file when the store is first used, that file is loaded then.
// Loads preferences from an INI file ([section] / key=value). On success the
// file's values replace every earlier value (SetPreference ones included).
// Returns false (and keeps the previous values) if the file cannot be read or
// parsed.
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
// Each list keeps at most kCaptureLimit entries; beyond that the oldest are
// dropped, so a long-running host does not grow without bound.
inline constexpr std::size_t kCaptureLimit = 100000;
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
struct ExceptionReport {
  std::string what;
  int code;         // what HK_TranslateAndReportException returned
  bool suppressed;  // errors were quiet on the reporting thread
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
  std::vector<std::string> exceptions;            // what() of translated exceptions
  std::vector<ExceptionReport> exceptionReports;  // the same, with code and quietness
  std::vector<LogLine> logLines;                  // every JOT_Log / JOT_sprintf line, filtered or not
};
// A copy of everything captured since the last ClearCaptured.
HK_API Captured Snapshot();
HK_API void ClearCaptured();

}  // namespace control
}  // namespace rkhost
