// Symbol visibility: the module is built with hidden visibility and exports
// only what a host uses.
#pragma once

#if defined(RK_BUILDING_MODULE)
#define RK_EXPORT __attribute__((visibility("default")))
#else
#define RK_EXPORT
#endif
