// RK_SortDir: the index through which cached items are found again, grouped
// by GUID; within a group, items stand in the order they were added.
//
// Ownership: the directory holds one counted reference per indexed item; it
// is what keeps an item alive while nobody has it checked out. Must be owned
// by a boost::shared_ptr before items are added.
// Threads: operations take the cache lock themselves; GetLastChangeTime
// reads an atomic counter without it.
#pragma once

#include <atomic>
#include <boost/enable_shared_from_this.hpp>
#include <boost/intrusive_ptr.hpp>
#include <boost/unordered_set.hpp>
#include <cstddef>
#include <cstdint>

#include "host/hk.h"
#include "rkcache/stuff.h"

// An item's hash is boost::hash_range over the 16 bytes of its GUID
// (Guid::GuidToBytes). It is computed whenever the GUID is set and kept with
// it, so lookups do not recompute it.
struct RK_EXPORT RK_GuidHash {
  static std::size_t Of(const plinth::utility::Guid& guid);
  std::size_t operator()(const boost::intrusive_ptr<RK_Stuff>& stuff) const { return stuff->guidHash; }
};
struct RK_GuidEqual {
  bool operator()(const boost::intrusive_ptr<RK_Stuff>& a, const boost::intrusive_ptr<RK_Stuff>& b) const {
    return a->GetGuid() == b->GetGuid();
  }
};
using RK_StuffByGuid = boost::unordered_multiset<boost::intrusive_ptr<RK_Stuff>, RK_GuidHash, RK_GuidEqual>;

class RK_EXPORT RK_SortDir : public HK_MemTrackedObject, public boost::enable_shared_from_this<RK_SortDir> {
 public:
  RK_SortDir();
  // Releases the items it still indexes. Never throws.
  ~RK_SortDir();
  RK_SortDir(const RK_SortDir&) = delete;
  RK_SortDir& operator=(const RK_SortDir&) = delete;

  // Indexes the item at the end of its GUID's group, after dropping older
  // items of the group that the new one can stand in for.
  // REQUIRES: the item is not indexed already.
  void AddStuff(boost::intrusive_ptr<RK_Stuff> stuff);
  // Fails (verification 1381 or 1382, then 3 is thrown) if the item is not
  // in this directory or is checked out writeable.
  void RemoveStuff(RK_Stuff* stuff);
  // A counter that moves on every change of the index or of where an indexed
  // item's data lives. Despite the name, a count, not a time.
  std::int64_t GetLastChangeTime() const { return changeCount.load(); }

  // Finds an item of the request's GUID that is identical to the request,
  // else one that can satisfy it, and checks it out with `flags`, all under
  // one lock. On success *found is the item (the check-out holds its
  // reference). *wasOnDisk, if given, receives IsOnDisk() of each candidate
  // tried. REQUIRES: request non-null and held by the caller; found non-null.
  RK_CheckoutResult FindAndCheckout(const RK_Stuff* request, int flags, RK_Stuff** found, bool* wasOnDisk);

  // The number of indexed items (under the cache lock).
  std::size_t GetStuffCount() const;

 private:
  friend class RK_Stuff;
  friend class RK_TEST_Access;

  RK_StuffByGuid stuffByGuid;  // cache lock
  std::atomic<std::int64_t> changeCount{0};
};
