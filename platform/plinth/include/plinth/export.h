// Symbol visibility for the platform library.
#pragma once

#if defined(PLINTH_BUILDING)
#define PLINTH_API __attribute__((visibility("default")))
#else
#define PLINTH_API
#endif
