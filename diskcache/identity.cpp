// Cache file identity and deletion.
//
// An item has a cache file exactly while its `diskCacheFile` is set. The
// bag that holds the item carries the file's padded size in its
// `diskCacheSize`; deleting the file takes that size off again. Both the
// link and the total are guarded by the cache lock.
#include <exception>

#include "frame/globals.h"
#include "rkcache/bag.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

plinth::filesupport::File RK_Stuff::GetDiskCacheFile() const {
  RK_ScCacheLock lock;
  // A subclass may answer IsOnDisk() from state of its own; only a file the
  // item actually holds can be handed out.
  if (IsOnDisk() && diskCacheFile) return *diskCacheFile;
  return plinth::filesupport::File();
}

void RK_Stuff::DeleteDiskCacheFile() {
  // The link is tested under the lock: writers set it under the lock from
  // other threads (background writes, the scan), so an unlocked test would
  // be a data race.
  RK_ScCacheLock lock;
  if (!diskCacheFile) return;

  if (const boost::shared_ptr<RK_Bag> owner = GetBag()) {
    // A size that cannot be measured is not un-charged; the file goes anyway.
    try {
      owner->diskCacheSize -= static_cast<std::int64_t>(diskCacheFile->Size(0));
    } catch (const std::exception&) {
    } catch (int) {
    }
  }
  // A file that cannot be deleted stays behind with no owner; the item
  // loses its copy either way.
  try {
    diskCacheFile->Delete();
  } catch (const std::exception&) {
  } catch (int) {
  }
  diskCacheFile.reset();

  // Only the main thread tells the item: subclasses update user-visible
  // state from this notification.
  if (HK_IsOnMainThread()) YourDiskCacheFileWasDeleted();

  if (const boost::shared_ptr<RK_SortDir> dir = RK_GlobalSortDir()) dir->changeCount.fetch_add(1);
}
