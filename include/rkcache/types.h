// Vocabulary shared by the module's headers: check-out results and flags,
// check-in flags, and the header byte vector.
#pragma once

#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/function.hpp>
#include <boost/intrusive_ptr.hpp>
#include <boost/shared_ptr.hpp>

#include "plinth/allocator.h"
#include "rkcache/export.h"

class RK_Stuff;
class RK_Bag;
class RK_SortDir;

enum RK_CheckoutResult {
  RK_CheckoutResult_NotCheckedOut = 0,  // nothing was checked out
  RK_CheckoutResult_CheckedOut = 1,     // checked out: the caller must check it in
};

// Check-out flags (a bit set).
enum {
  RK_Checkout_ReadOnly = 1,           // clear: writeable check-out
  RK_Checkout_OnlyIfInMemory = 2,     // give up at once if the data is not in memory
  RK_Checkout_EvenIfNotInMemory = 4,  // succeed even if the data is neither in memory nor on disk
  RK_Checkout_DontRead = 8,           // do not read an on-disk item back; on disk counts as available
};

// Check-in flags (a bit set). Discard wins over FreeMemory, FreeMemory over
// WriteNow; KeepLastUse combines with any of them.
enum {
  RK_Checkin_KeepLastUse = 1,  // not a use: last use time and bag position stay
  RK_Checkin_Discard = 2,      // remove from bag and sort directory afterwards
  RK_Checkin_FreeMemory = 4,   // free as much of the item's memory as possible afterwards
  RK_Checkin_WriteNow = 8,     // write to the disk cache at once, on the calling thread
};

// The bytes that describe an item in its cache file name.
using RK_HeaderBytes = plinth::utility::ByteVector;

// Builds an empty item of a subclass from its header bytes.
using RK_Factory = boost::function<boost::intrusive_ptr<RK_Stuff>(const RK_HeaderBytes&)>;
