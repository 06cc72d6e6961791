// The host's services: thread identity, error reports, localised strings,
// verifications, quiet errors, logging, memory statistics, tracked
// allocation, the computer name, text conversion, the millisecond clock and
// preferences.
//
// Thread safety: every function may be called from any thread. Reports are
// written to the host log and kept for inspection (see host/control.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <exception>
#include <string>

#include "host/export.h"
#include "plinth/allocator.h"
#include "plinth/types.h"

// ---------------------------------------------------------------------------
// Status codes of the host services (0 is success)
// ---------------------------------------------------------------------------
inline constexpr int HK_ErrBadParameter = 0x4B01;     // null pointer, buffer size <= 0
inline constexpr int HK_ErrUnknownSelector = 0x4B02;  // HK_GetMemoryStat selector
inline constexpr int HK_ErrOutOfMemory = 0x4B03;      // a translated std::bad_alloc
inline constexpr int HK_ErrException = 0x4B04;        // any other translated exception
inline constexpr int HK_ErrClock = 0x4B05;            // the system clock could not be read
inline constexpr int ST_ErrBadHandle = 0x4C01;        // not a handle from ST_GetPrefHandle
inline constexpr int ST_ErrBadValue = 0x4C02;         // stored text is not a number of the asked kind

// ---------------------------------------------------------------------------
// Threads
// ---------------------------------------------------------------------------
// The main thread is the process's initial thread unless the host named
// another one (control.h).
HK_API bool HK_IsOnMainThread();
// True on threads that marked themselves as render threads (control.h).
HK_API bool HK_IsOnRenderThread();

// ---------------------------------------------------------------------------
// Error reports, localised strings, verifications, exceptions
// ---------------------------------------------------------------------------
// Shows `detail` to the user as an error of `group` and `number`, unless
// errors are quiet on this thread (then it is only logged as suppressed).
HK_API void HKp_ReportErrString(std::int32_t group, std::int32_t number, const char* detail);

// A module's localised message table: entries of "key=text" strings, each
// followed by three slots that the string service owns.
struct HK_LStrEntry {
  const char* keyAndText;  // "key=default text", optionally followed by "{{*COMMENT*}}note"
  std::intptr_t slots[3];
};
struct HK_LStrCacheRec {
  const char* moduleKey;
  std::int32_t count;  // entries including the terminating one
  HK_LStrEntry* entries;
};
using HK_ZRef = HK_LStrCacheRec*;

// The text of entry `index` of the table: the part after the first '=',
// without a translator note (from "{{*COMMENT*}}" on); a text without '='
// is returned whole. An index outside the table, or at or past the
// terminating entry (null text), gives "".
HK_API std::string HK_ZLookupLStrCache(HK_ZRef table, int index, int reserved1, int reserved2);
// The localised text of a "key=default text" string: the text after '='.
HK_API std::string HK_ZStringToMBString(const char* keyAndText);

// Records a failed internal check and returns.
HK_API void HK_ReportFailedVerification(const char* file, int number, const char* expression,
                                        const char* message);
// Reports a caught exception to the user (unless quiet) and returns the
// error code it stands for (never 0): HK_ErrOutOfMemory for std::bad_alloc
// (and its subclasses), HK_ErrException for anything else.
HK_API int HK_TranslateAndReportException(const std::exception& e);

// Quiet errors nest per thread: between a start and its end, no error is
// shown to the user from this thread. The innermost open bracket decides:
// start(true) makes errors quiet, start(false) shows them again until its
// end. Returns 0 on success (a non-zero status can be forced through
// control.h; then no bracket is opened and no end is owed). An end without
// an open bracket is logged and ignored.
HK_API int HK_StartQuietErrorsOnCurrentThread(bool quiet);
HK_API void HK_EndQuietErrorsOnCurrentThread();
HK_API bool HK_AreErrorsQuietOnCurrentThread();

// ---------------------------------------------------------------------------
// Logging
// ---------------------------------------------------------------------------
// One line through the host's log sink, if level passes the filter
// (lines at or below the configured level are written; default 10).
HK_API void JOT_Log(int level, const char* module, const char* tag, const char* message);
HK_API void JOT_sprintf(int level, const char* module, const char* tag, const char* format, ...)
    __attribute__((format(printf, 4, 5)));
// The message text of a trace: "<operation>: <formatted text>".
HK_API std::string JOT_convertMesg(const char* operation, const char* format, ...)
    __attribute__((format(printf, 2, 3)));

// ---------------------------------------------------------------------------
// Memory
// ---------------------------------------------------------------------------
// Selector of the statistic that counts the bytes the host's items hold.
inline constexpr int HK_MemStatItemBytes = 6;
// Writes the statistic to *value. Returns 0 on success, a non-zero status for
// an unknown selector (HK_ErrUnknownSelector), a null value
// (HK_ErrBadParameter) or when a failure was forced (control.h).
HK_API int HK_GetMemoryStat(int selector, std::uint64_t* value);
// Tracked allocation: adds to / subtracts from statistic 6, which never
// goes below 0. HK_TrackedAlloc throws std::bad_alloc like operator new.
HK_API void* HK_TrackedAlloc(std::size_t bytes);
// REQUIRES: p is null or came from HK_TrackedAlloc(bytes) with the same count.
HK_API void HK_TrackedFree(void* p, std::size_t bytes) noexcept;
HK_API void HK_TrackBytes(std::int64_t delta);

// Base for objects allocated through tracked allocation. The sized delete
// takes back the size of the whole object, so a class deleted through a
// base pointer needs a virtual destructor.
class HK_API HK_MemTrackedObject {
 public:
  static void* operator new(std::size_t bytes);
  static void operator delete(void* p, std::size_t bytes) noexcept;
};

// ---------------------------------------------------------------------------
// Machine, text, clock
// ---------------------------------------------------------------------------
// Writes the computer name (possibly empty) zero-terminated into buffer,
// cut to fit. Returns 0 on success, non-zero for a bad buffer or a forced
// failure. Cutting never splits a UTF-8 character.
HK_API int HK_GetComputerName(int bufferSize, char* buffer);
// Copies text zero-terminated into buffer, cut to fit without splitting a
// UTF-8 character. Returns 0 on success, HK_ErrBadParameter for a null buffer
// or text or a size <= 0.
HK_API int HK_CopyString(const char* text, int bufferSize, char* buffer);

// The host's multibyte encoding is UTF-8. HK_AsciiToUTF16String throws
// std::invalid_argument for a byte above 0x7F; HK_MBToUTF16String converts
// ill-formed UTF-8 with U+FFFD in place of each byte that does not start a
// well-formed sequence; HK_UTF16ToMBString throws std::invalid_argument for a
// lone surrogate unless replaceInvalid is true (then it becomes U+FFFD). A
// null text gives "".
using HK_UTF16String = plinth::utility::SmallUString;
HK_API HK_UTF16String HK_AsciiToUTF16String(const char* text);
HK_API HK_UTF16String HK_MBToUTF16String(const char* text);
HK_API std::string HK_UTF16ToMBString(const HK_UTF16String& text, bool replaceInvalid);

// A monotonic millisecond count (CLOCK_MONOTONIC, or the test clock of
// control.h). Returns 0 on success.
HK_API int HK_MillisecondsSinceBoot(std::uint64_t* ms);

// The host's 8-byte time record; copied whole, never interpreted here.
struct T_Time {
  std::int64_t value;
};

// ---------------------------------------------------------------------------
// Preferences (an INI file; see control.h)
// ---------------------------------------------------------------------------
using ST_PrefHandle = void*;
// The store of preference `type` (0: the text-preference store); null for
// an unknown type.
HK_API ST_PrefHandle ST_GetPrefHandle(int type);
// Stored value or the default when the key is missing; returns 0. A value
// that is present but not a number of the asked kind, or a bad handle, gives
// a non-zero status and leaves *value at the default.
HK_API int ST_GetTextPrefLong(ST_PrefHandle handle, const char* section, const char* key,
                              std::int32_t defaultValue, std::int32_t* value);
HK_API int ST_GetTextPrefFpLong(ST_PrefHandle handle, const char* section, const char* key,
                                double defaultValue, double* value);
