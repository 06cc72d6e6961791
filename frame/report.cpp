// Error reporting: user-visible errors, failed verifications, quiet-error
// brackets. Every Part reports through these, so the patterns live here.
#include "frame/report.h"

#include "rkcache/errors.h"

void RKp_ThrowUserError(int code, int messageIndex) {
  // Only the main thread may put up a report; render and background threads
  // just throw, and their callers decide what the user sees.
  if (HK_IsOnMainThread()) {
    // The number 2 is what every check-out error passes: it is also the index
    // of "internal structure damaged". The detail names what went wrong.
    const std::string detail = HK_ZLookupLStrCache(RK_G_zref, messageIndex, 0, 0);
    HKp_ReportErrString(RK_ErrorGroup, 2, detail.c_str());
  }
  throw code;
}

void RKp_FailVerification(int number, const char* message) {
  HK_ReportFailedVerification(nullptr, number, nullptr, message);
  throw static_cast<int>(RK_InternalErrorCode);
}

RKp_ScQuietErrors::RKp_ScQuietErrors() {
  const int status = HK_StartQuietErrorsOnCurrentThread(true);
  // Nothing was started, so no end call is owed: the destructor does not run.
  if (status != 0) throw status;
}

RKp_ScQuietErrors::~RKp_ScQuietErrors() {
  HK_EndQuietErrorsOnCurrentThread();
}
