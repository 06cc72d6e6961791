// RK_ScCheckout: the scoped receipt through which a host holds a check-out.
//
// A receipt remembers the item it last checked out (`GetStuff`, kept alive
// by a reference of the receipt's own), whether it holds a check-out of it
// now (`DidCheckout`), and whether the item was on disk when it was last
// tried (`IsOnDisk`). It checks a held item in when it is destroyed, when it
// checks out again, or when told to (`Checkin`).
//
// Copies: copies of a holding receipt share its one check-out; no second
// check-out is made. Each copy holds the check-out until it lets go of it
// (destruction, reuse, assignment, Checkin, a failed EnsureInMemory), and
// only the last copy that lets go checks the item in, with the flags of its
// own call; earlier ones just drop their share. Release hands the shared
// check-out to the caller once: every copy then holds nothing. A check-out is
// therefore never checked in twice. Assignment first lets go of what the
// target held (checking it in if it was the last holder) and then shares
// the source's check-out. A move transfers the check-out and leaves the
// source empty.
//
// Once a receipt has called RK_Stuff::Checkin for its check-out, it holds
// nothing any more, also when that check-in threw: the check-out has ended
// by then (see RK_Stuff::Checkin).
//
// Threads: a receipt belongs to one thread at a time and takes no lock of
// its own; copies may live on different threads. The check-outs and
// check-ins it forwards take the cache lock.
#pragma once

#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/intrusive_ptr.hpp>
#include <boost/shared_ptr.hpp>

#include "rkcache/stuff.h"

class RK_EXPORT RK_ScCheckout {
 public:
  RK_ScCheckout();
  // Checks item out with flags; an exception of the check-out leaves the constructor.
  // REQUIRES: the caller holds a reference to item.
  RK_ScCheckout(RK_Stuff* item, int flags);
  RK_ScCheckout(const RK_ScCheckout& other);
  RK_ScCheckout(RK_ScCheckout&& other) noexcept;
  RK_ScCheckout& operator=(const RK_ScCheckout& other);
  // The check-in of what the target held is made as by the destructor.
  RK_ScCheckout& operator=(RK_ScCheckout&& other) noexcept;
  // Checks in a held check-out (flags 0, zero cost); an int error is
  // dropped, a std::exception goes to the host's exception reporter.
  ~RK_ScCheckout();

  // Each first lets go of what the receipt holds (checking it in with flags
  // 0 if it was the last holder); errors of that check-in propagate.
  // REQUIRES (Checkout): the caller keeps item alive with its own reference.
  RK_CheckoutResult Checkout(RK_Stuff* item, int flags);
  // Looks the request up in the global sort directory (nothing is found
  // before RK_Birth and after RK_Death).
  RK_CheckoutResult FindAndCheckout(RK_Stuff* request, int flags);

  // Lets go of a held check-out, checking the item in with flags and cost
  // if this was the last holder; does nothing if nothing is held.
  void Checkin(int flags, const boost::posix_time::time_duration& cost);
  // If the held item cannot be brought into memory, lets go of it (flags 0).
  void EnsureInMemory();

  bool DidCheckout() const { return Holds(); }
  RK_CheckoutResult GetResult() const {
    return Holds() ? RK_CheckoutResult_CheckedOut : RK_CheckoutResult_NotCheckedOut;
  }
  // The item last checked out through this receipt, without a new reference;
  // may be set while nothing is held (after Release).
  RK_Stuff* GetStuff() const { return stuff.get(); }
  bool IsInMemory() const;
  // The held item is on disk, or the item was on disk when last tried.
  bool IsOnDisk() const;
  // Hands the check-out to the caller, who must check the item in with
  // RK_Stuff::Checkin if DidCheckout() was true; the receipt keeps only its
  // reference to the item. Returns the item (see GetStuff).
  RK_Stuff* Release();
  void Swap(RK_ScCheckout& other) noexcept;

 private:
  // The check-out shared by copies of a holding receipt: how many of them
  // still hold it, and whether one of them released it to its caller.
  struct Holding;

  bool Holds() const;
  // Ends this receipt's hold; the last holder checks the item in.
  void LetGo(int flags, const boost::posix_time::time_duration& cost);

  boost::intrusive_ptr<RK_Stuff> stuff;  // the item last checked out through this receipt
  RK_CheckoutResult result;              // 1 while this receipt holds (a share of) a check-out of stuff
  bool wasOnDisk;                        // the item was on disk when last tried
  // Created by the first copy of a holding receipt and shared by all copies
  // holding that check-out; empty while the receipt holds it alone. Mutable
  // because copying a receipt creates it in the source.
  mutable boost::shared_ptr<Holding> holding;
};
