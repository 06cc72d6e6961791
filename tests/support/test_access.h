// The declared test hook into the module's private state, which the module
// befriends.
#pragma once

#include <boost/intrusive_ptr.hpp>
#include <vector>

#include "rkcache/rkcache.h"

class RK_TEST_Access {
 public:
  static void ThrowIfCheckedOutLessThan(const RK_Stuff& s, int n) { s.ThrowIfCheckedOutLessThan(n); }
  static void ThrowIfCheckedOutMoreThan(const RK_Stuff& s, int n) { s.ThrowIfCheckedOutMoreThan(n); }
  static void ThrowIfCheckedOutWriteable(const RK_Stuff& s) { s.ThrowIfCheckedOutWriteable(); }
  static bool FreeUpAsMuchAsPossible(RK_Stuff& s) { return s.FreeUpAsMuchAsPossible(); }
  static bool WorthWritingToDiskCache(RK_Stuff& s, const boost::posix_time::time_duration& d) {
    return s.WorthWritingToDiskCache(d);
  }
  static boost::intrusive_ptr<RK_Stuff> CreateSubclass(const char* name, const RK_HeaderBytes& header) {
    return RK_Stuff::CreateSubclass(name, header);
  }
  static RK_FactoryMap* FactoryRegistry() { return RK_Stuff::S_factory_funcsP; }
  static void SetLastUseTime(RK_Stuff& s, const boost::posix_time::ptime& t) { s.lastUseTime = t; }
  static void SetCheckoutCount(RK_Stuff& s, std::uint32_t n) { s.checkoutCount.store(n); }
  static void SetCheckedOutWriteable(RK_Stuff& s, bool w) { s.checkedOutWriteable.store(w); }
  static void SetDiskCacheFile(RK_Stuff& s, boost::shared_ptr<plinth::filesupport::File> f) {
    s.diskCacheFile = std::move(f);
  }
  static boost::weak_ptr<RK_SortDir>& SortDirLink(RK_Stuff& s) { return s.sortDir; }
  static void AddStuffGuts(RK_Bag& b, boost::intrusive_ptr<RK_Stuff> s) { b.AddStuffGuts(std::move(s)); }
  static void RemoveStuffGuts(RK_Bag& b, RK_Stuff* s) { b.RemoveStuffGuts(s); }
  static std::uint32_t LockHoldCount(const RK_Bag& b) { return b.lockHoldCount; }
  static void SetDiskCacheSize(RK_Bag& b, std::int64_t size) { b.diskCacheSize = size; }
  // The bag's items, oldest first.
  static std::vector<RK_Stuff*> Order(const RK_Bag& b) {
    RK_ScCacheLock lock;
    return std::vector<RK_Stuff*>(b.stuffByLastUse.begin(), b.stuffByLastUse.end());
  }
  // The items of one GUID, in group order.
  static std::vector<RK_Stuff*> Group(const RK_SortDir& d, const RK_Stuff& key) {
    RK_ScCacheLock lock;
    std::vector<RK_Stuff*> out;
    boost::intrusive_ptr<RK_Stuff> k(const_cast<RK_Stuff*>(&key));
    auto range = d.stuffByGuid.equal_range(k);
    for (auto it = range.first; it != range.second; ++it) out.push_back(it->get());
    return out;
  }
};
