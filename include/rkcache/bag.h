// RK_Bag: the memory cache proper. Every item the cache knows, in memory, on
// disk or both, ordered by last use (oldest first): the order in which
// clearing, reclamation and size reporting walk the items.
//
// Ownership: the bag holds plain pointers; the sort directory and the
// check-outs hold the references that keep items alive. Every bag must be
// owned by a boost::shared_ptr before items are added (items keep a weak
// reference to their bag).
// Threads: operations take the cache lock themselves unless marked; the lock
// is recursive, so they may be called from item callbacks.
#pragma once

#include <atomic>
#include <boost/enable_shared_from_this.hpp>
#include <boost/intrusive_ptr.hpp>
#include <cstddef>
#include <cstdint>

#include "host/hk.h"
#include "plinth/files.h"
#include "rkcache/stuff.h"

class RK_EXPORT RK_Bag : public HK_MemTrackedObject, public boost::enable_shared_from_this<RK_Bag> {
 public:
  enum FreeUpResult {
    FreeUpResult_NothingFreed = 0,  // the memory statistic did not drop
    FreeUpResult_FreedSome = 1,     // it dropped, by no more than asked
    FreeUpResult_FreedEnough = 2,   // it dropped by more than asked
  };

  RK_Bag();
  // Releases the items it still holds (they stay indexed in their sort
  // directory and no longer name a bag). Never throws.
  virtual ~RK_Bag();
  // Memberwise copy of the element pointers and settings; takes no lock and
  // tells no item (they keep naming the bag they are in).
  RK_Bag& operator=(const RK_Bag& other);

  // Stamps the item's last use with now and enters it.
  // Fails (verification 380, then 3 is thrown) if the item is in a bag already.
  void AddStuff(boost::intrusive_ptr<RK_Stuff> stuff);
  // Fails (verification 402, then 3 is thrown) if the item is not in this bag.
  void RemoveStuff(RK_Stuff* stuff);
  // Takes every item that is not checked out out of this bag and its sort directory.
  void ClearBagAndSortDir();

  void EnableDiskCache(bool enable) { diskCacheEnabled.store(enable); }
  bool IsDiskCacheEnabled() const { return diskCacheEnabled.load(); }
  std::uint32_t GetAppVersion() const { return appVersion; }

  // Frees memory, least recently used first, until memory statistic 6 has
  // dropped by more than `wanted`: first the memory of items also on disk,
  // then items that live in memory only. A call made while the calling
  // thread holds the cache lock frees nothing.
  FreeUpResult FreeUpSomeMemory(std::uint64_t wanted);
  // Frees the memory of every item that is not checked out; drops those that
  // are then neither in memory nor on disk.
  void PurgeAllMemoryCaches();

  // Sums of GetSizeInBytes() of the items in memory and of those on disk.
  void GetCacheSizesInBytes(std::uint64_t& memoryBytes, std::uint64_t& diskBytes) const;
  // The size of the cache files charged to this bag.
  std::int64_t GetCurrentDiskCacheSize() const;

  // The number of items in the bag (under the cache lock).
  std::size_t GetStuffCount() const;

 private:
  friend class RK_Stuff;
  friend class RK_ScCacheLock;
  friend class RK_SortDir;  // its destructor releases items from their bag
  friend class RK_TEST_Access;

  // The same as AddStuff / RemoveStuff without taking the lock and (for
  // AddStuffGuts) without stamping: the item goes behind every item stamped
  // no later than it. REQUIRES: the cache lock is held.
  void AddStuffGuts(boost::intrusive_ptr<RK_Stuff> stuff);
  void RemoveStuffGuts(RK_Stuff* stuff);
  // Stamps an item of this bag as used at `now` and moves it to the young
  // end. REQUIRES: the cache lock is held; the item is in this bag.
  void MarkUsed(RK_Stuff* stuff, const boost::posix_time::ptime& now);
  // `now`, or the latest stamp given at the young end if later (see bag.cpp).
  // REQUIRES: the cache lock is held.
  boost::posix_time::ptime StampFor(const boost::posix_time::ptime& now) const;

  RK_StuffByLastUse stuffByLastUse;  // cache lock
  // The latest stamp an item took at the young end; kept here so that a
  // use reads no other item. Cache lock.
  boost::posix_time::ptime youngestStamp{boost::posix_time::min_date_time};
  std::uint32_t lockHoldCount = 0;            // cache lock (raised by RK_ScCacheLock)
  std::atomic<bool> diskCacheEnabled{false};  // atomic: read without the lock
  plinth::filesupport::Dir diskCacheDir;      // written by the configuring thread
  plinth::ustring diskCacheRootPath;          // written by the configuring thread
  std::int64_t diskCacheSizeLimit = 0;        // bytes
  std::int64_t diskCacheSize = 0;             // bytes; cache lock
  std::uint32_t appVersion = 0;               // bit 31 always clear
};
