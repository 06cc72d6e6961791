// RK_SortDir: the GUID index.
//
// Items of one GUID form a group; a new item goes to the end of its group,
// so lookups try older items first. The container keeps a group together
// but, left to itself, puts a new equivalent element right after the
// group's first one; inserting with the group's last element as the hint
// appends instead. Every operation touches only the item's own group.
//
// An indexed item's `sortDir` names this directory. A writeable check-out
// takes the item out while its link keeps naming the directory; check-in
// enters it again through AddStuff.
#include "rkcache/sortdir.h"

#include <boost/container/small_vector.hpp>
#include <boost/functional/hash.hpp>
#include <exception>
#include <utility>

#include "frame/globals.h"
#include "frame/profile.h"
#include "frame/report.h"
#include "rkcache/errors.h"
#include "rkcache/lifecycle.h"

std::size_t RK_GuidHash::Of(const plinth::utility::Guid& guid) {
  const std::array<unsigned char, 16> bytes = guid.GuidToBytes();
  return boost::hash_range(bytes.begin(), bytes.end());
}

namespace {

// True when `link` was obtained from the same owner as `self`, also after
// both have expired (as in the owner's destructor).
bool SameOwner(const boost::weak_ptr<RK_SortDir>& link, const boost::weak_ptr<RK_SortDir>& self) {
  return !link.owner_before(self) && !self.owner_before(link);
}

}  // namespace

RK_SortDir::RK_SortDir() {
  stuffByGuid.max_load_factor(1.0f);
}

RK_SortDir::~RK_SortDir() {
  // The per-item RemoveStuff would fail its first check for every item (our
  // weak self-reference has expired), so the elements are released directly.
  // An item the directory releases for good also leaves its bag: the bag
  // holds a plain pointer and must not outlive the item's last reference.
  try {
    RK_ScCacheLock lock;
    const boost::weak_ptr<RK_SortDir> self = weak_from_this();
    for (const boost::intrusive_ptr<RK_Stuff>& stuff : stuffByGuid) {
      if (SameOwner(stuff->sortDir, self)) stuff->sortDir.reset();
      if (boost::shared_ptr<RK_Bag> bag = stuff->bag.lock()) {
        RKp_Swallow([&] { bag->RemoveStuffGuts(stuff.get()); });
      }
    }
    stuffByGuid.clear();
  } catch (int) {
  } catch (const std::exception& e) {
    HK_TranslateAndReportException(e);
  } catch (...) {
  }
}

void RK_SortDir::AddStuff(boost::intrusive_ptr<RK_Stuff> stuff) {
  RK_PROFILE_SCOPE(RKp_Profile_SortDirAddStuff);
  RK_ScCacheLock lock;

  // Supersede older items of the group that the new one can stand in for.
  // The group is copied first: dropping an item runs its callbacks, which
  // may change the directory, and the copy keeps every candidate alive.
  auto range = stuffByGuid.equal_range(stuff);
  if (range.first != range.second) {
    boost::container::small_vector<boost::intrusive_ptr<RK_Stuff>, 4> group(range.first, range.second);
    for (const boost::intrusive_ptr<RK_Stuff>& existing : group) {
      // A callback of an earlier drop may have taken it out already.
      if (existing->sortDir.lock().get() != this) continue;
      const bool holdsData = existing->IsInMemory() || existing->IsOnDisk();
      if (holdsData && !stuff->CanSatisfyRequest(existing.get())) continue;
      if (existing->GetCheckoutCount() == 0) {
        existing->RemoveFromBagAndSortDir();
        continue;
      }
      // Checked out: its holders keep it, but it leaves bag and index now,
      // so its check-in will not put it back.
      if (boost::shared_ptr<RK_Bag> bag = existing->bag.lock()) bag->RemoveStuff(existing.get());
      existing->sortDir.reset();
      auto now = stuffByGuid.equal_range(existing);
      for (auto it = now.first; it != now.second; ++it) {
        if (it->get() == existing.get()) {
          stuffByGuid.erase(it);
          break;
        }
      }
    }
  }

  // Append at the end of the group: hint with its current last element.
  range = stuffByGuid.equal_range(stuff);
  if (range.first == range.second) {
    stuffByGuid.insert(stuff);
  } else {
    auto last = range.first;
    for (auto it = range.first; it != range.second; ++it) last = it;
    stuffByGuid.insert(last, stuff);
  }
  stuff->sortDir = weak_from_this();
  changeCount.fetch_add(1);
}

void RK_SortDir::RemoveStuff(RK_Stuff* stuff) {
  RK_PROFILE_SCOPE(RKp_Profile_SortDirRemoveStuff);
  // The reference is taken before the guard so that, if it is the last one,
  // the item dies after the lock is released.
  boost::intrusive_ptr<RK_Stuff> keep(stuff);
  // The checks read the item's link, which other threads write under the
  // lock; they run under it too (the callers usually hold it already).
  RK_ScCacheLock lock;
  if (stuff->sortDir.lock().get() != this) RKp_FailVerification(1381, "stuff not in the right sortdir");
  if (stuff->IsCheckedOutWriteable())
    RKp_FailVerification(1382, "can't remove a writeable stuff from sortdir");

  stuff->sortDir.reset();
  auto range = stuffByGuid.equal_range(keep);
  for (auto it = range.first; it != range.second; ++it) {
    if (it->get() == stuff) {
      stuffByGuid.erase(it);
      break;
    }
  }
  changeCount.fetch_add(1);
}

std::size_t RK_SortDir::GetStuffCount() const {
  RK_ScCacheLock lock;
  return stuffByGuid.size();
}
