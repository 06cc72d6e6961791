// The module's localised message table. The host's string service loads it
// through RK_G_zref and owns the three slots of every entry; index N is the
// entry whose key ends in N. Texts after "{{*COMMENT*}}" are notes for
// translators and never shown. "#{rsquo}" is the host's markup for a right
// single quotation mark and stays as it is.
#include "rkcache/errors.h"

namespace {

HK_LStrEntry S_messages[] = {
    {"$$$/VX/RK/LStr/0000=", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0001=bag to store cached items", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0002=internal structure damaged", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0003= %s (bag)", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0004= %s (cache sort directory)", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0005= %s (global data)", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0006=disposing non-empty cache", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0007=cannot dispose the global cache", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0008=cannot resize or move disk cache", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0009=cache sort directory", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0010=cannot dispose checked-out cached item", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0011=cached item already checked-out read/write", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0012=cannot check-out read/write already checked-out item", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0013= %s (cache check-out receipt)", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0014=cache check-out receipt", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0015=unable to search importance sort directory", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0016=unable to add cached item to disposed sort directory", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0017=cache item not found", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0018=unable to dispose importance sort directory", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0019=cannot reference an ID which is not checked out", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0020=stale stuff ID", {0, 0, 0}},
    {"$$$/VX/RK/LStr/0021=unsafe operation attempted"
     "{{*COMMENT*}}Shown when a caller uses a cached item in a way that could corrupt the cache.",
     {0, 0, 0}},
    {"$$$/VX/RK/LStr/0022=can#{rsquo}t convert to writeable when not checked out"
     "{{*COMMENT*}}Shown when a cached item is made writeable by a caller that has not checked it out.",
     {0, 0, 0}},
    {"$$$/VX/RK/LStr/0023=This Computer"
     "{{*COMMENT*}}Folder name used in the disk cache path when the machine has no name.",
     {0, 0, 0}},
    {"$$$/VX/RK/LStr/0024=Disk Cache folder doesn#{rsquo}t exist, so it will be reset to the system "
     "temporary directory. Please check your settings in Memory & Cache Preferences."
     "{{*COMMENT*}}Warning at start-up; 'Memory & Cache Preferences' is the name of the preferences panel.",
     {0, 0, 0}},
    {"$$$/VX/RK/LStr/0025=Disk Cache folder isn#{rsquo}t a folder, so it will be reset to the system "
     "temporary directory. Please check your settings in Memory & Cache Preferences."
     "{{*COMMENT*}}Warning at start-up when the chosen path names a file; keep the panel name as translated "
     "elsewhere.",
     {0, 0, 0}},
    {"$$$/VX/RK/LStr/0026=Unable to write to Disk Cache folder, so disk caching will be disabled. Please "
     "check your settings in Memory & Cache Preferences."
     "{{*COMMENT*}}Warning when the disk cache folder is read-only or full; keep the panel name as "
     "translated "
     "elsewhere.",
     {0, 0, 0}},
    // The terminator; the count below includes it.
    {nullptr, {-1, -1, 0}},
};

static_assert(sizeof(S_messages) / sizeof(S_messages[0]) == 28, "27 messages and the terminator");

HK_LStrCacheRec S_messageTable = {"RK", 28, S_messages};

}  // namespace

HK_ZRef RK_G_zref = &S_messageTable;
