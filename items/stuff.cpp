// RK_Stuff: construction, destruction, the base class's virtual answers, the
// bag's ordering and the check-out state checks.
//
// An item's states: free (in no bag, or in bag and sort directory with no
// check-out), checked out read-only (checkoutCount >= 1), checked out
// writeable (checkoutCount == 1, out of its sort directory), on disk only
// (diskCacheFile set, memory freed), and dropped while still held (in no bag
// or sort directory, alive through a host or check-out reference).
// Invariants: checkedOutWriteable implies checkoutCount == 1; each check-out
// holds one reference, so a checked-out item is never destroyed.
#include "rkcache/stuff.h"

#include "frame/report.h"
#include "rkcache/bag.h"
#include "rkcache/errors.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"

RK_Stuff::RK_Stuff()
    : guid(plinth::utility::Guid::CreateUnique()), guidHash(RK_GuidHash::Of(guid)), lastUseTime(RK_Now()) {}

void RK_Stuff::SetGuid(const plinth::utility::Guid& g) {
  guid = g;
  guidHash = RK_GuidHash::Of(g);
}

// Only the last release gets here. The sort directory holds a reference while
// it indexes the item, so it cannot still name it; but a bag holds plain
// pointers, and an item a host put into a bag directly (RK_Bag::AddStuff,
// without a directory) may die while the bag still lists it. It leaves the
// bag here, so the bag never names a dead item. Items that left their bag
// before (the usual case) take no lock. The cache file stays on disk.
RK_Stuff::~RK_Stuff() {
  if (bag.expired()) return;
  try {
    RK_ScCacheLock lock;
    if (const boost::shared_ptr<RK_Bag> owner = bag.lock()) owner->RemoveStuffGuts(this);
  } catch (...) {
    // Cannot happen (the link names the bag); a destructor must not throw.
  }
}

bool RK_Stuff::IdenticalRequest(const RK_Stuff*) const {
  return true;
}

bool RK_Stuff::CanSatisfyRequest(const RK_Stuff*) const {
  return true;
}

bool RK_Stuff::CanDiskCache() const {
  return false;
}

const char* RK_Stuff::GetSubclassMatchname() const {
  return nullptr;
}

void RK_Stuff::GetHeader(RK_HeaderBytes&) const {}

void RK_Stuff::Write(plinth::filesupport::OByteStream&) const {}

void RK_Stuff::Read(plinth::filesupport::IByteStream&) {}

void RK_Stuff::YourDiskCacheFileWasDeleted() const {}

bool RK_Stuff::IsOnDisk() const {
  return static_cast<bool>(diskCacheFile);
}

// The checks read the count without the lock: they run on the thread that
// holds (or should hold) the check-out, whose own count cannot change under it.
// The comparisons are unsigned, so a negative n turns into a huge bound.
void RK_Stuff::ThrowIfCheckedOutLessThan(int n) const {
  if (GetCheckoutCount() < static_cast<std::uint32_t>(n)) RKp_ThrowUserError(RK_ModuleErrorNotCheckedOut, 22);
}

void RK_Stuff::ThrowIfCheckedOutMoreThan(int n) const {
  if (GetCheckoutCount() > static_cast<std::uint32_t>(n)) RKp_ThrowUserError(RK_ModuleErrorCheckout, 12);
}

void RK_Stuff::ThrowIfCheckedOutWriteable() const {
  if (IsCheckedOutWriteable()) RKp_ThrowUserError(RK_ModuleErrorCheckout, 11);
}
