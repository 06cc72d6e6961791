// RK_Stuff: the base class of everything the cache holds.
//
// The host derives one subclass per kind of result. An object of the
// subclass is both a cached item and, when built to describe what the host
// wants, a request: lookups ask cached items whether they are identical to a
// request or can satisfy it.
//
// Ownership: items are intrusively counted (boost::intrusive_ptr). The sort
// directory holds one reference per indexed item, each check-out holds one;
// the bag holds plain pointers. An item is destroyed by its last release.
//
// Threads: the fields below are guarded by the cache lock (RK_ScCacheLock).
// The check-out count and writeable flag are atomics, so the holder of a
// check-out and the ThrowIf checks may read them without the lock. Item
// virtuals are called with the cache lock held and may re-enter the cache.
#pragma once

#include <atomic>
#include <boost/date_time/posix_time/posix_time_types.hpp>
#include <boost/intrusive_ptr.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>
#include <cstdint>
#include <list>
#include <map>

#include "plinth/files.h"
#include "plinth/guid.h"
#include "plinth/refcounted.h"
#include "plinth/streams.h"
#include "rkcache/types.h"

// A bag's items, sorted by last use, oldest first; items with equal stamps
// stand in the order in which they were added. A list, so that moving a used
// item to the young end is a splice.
using RK_StuffByLastUse = std::list<RK_Stuff*>;

// The factory registry: match name (UTF-16, exact, case-sensitive) to factory.
using RK_FactoryMap = std::map<plinth::utility::SmallUString, RK_Factory>;

class RK_EXPORT RK_Stuff : public plinth::utility::RefCountedObject {
 public:
  // A new unique GUID, no check-outs, last use now, in no bag or directory.
  RK_Stuff();

  // ---- The virtual interface, in slot order (the destructor is slot 0). ----
  // Called on the cached item with the request as argument.
  virtual bool IdenticalRequest(const RK_Stuff* request) const;
  virtual bool CanSatisfyRequest(const RK_Stuff* request) const;
  virtual std::uint32_t GetSizeInBytes() = 0;
  // Drops the in-memory data; true if memory was freed.
  virtual bool FreeMemory() = 0;
  virtual bool IsInMemory() = 0;
  virtual bool CanDiskCache() const;
  virtual const char* GetSubclassMatchname() const;
  virtual void GetHeader(RK_HeaderBytes& header) const;
  virtual void Write(plinth::filesupport::OByteStream& stream) const;
  virtual void Read(plinth::filesupport::IByteStream& stream);
  virtual void YourDiskCacheFileWasDeleted() const;
  virtual bool IsOnDisk() const;

  // ---- Accessors (no lock; hold RK_ScCacheLock for a consistent view). ----
  plinth::utility::Guid GetGuid() const { return guid; }
  // Not while the item is in a sort directory: the GUID is its key there.
  void SetGuid(const plinth::utility::Guid& g);
  std::uint32_t GetCheckoutCount() const { return checkoutCount.load(std::memory_order_acquire); }
  bool IsCheckedOutWriteable() const { return checkedOutWriteable.load(std::memory_order_acquire); }
  boost::posix_time::ptime GetLastUseTime() const { return lastUseTime; }
  boost::shared_ptr<RK_Bag> GetBag() const { return bag.lock(); }
  boost::shared_ptr<RK_SortDir> GetSortDir() const { return sortDir.lock(); }
  // Marks the item as one that must not go to the disk cache. Irreversible.
  void SetNoDiskCache() { noDiskCache = true; }
  bool GetNoDiskCache() const { return noDiskCache; }
  // A copy of the item's cache file, or an empty file object if it has none.
  plinth::filesupport::File GetDiskCacheFile() const;

  // ---- Check-out and check-in. ----
  // REQUIRES: the caller holds a reference to the item.
  RK_CheckoutResult Checkout(int flags);
  // REQUIRES: the caller holds a check-out of the item (else 0x3A04 is thrown).
  void Checkin(int flags, const boost::posix_time::time_duration& cost);
  // REQUIRES: the caller holds the item's only, read-only check-out.
  void ConvertToWriteable();
  // Reads an on-disk item back; true if the data is in memory afterwards.
  bool EnsureInMemory();

  // ---- Entering and leaving the cache. ----
  // Enters the item into bag and into the global sort directory; may queue a
  // background disk write. REQUIRES: bag non-empty; between RK_Birth and RK_Death.
  void AddToBagAndSortDir(const boost::shared_ptr<RK_Bag>& bag,
                          const boost::posix_time::time_duration& computeTime);
  // Takes an item that is not checked out out of its sort directory and bag
  // and frees its memory; does nothing for a checked-out item.
  void RemoveFromBagAndSortDir();

  // ---- The subclass factory registry (no lock: register before scanning). ----
  static void RegisterFactory(const char* matchName, const RK_Factory& factory);
  static void Death();

 protected:
  virtual ~RK_Stuff();

  // Check-out state checks for the holder's code. Each reports on the main
  // thread and throws on failure (see errors.h).
  void ThrowIfCheckedOutLessThan(int n) const;  // 0x3A04, message 22
  void ThrowIfCheckedOutMoreThan(int n) const;  // 0x3A03, message 12
  void ThrowIfCheckedOutWriteable() const;      // 0x3A03, message 11

  static RK_FactoryMap* S_factory_funcsP;  // null until the first registration

 private:
  friend class RK_Bag;
  friend class RK_SortDir;
  friend class RK_ScCheckout;
  friend struct RK_GuidHash;
  friend class RK_TEST_Access;  // test hook, defined by the test suites only
  // Binds the private write job (diskcache/background_write.h).
  friend bool RKp_QueueBackgroundWrite(const boost::intrusive_ptr<RK_Stuff>& stuff);

  // Internal helpers without a test hook stay out of the exported interface.
  RK_INTERNAL void TempRemoveFromSortDir();
  bool FreeUpAsMuchAsPossible();
  bool WorthWritingToDiskCache(const boost::posix_time::time_duration& computeTime);
  static boost::intrusive_ptr<RK_Stuff> CreateSubclass(const char* matchName, const RK_HeaderBytes& header);

  // Disk cache I/O: reads the payload from the cache file; deletes the cache
  // file (un-charging its size); the body of a background write job.
  RK_INTERNAL void PrepAndRead();
  RK_INTERNAL void DeleteDiskCacheFile();
  RK_INTERNAL void WriteToDiskAsync(boost::intrusive_ptr<RK_Stuff> self);

  plinth::utility::Guid guid;                    // set before entering the cache
  std::size_t guidHash;                          // RK_GuidHash's value for guid, kept with it
  std::atomic<std::uint32_t> checkoutCount{0};   // written under the cache lock
  std::atomic<bool> checkedOutWriteable{false};  // written under the cache lock or by the sole holder
  boost::posix_time::ptime lastUseTime;          // cache lock; a bag keeps its list sorted by it
  boost::shared_ptr<plinth::filesupport::File> diskCacheFile;  // cache lock
  boost::weak_ptr<RK_Bag> bag;                                 // cache lock
  RK_StuffByLastUse::iterator bagPosition;                     // cache lock; meaningful while bag is set
  boost::weak_ptr<RK_SortDir> sortDir;                         // cache lock, or the sole writeable holder
  bool noDiskCache = false;
};
