// Symbol visibility for the host services library.
#pragma once

#if defined(RKHOST_BUILDING)
#define HK_API __attribute__((visibility("default")))
#else
#define HK_API
#endif
