// Error reporting helpers (internal). Every Part reports through these, so
// the patterns live in one place.
#pragma once

#include <exception>

#include "host/hk.h"
#include "rkcache/export.h"

// A user-visible error: on the main thread, reports message `messageIndex`
// of the module's table (group RK_ErrorGroup, number 2); then throws `code`
// as an int on every thread.
[[noreturn]] RK_INTERNAL void RKp_ThrowUserError(int code, int messageIndex);

// A broken invariant: HK_ReportFailedVerification(null, number, null,
// message), then throws RK_InternalErrorCode.
[[noreturn]] RK_INTERNAL void RKp_FailVerification(int number, const char* message);

// Runs f; a thrown int is dropped, a std::exception is passed to
// HK_TranslateAndReportException. Other exceptions pass on. For operations
// that must not let an error escape (destructors, read-back).
template <class F>
RK_INTERNAL void RKp_Swallow(F&& f) noexcept(false) {
  try {
    f();
  } catch (int) {
  } catch (const std::exception& e) {
    HK_TranslateAndReportException(e);
  }
}

// Brackets work that runs away from the user's action: starts quiet errors
// on construction (a non-zero status is thrown as an int, and then no end
// call is owed) and ends them on destruction.
class RK_INTERNAL RKp_ScQuietErrors {
 public:
  RKp_ScQuietErrors();
  ~RKp_ScQuietErrors();
  RKp_ScQuietErrors(const RKp_ScQuietErrors&) = delete;
  RKp_ScQuietErrors& operator=(const RKp_ScQuietErrors&) = delete;
};
