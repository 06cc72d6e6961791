// Lookup and check-out by request: the cache hit path.
//
// Only the request GUID's group is examined, at most twice: first for an
// item identical to the request, then for one that can satisfy it. Finding
// and checking out happen under one hold of the cache lock, so the chosen
// item cannot be evicted or changed in between.
#include <boost/container/small_vector.hpp>

#include "frame/globals.h"
#include "frame/profile.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

namespace {

// Groups are small (usually one item); larger ones spill to the heap.
using Candidates = boost::container::small_vector<boost::intrusive_ptr<RK_Stuff>, 4>;

}  // namespace

RK_CheckoutResult RK_SortDir::FindAndCheckout(const RK_Stuff* request, int flags, RK_Stuff** found,
                                              bool* wasOnDisk) {
  RK_PROFILE_SCOPE(RKp_Profile_SortDirFindAndCheckout);
  RK_ScCacheLock lock;
  // The call's own reference to the request, which is also the lookup key:
  // hashing and equality look only at the GUID. Released before the lock.
  const boost::intrusive_ptr<RK_Stuff> key(const_cast<RK_Stuff*>(request));
  *found = nullptr;

  const auto range = stuffByGuid.equal_range(key);
  if (range.first == range.second) return RK_CheckoutResult_NotCheckedOut;

  // The walk works on a copy of the group: checking a candidate out may
  // change the directory (a failed read-back deletes a cache file; item
  // callbacks may re-enter the cache and add or drop items), which would
  // invalidate iterators.
  // The references keep every candidate alive until the walk is over.
  const Candidates candidates(range.first, range.second);
  const std::int64_t startCount = changeCount.load(std::memory_order_relaxed);

  // A candidate that left this directory during the walk is not offered.
  // Only worth asking once the directory has changed at all.
  auto stillIndexed = [&](RK_Stuff* candidate) {
    if (changeCount.load(std::memory_order_relaxed) == startCount) return true;
    return candidate->sortDir.lock().get() == this && !candidate->IsCheckedOutWriteable();
  };

  for (int pass = 0; pass < 2; ++pass) {
    for (const boost::intrusive_ptr<RK_Stuff>& candidate : candidates) {
      if (!stillIndexed(candidate.get())) continue;
      const bool matches =
          pass == 0 ? candidate->IdenticalRequest(request) : candidate->CanSatisfyRequest(request);
      if (!matches) continue;
      if (wasOnDisk) *wasOnDisk = candidate->IsOnDisk();
      if (candidate->Checkout(flags) != RK_CheckoutResult_NotCheckedOut) {
        *found = candidate.get();
        return RK_CheckoutResult_CheckedOut;
      }
    }
  }
  return RK_CheckoutResult_NotCheckedOut;
}
