// Cache size reporting: what the bag's items hold, by where their data
// lives, and the running size of the disk cache.
#include <cstdint>

#include "frame/profile.h"
#include "rkcache/bag.h"
#include "rkcache/lifecycle.h"
#include "rkcache/stuff.h"

void RK_Bag::GetCacheSizesInBytes(std::uint64_t& memoryBytes, std::uint64_t& diskBytes) const {
  RK_PROFILE_SCOPE(RKp_Profile_BagGetCacheSizes);
  // Accumulated in the caller's variables: if an item throws, they hold the
  // totals so far.
  memoryBytes = 0;
  diskBytes = 0;
  RK_ScCacheLock lock;
  for (RK_Stuff* stuff : stuffByLastUse) {
    const std::uint64_t size = stuff->GetSizeInBytes();
    if (stuff->IsInMemory()) memoryBytes += size;
    if (stuff->IsOnDisk()) diskBytes += size;
  }
}

std::int64_t RK_Bag::GetCurrentDiskCacheSize() const {
  RK_ScCacheLock lock;
  return diskCacheSize;
}
