// RK_ScCheckout: scoped receipts for check-outs.
//
// States of a receipt: empty (no item) -> holding (result 1) -> empty
// again, or -> released (result 0, item kept) after Release. Copies of a
// holding receipt share one Holding record; the receipt that brings its
// holder count to zero is the one that checks in, unless a copy released
// the check-out to its caller.
//
// References: a check-out holds one reference to its item (RK_Stuff::Checkout
// takes it, RK_Stuff::Checkin drops it). The receipts that share a check-out
// hold one reference fewer of their own than there are of them: one of their
// `stuff` pointers stands for the check-out's reference, so the hit path
// takes no second one. The pointers are interchangeable, so whichever
// receipt checks in hands its pointer to the check-in, and the others drop
// theirs. Release gives the check-out's reference to the caller and takes
// one for the receipts in its place.
#include "rkcache/receipt.h"

#include <atomic>
#include <boost/make_shared.hpp>
#include <utility>

#include "frame/globals.h"
#include "frame/report.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"

struct RK_ScCheckout::Holding {
  explicit Holding(int holders) : holders(holders) {}
  std::atomic<int> holders;           // receipts that still hold the check-out
  std::atomic<bool> released{false};  // one of them handed it to its caller
};

RK_ScCheckout::RK_ScCheckout() : result(RK_CheckoutResult_NotCheckedOut), wasOnDisk(false) {}

RK_ScCheckout::RK_ScCheckout(RK_Stuff* item, int flags) : RK_ScCheckout() {
  Checkout(item, flags);
}

RK_ScCheckout::RK_ScCheckout(const RK_ScCheckout& other)
    : stuff(other.stuff), result(RK_CheckoutResult_NotCheckedOut), wasOnDisk(other.wasOnDisk) {
  if (!other.Holds()) return;
  // The source is counted as a holder from the moment it is first copied.
  if (!other.holding) other.holding = boost::make_shared<Holding>(1);
  other.holding->holders.fetch_add(1, std::memory_order_relaxed);
  holding = other.holding;
  result = RK_CheckoutResult_CheckedOut;
}

RK_ScCheckout::RK_ScCheckout(RK_ScCheckout&& other) noexcept
    : stuff(std::move(other.stuff)),
      result(other.result),
      wasOnDisk(other.wasOnDisk),
      holding(std::move(other.holding)) {
  other.result = RK_CheckoutResult_NotCheckedOut;
  other.wasOnDisk = false;
}

RK_ScCheckout& RK_ScCheckout::operator=(const RK_ScCheckout& other) {
  // What this receipt held is let go by the temporary's destructor.
  RK_ScCheckout copy(other);
  Swap(copy);
  return *this;
}

RK_ScCheckout& RK_ScCheckout::operator=(RK_ScCheckout&& other) noexcept {
  RK_ScCheckout moved(std::move(other));
  Swap(moved);
  return *this;
}

RK_ScCheckout::~RK_ScCheckout() {
  RKp_Swallow([this] { LetGo(0, boost::posix_time::time_duration()); });
}

bool RK_ScCheckout::Holds() const {
  if (result == RK_CheckoutResult_NotCheckedOut) return false;
  return !holding || !holding->released.load(std::memory_order_acquire);
}

void RK_ScCheckout::LetGo(int flags, const boost::posix_time::time_duration& cost) {
  if (result == RK_CheckoutResult_NotCheckedOut) return;
  // The fields are cleared before the check-in: once it is called, the
  // check-out has ended, whether or not the check-in throws afterwards.
  boost::intrusive_ptr<RK_Stuff> item;
  item.swap(stuff);
  boost::shared_ptr<Holding> shared;
  shared.swap(holding);
  result = RK_CheckoutResult_NotCheckedOut;
  wasOnDisk = false;

  if (shared) {
    // acq_rel: the last holder sees a release flag set by any other copy.
    const bool last = shared->holders.fetch_sub(1, std::memory_order_acq_rel) == 1;
    if (!last || shared->released.load(std::memory_order_acquire)) return;
  }
  // The pointer stands for the check-out's reference, which the check-in drops.
  item.detach()->Checkin(flags, cost);
}

RK_CheckoutResult RK_ScCheckout::Checkout(RK_Stuff* item, int flags) {
  LetGo(0, boost::posix_time::time_duration());
  // Taken before the check-out, so it tells whether the item had to be read back.
  wasOnDisk = item->IsOnDisk();
  const RK_CheckoutResult r = item->Checkout(flags);
  if (r != RK_CheckoutResult_NotCheckedOut) {
    stuff.reset(item, false);  // adopts the check-out's reference
    result = r;
  }
  return r;
}

RK_CheckoutResult RK_ScCheckout::FindAndCheckout(RK_Stuff* request, int flags) {
  LetGo(0, boost::posix_time::time_duration());
  // The directory is used under the cache lock, which keeps the global one
  // alive without a reference of our own; the lookup takes it again.
  RK_ScCacheLock lock;
  RK_SortDir* const dir = RK_G_locked.sortDir;
  if (!dir) return RK_CheckoutResult_NotCheckedOut;
  RK_Stuff* found = nullptr;
  const RK_CheckoutResult r = dir->FindAndCheckout(request, flags, &found, &wasOnDisk);
  if (r != RK_CheckoutResult_NotCheckedOut) {
    stuff.reset(found, false);  // adopts the check-out's reference
    result = r;
  }
  return r;
}

void RK_ScCheckout::Checkin(int flags, const boost::posix_time::time_duration& cost) {
  LetGo(flags, cost);
}

void RK_ScCheckout::EnsureInMemory() {
  if (Holds() && !stuff->EnsureInMemory()) LetGo(0, boost::posix_time::time_duration());
}

bool RK_ScCheckout::IsInMemory() const {
  return Holds() && stuff->IsInMemory();
}

bool RK_ScCheckout::IsOnDisk() const {
  return (Holds() && stuff->IsOnDisk()) || wasOnDisk;
}

RK_Stuff* RK_ScCheckout::Release() {
  // The check-out's reference goes to the caller; the receipts keep one of
  // their own in its place (before the flag tells the other copies).
  if (Holds()) intrusive_ptr_add_ref(stuff.get());
  if (result != RK_CheckoutResult_NotCheckedOut && holding) {
    // The caller now owns the shared check-out: no copy may check it in.
    if (Holds()) holding->released.store(true, std::memory_order_release);
    holding->holders.fetch_sub(1, std::memory_order_acq_rel);
    holding.reset();
  }
  result = RK_CheckoutResult_NotCheckedOut;
  wasOnDisk = false;
  return stuff.get();
}

void RK_ScCheckout::Swap(RK_ScCheckout& other) noexcept {
  stuff.swap(other.stuff);
  std::swap(result, other.result);
  std::swap(wasOnDisk, other.wasOnDisk);
  holding.swap(other.holding);
}
