// Error codes. The module throws plain `int` codes (no exception class).
// User-visible errors are reported to the host on the main thread only,
// before the code is thrown; broken invariants are reported as failed
// verifications and then 3 is thrown.
#pragma once

#include "host/hk.h"
#include "rkcache/export.h"

enum : int {
  RK_ModuleErrorCheckout = 0x3A03,         // check-out conflict
  RK_ModuleErrorNotCheckedOut = 0x3A04,    // an operation that needs a check-out found none
  RK_ModuleErrorDiskCacheFolder = 0x3A07,  // the disk cache folder cannot be used
  RK_InternalErrorCode = 3,                // thrown after a failed internal verification
  RK_ErrorWrongAppVersion = 9,             // a cache file of another application version
};

// The group passed with every user-visible report.
inline constexpr int RK_ErrorGroup = 0x3A0000;

// The module's localised message table (28 entries: 27 messages and the
// terminator), for HK_ZLookupLStrCache.
extern RK_EXPORT HK_ZRef RK_G_zref;
