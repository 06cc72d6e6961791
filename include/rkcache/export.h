// Symbol visibility: the module is built with hidden visibility and exports
// only what a host uses.
#pragma once

#if defined(RK_BUILDING_MODULE)
#define RK_EXPORT __attribute__((visibility("default")))
// Pins the module's own helpers to hidden visibility even where a template
// argument or an enclosing exported class would otherwise make them visible.
#define RK_INTERNAL __attribute__((visibility("hidden")))
#else
#define RK_EXPORT
#define RK_INTERNAL
#endif
