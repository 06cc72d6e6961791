// Error reports, failed verifications, translated exceptions and quiet
// errors. The host has no dialogs: a report that would be shown is written
// to the log at kLevelReport, a suppressed one at kLevelSuppressed, and
// both are captured with their quietness.
#include <atomic>
#include <cstdio>
#include <new>
#include <string>
#include <vector>

#include "host/hk.h"
#include "internal.h"

namespace rkhost {
namespace {

// The open quiet-error brackets of this thread, innermost last; each holds
// the quietness it was opened with.
thread_local std::vector<bool> t_quietStack;

std::atomic<int> g_failStartQuiet{0};

std::string Hex(std::int32_t value) {
  char buffer[16];
  std::snprintf(buffer, sizeof buffer, "0x%X", static_cast<unsigned>(value));
  return buffer;
}

}  // namespace

namespace control {

void FailStartQuietErrors(int status) {
  g_failStartQuiet.store(status);
}

}  // namespace control
}  // namespace rkhost

using rkhost::detail::kLevelInternal;
using rkhost::detail::kLevelReport;
using rkhost::detail::kLevelSuppressed;

bool HK_AreErrorsQuietOnCurrentThread() {
  return !rkhost::t_quietStack.empty() && rkhost::t_quietStack.back();
}

int HK_StartQuietErrorsOnCurrentThread(bool quiet) {
  const int forced = rkhost::g_failStartQuiet.load();
  if (forced != 0) return forced;
  rkhost::t_quietStack.push_back(quiet);
  return 0;
}

void HK_EndQuietErrorsOnCurrentThread() {
  if (rkhost::t_quietStack.empty()) {
    rkhost::detail::WriteLogLine(kLevelInternal, "HK", "QuietErrors",
                                 "end of quiet errors without a start; ignored");
    return;
  }
  rkhost::t_quietStack.pop_back();
}

void HKp_ReportErrString(std::int32_t group, std::int32_t number, const char* detail) {
  const bool quiet = HK_AreErrorsQuietOnCurrentThread();
  std::string text = detail != nullptr ? detail : "";
  rkhost::detail::WriteLogLine(
      quiet ? kLevelSuppressed : kLevelReport, "HK", quiet ? "SuppressedError" : "Error",
      "group " + rkhost::Hex(group) + " number " + std::to_string(number) + ": " + text);
  rkhost::detail::CaptureErrorReport(rkhost::control::ErrorReport{group, number, std::move(text), quiet});
}

void HK_ReportFailedVerification(const char* file, int number, const char* expression, const char* message) {
  std::string text = message != nullptr ? message : "";
  std::string line = "failed verification " + std::to_string(number) + ": " + text;
  if (expression != nullptr) line += std::string(" (") + expression + ")";
  if (file != nullptr) line += std::string(" in ") + file;
  rkhost::detail::WriteLogLine(kLevelReport, "HK", "Verification", line);
  rkhost::detail::CaptureVerification(rkhost::control::Verification{number, std::move(text)});
}

int HK_TranslateAndReportException(const std::exception& e) {
  const int code = dynamic_cast<const std::bad_alloc*>(&e) != nullptr ? HK_ErrOutOfMemory : HK_ErrException;
  const bool quiet = HK_AreErrorsQuietOnCurrentThread();
  const char* raw = e.what();
  std::string what = raw != nullptr ? raw : "";
  rkhost::detail::WriteLogLine(quiet ? kLevelSuppressed : kLevelReport, "HK",
                               quiet ? "SuppressedException" : "Exception",
                               "code " + rkhost::Hex(code) + ": " + what);
  rkhost::detail::CaptureException(rkhost::control::ExceptionReport{std::move(what), code, quiet});
  return code;
}
