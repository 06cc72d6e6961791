// Entering a new item: into a bag and the global sort directory, both or
// neither, then possibly a background disk write.
#include <boost/date_time/posix_time/posix_time_types.hpp>

#include "diskcache/background_write.h"
#include "frame/globals.h"
#include "rkcache/bag.h"
#include "rkcache/errors.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

void RK_Stuff::AddToBagAndSortDir(const boost::shared_ptr<RK_Bag>& bagArg,
                                  const boost::posix_time::time_duration& computeTime) {
  RK_ScCacheLock lock;
  const boost::intrusive_ptr<RK_Stuff> self(this);
  const boost::shared_ptr<RK_Bag> target(bagArg);

  target->AddStuff(self);
  try {
    const boost::shared_ptr<RK_SortDir> dir = RK_GlobalSortDir();
    // Outside RK_Birth..RK_Death there is no directory to enter.
    if (!dir) throw static_cast<int>(RK_InternalErrorCode);
    dir->AddStuff(self);
  } catch (...) {
    // In both or in neither: undo the bag entry, and let the original
    // failure through even if the undo fails as well.
    try {
      target->RemoveStuff(this);
    } catch (...) {
    }
    throw;
  }

  // Background write decision, cheapest and most decisive tests first.
  if (!RKp_BackgroundExecutor()) return;
  if (computeTime.total_milliseconds() <= 0) return;
  if (!WorthWritingToDiskCache(computeTime)) return;
  if (!(IsInMemory() && CanDiskCache())) return;
  const boost::shared_ptr<RK_Bag> current = GetBag();
  if (!current || !current->IsDiskCacheEnabled()) return;
  RKp_QueueBackgroundWrite(self);
}
