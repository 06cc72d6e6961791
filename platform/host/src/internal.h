// Pieces shared between the source files of the host services. Everything
// here has hidden visibility: it is not part of the library's interface.
#pragma once

#include <string>

#include "host/control.h"

namespace rkhost {
namespace detail {

// Log levels of the lines the services write about themselves. Lower is
// more important; the default filter (10) lets all of them through.
inline constexpr int kLevelReport = 1;      // an error shown to the user
inline constexpr int kLevelSuppressed = 5;  // an error kept quiet
inline constexpr int kLevelInternal = 2;    // misuse of the services

// The one way a line reaches the log: captured, then written through the
// sink if the level passes the filter.
void WriteLogLine(int level, const std::string& module, const std::string& tag, const std::string& text);

// Records for control::Snapshot.
void CaptureErrorReport(control::ErrorReport report);
void CaptureVerification(control::Verification verification);
void CaptureException(control::ExceptionReport report);
void CaptureLogLine(control::LogLine line);

}  // namespace detail
}  // namespace rkhost
