// RK_ScCheckout: the scoped receipt through which a host holds a check-out.
//
// A receipt belongs to one thread at a time and takes no lock of its own.
// Copy semantics: copies of a holding receipt share the one check-out; the
// last copy that still holds it checks it in (at destruction, reuse or
// Checkin). No check-out is ever checked in twice. A move transfers it.
#pragma once

#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/intrusive_ptr.hpp>
#include <boost/shared_ptr.hpp>

#include "rkcache/stuff.h"

class RK_EXPORT RK_ScCheckout {
 public:
  RK_ScCheckout();
  // Checks item out with flags; an exception of the check-out leaves the constructor.
  RK_ScCheckout(RK_Stuff* item, int flags);
  RK_ScCheckout(const RK_ScCheckout& other);
  RK_ScCheckout(RK_ScCheckout&& other) noexcept;
  RK_ScCheckout& operator=(const RK_ScCheckout& other);
  RK_ScCheckout& operator=(RK_ScCheckout&& other) noexcept;
  // Checks in a held check-out (flags 0); never lets an int or std::exception out.
  ~RK_ScCheckout();

  // Each first checks in what the receipt holds (flags 0).
  // REQUIRES (Checkout): the caller keeps item alive with its own reference.
  RK_CheckoutResult Checkout(RK_Stuff* item, int flags);
  RK_CheckoutResult FindAndCheckout(RK_Stuff* request, int flags);

  void Checkin(int flags, const boost::posix_time::time_duration& cost);
  // If the held item cannot be brought into memory, checks it in and empties the receipt.
  void EnsureInMemory();

  bool DidCheckout() const;
  RK_CheckoutResult GetResult() const;
  RK_Stuff* GetStuff() const { return stuff.get(); }
  bool IsInMemory() const;
  bool IsOnDisk() const;
  // Hands the check-out to the caller, who must check the item in with
  // RK_Stuff::Checkin; the receipt keeps only its reference to the item.
  RK_Stuff* Release();
  void Swap(RK_ScCheckout& other) noexcept;

 private:
  struct Holding;  // the shared check-out; see the copy semantics above

  boost::intrusive_ptr<RK_Stuff> stuff;  // the item last checked out through this receipt
  RK_CheckoutResult result;              // 1 while this receipt holds a check-out of stuff
  bool wasOnDisk;                        // the item was on disk when last tried
  boost::shared_ptr<Holding> holding;    // shared among copies that hold the same check-out
};
