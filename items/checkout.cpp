// Check-out and check-in of an item.
//
// The states of one item and how it moves between them:
//
//   free (count 0) --Checkout(read-only)--> checked out read-only (count n >= 1)
//   free --Checkout(writeable)--> checked out writeable (count 1, out of its
//        sort directory, `sortDir` still naming it so check-in can put it back)
//   read-only, count 1 --ConvertToWriteable--> writeable (cache file deleted)
//   any checked-out state --Checkin--> one check-out fewer; the last check-in
//        of a writeable check-out puts the item back into its directory
//   on disk only (not in memory, has a cache file): a read-only check-out
//        reads it back while it holds the cache lock
//
// Invariants, all under the cache lock:
//   checkedOutWriteable implies checkoutCount == 1;
//   an item checked out writeable is in no sort directory;
//   every outstanding check-out holds one reference to the item, so a
//   checked-out item is never destroyed.
#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <cassert>
#include <exception>

#include "diskcache/background_write.h"
#include "frame/globals.h"
#include "frame/profile.h"
#include "frame/report.h"
#include "frame/trace.h"
#include "rkcache/bag.h"
#include "rkcache/errors.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

namespace {

// Message indexes of the module's table used here.
constexpr int kMsgCheckedOutWriteable = 11;   // "cached item already checked-out read/write"
constexpr int kMsgAlreadyCheckedOut = 12;     // "cannot check-out read/write already checked-out item"
constexpr int kMsgNotCheckedOut = 19;         // "cannot reference an ID which is not checked out"
constexpr int kMsgConvertNotCheckedOut = 22;  // "can't convert to writeable when not checked out"

}  // namespace

RK_CheckoutResult RK_Stuff::Checkout(int flags) {
  // Opened before the lock, so that time spent waiting for it is measured.
  RK_PROFILE_SCOPE(RKp_Profile_StuffCheckout);
  RK_ScCacheLock lock;

  if (checkedOutWriteable.load(std::memory_order_relaxed))
    RKp_ThrowUserError(RK_ModuleErrorCheckout, kMsgCheckedOutWriteable);
  const bool writeable = (flags & RK_Checkout_ReadOnly) == 0;
  const std::uint32_t count = checkoutCount.load(std::memory_order_relaxed);
  if (writeable && count > 0) RKp_ThrowUserError(RK_ModuleErrorCheckout, kMsgAlreadyCheckedOut);

  const bool inMemory = IsInMemory();
  if ((flags & RK_Checkout_OnlyIfInMemory) && !inMemory) return RK_CheckoutResult_NotCheckedOut;

  // From here on, any failure takes the count off again. The check-out's
  // reference is taken at once: taking the item out of its directory drops
  // the directory's reference, which may be the only other one.
  checkoutCount.store(count + 1, std::memory_order_release);
  intrusive_ptr_add_ref(this);
  bool ok = false;
  try {
    if (!writeable && !inMemory && (flags & RK_Checkout_DontRead) == 0 && IsOnDisk()) {
      // The read-back runs under the cache lock: the item cannot be evicted
      // or changed while its data arrives. A failed read fails the check-out
      // whatever the other flags say.
      ok = EnsureInMemory();
    } else {
      ok = inMemory || (flags & RK_Checkout_EvenIfNotInMemory) ||
           ((flags & RK_Checkout_DontRead) && IsOnDisk());
    }
    // A writeable check-out leaves the directory only once it is sure to
    // succeed: one that fails its final test never disturbs the directory,
    // so the item stays where lookups find it.
    if (ok && writeable) TempRemoveFromSortDir();
  } catch (...) {
    checkoutCount.store(checkoutCount.load(std::memory_order_relaxed) - 1, std::memory_order_release);
    intrusive_ptr_release(this);
    throw;
  }
  if (!ok) {
    checkoutCount.store(checkoutCount.load(std::memory_order_relaxed) - 1, std::memory_order_release);
    intrusive_ptr_release(this);
    return RK_CheckoutResult_NotCheckedOut;
  }
  checkedOutWriteable.store(writeable, std::memory_order_release);
  return RK_CheckoutResult_CheckedOut;
}

void RK_Stuff::TempRemoveFromSortDir() {
  boost::shared_ptr<RK_SortDir> dir = GetSortDir();
  if (!dir) return;
  dir->RemoveStuff(this);
  // RemoveStuff cleared the link; it keeps naming the directory while the
  // item is out of it, so that check-in knows where to put it back.
  sortDir = dir;
}

void RK_Stuff::ConvertToWriteable() {
  // Checked and changed under the lock: otherwise another thread could check
  // the item out between the count test and the change.
  RK_ScCacheLock lock;
  if (checkedOutWriteable.load(std::memory_order_relaxed))
    RKp_ThrowUserError(RK_ModuleErrorCheckout, kMsgCheckedOutWriteable);
  const std::uint32_t count = checkoutCount.load(std::memory_order_relaxed);
  if (count >= 2) RKp_ThrowUserError(RK_ModuleErrorCheckout, kMsgAlreadyCheckedOut);
  if (count == 0) RKp_ThrowUserError(RK_ModuleErrorNotCheckedOut, kMsgConvertNotCheckedOut);

  TempRemoveFromSortDir();
  // Marked writeable before the cache file goes: should the deletion's
  // notification throw, the item is already a consistent writeable check-out
  // whose check-in puts it back into its directory.
  checkedOutWriteable.store(true, std::memory_order_release);
  // The copy on disk is about to become stale.
  DeleteDiskCacheFile();
}

bool RK_Stuff::EnsureInMemory() {
  if (!IsInMemory() && IsOnDisk()) {
    // Reading back runs away from the user's action: the host shows no
    // message for what fails inside, and a failure only leaves the item out
    // of memory.
    RKp_ScQuietErrors quiet;
    RKp_Swallow([this] {
      RK_TRACE("RK_Stuff", 10, "RK_Stuff::EnsureInMemory", "pre-prep");
      PrepAndRead();
      RK_TRACE("RK_Stuff", 10, "RK_Stuff::EnsureInMemory", "post-prep");
    });
  }
  return IsInMemory();
}

void RK_Stuff::Checkin(int flags, const boost::posix_time::time_duration& cost) {
  RK_PROFILE_SCOPE(RKp_Profile_StuffCheckin);

  // The clock is read before the lock so that the locked section stays
  // short. Should it fail, the check-out still ends and the error is passed
  // on afterwards, with the item left at its old place in the bag.
  const bool restamp = (flags & RK_Checkin_KeepLastUse) == 0;
  boost::posix_time::ptime now;
  std::exception_ptr clockError;
  if (restamp) {
    try {
      now = RK_Now();
    } catch (...) {
      clockError = std::current_exception();
    }
  }

  // Adopts the check-out's reference, so it is dropped last, when nothing
  // here touches the item any more.
  boost::intrusive_ptr<RK_Stuff> checkoutRef;
  bool wasWriteable = false;
  {
    RK_ScCacheLock lock;
    const std::uint32_t count = checkoutCount.load(std::memory_order_relaxed);
    if (count == 0) RKp_ThrowUserError(RK_ModuleErrorNotCheckedOut, kMsgNotCheckedOut);
    checkoutRef.reset(this, false);
    wasWriteable = checkedOutWriteable.load(std::memory_order_relaxed);
    assert(!wasWriteable || count == 1);
    checkedOutWriteable.store(false, std::memory_order_release);
    checkoutCount.store(count - 1, std::memory_order_release);

    if (restamp && !clockError) {
      boost::shared_ptr<RK_Bag> keep;
      if (RK_Bag* owner = RKp_BagUnderLock(bag, keep)) {
        // The item's own link names the bag, so the membership checks of a
        // remove-and-add could not fail; the bag moves it directly.
        owner->MarkUsed(this, now);
      } else {
        lastUseTime = now;
      }
    }

    if (wasWriteable) {
      // Put back under the same lock that ends the check-out: a lookup must
      // never find the item in its directory while it is still marked
      // writeable (it would take that for a conflict).
      if (boost::shared_ptr<RK_SortDir> dir = sortDir.lock()) {
        sortDir.reset();
        try {
          dir->AddStuff(checkoutRef);
        } catch (...) {
          // Not back in the directory, so not in the bag either: the item
          // must be in both or in neither.
          if (boost::shared_ptr<RK_Bag> owner = bag.lock()) owner->RemoveStuffGuts(this);
          throw;
        }
      }
    }
  }
  if (clockError) std::rethrow_exception(clockError);

  if (flags & RK_Checkin_Discard) {
    RemoveFromBagAndSortDir();
    return;
  }
  if (flags & RK_Checkin_FreeMemory) {
    RK_ScCacheLock lock;
    FreeUpAsMuchAsPossible();
    return;
  }
  // Only new data (a writeable check-out) or an explicit request is worth a
  // disk write; a read-only check-in never starts one. Decided outside the
  // lock.
  const bool writeNow = (flags & RK_Checkin_WriteNow) != 0;
  if (!writeNow && !wasWriteable) return;
  if (!IsInMemory() || !CanDiskCache()) return;
  if (writeNow) {
    RK_DeprioritizeBackgroundWrites();
    WriteToDiskAsync(checkoutRef);
    return;
  }
  const boost::shared_ptr<RK_Bag> owner = GetBag();
  if (owner && owner->IsDiskCacheEnabled() && WorthWritingToDiskCache(cost))
    RKp_QueueBackgroundWrite(checkoutRef);
}
