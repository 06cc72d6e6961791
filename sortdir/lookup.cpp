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
using Candidates = boost::container::small_vector<RK_Stuff*, 4>;

// The request as a lookup key without a reference of its own: hashing and
// equality look only at the GUID, and the caller holds a reference for the
// whole call. Detached, not released, on every way out.
class BorrowedKey {
 public:
  explicit BorrowedKey(const RK_Stuff* request) : key_(const_cast<RK_Stuff*>(request), false) {}
  ~BorrowedKey() { key_.detach(); }
  BorrowedKey(const BorrowedKey&) = delete;
  BorrowedKey& operator=(const BorrowedKey&) = delete;
  const boost::intrusive_ptr<RK_Stuff>& Get() const { return key_; }

 private:
  boost::intrusive_ptr<RK_Stuff> key_;
};

}  // namespace

RK_CheckoutResult RK_SortDir::FindAndCheckout(const RK_Stuff* request, int flags, RK_Stuff** found,
                                              bool* wasOnDisk) {
  RK_PROFILE_SCOPE(RKp_Profile_SortDirFindAndCheckout);
  RK_ScCacheLock lock;
  const BorrowedKey key(request);
  *found = nullptr;

  const auto range = stuffByGuid.equal_range(key.Get());
  if (range.first == range.second) return RK_CheckoutResult_NotCheckedOut;

  // The walk works on a copy of the group: asking or checking out a
  // candidate may change the directory (a failed read-back deletes a cache
  // file; item callbacks may re-enter the cache and add or drop items),
  // which would invalidate iterators. The copy holds plain pointers, valid
  // while the directory holds their items; every change to the directory
  // moves its change count, and then a candidate is offered only if it is
  // still an element of the group. That test compares addresses and never
  // touches a candidate that may have died.
  Candidates candidates;
  for (auto it = range.first; it != range.second; ++it) candidates.push_back(it->get());
  const std::int64_t startCount = changeCount.load(std::memory_order_relaxed);
  auto stillIndexed = [&](RK_Stuff* candidate) {
    if (changeCount.load(std::memory_order_relaxed) == startCount) return true;
    const auto now = stuffByGuid.equal_range(key.Get());
    for (auto it = now.first; it != now.second; ++it)
      if (it->get() == candidate) return true;
    return false;
  };

  for (int pass = 0; pass < 2; ++pass) {
    for (RK_Stuff* candidate : candidates) {
      if (!stillIndexed(candidate)) continue;
      const bool matches =
          pass == 0 ? candidate->IdenticalRequest(request) : candidate->CanSatisfyRequest(request);
      if (!matches) continue;
      if (wasOnDisk) *wasOnDisk = candidate->IsOnDisk();
      if (candidate->Checkout(flags) != RK_CheckoutResult_NotCheckedOut) {
        *found = candidate;
        return RK_CheckoutResult_CheckedOut;
      }
    }
  }
  return RK_CheckoutResult_NotCheckedOut;
}
