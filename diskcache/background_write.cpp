// Background disk writes: submitting the write job and the job's body.
//
// A job holds a counted reference to its item, so the item outlives the
// queue. A job that finds writes suspended by a purge, the executor gone or
// cancelled, or the item out of every sort directory does nothing.
#include "diskcache/background_write.h"

#include <boost/bind/bind.hpp>

#include "frame/globals.h"
#include "rkcache/bag.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

bool RKp_QueueBackgroundWrite(const boost::intrusive_ptr<RK_Stuff>& stuff) {
  const auto executor = RKp_BackgroundExecutor();
  if (!executor) return false;
  executor->Submit(boost::bind(&RK_Stuff::WriteToDiskAsync, stuff.get(), stuff), 0);
  return true;
}

void RK_Stuff::WriteToDiskAsync(boost::intrusive_ptr<RK_Stuff> self) {
  const boost::shared_ptr<RK_SortDir> dir = GetSortDir();
  if (RK_G_writesSuspended.load() != 0) return;
  const auto executor = RKp_BackgroundExecutor();
  if (!executor || executor->IsCancelled()) return;
  if (!dir) return;
  const boost::shared_ptr<RK_Bag> owner = GetBag();
  if (!owner || !owner->IsDiskCacheEnabled()) return;

  // The step the cache file writer completes: under the cache lock, make
  // room for GetSizeInBytes() bytes among files of less recently used items
  // and check the item out read-only if its data is still in memory; then
  // write its cache file outside the lock and check it in keeping its last
  // use. Until that writer is part of the module, an eligible item is left
  // as it is: nothing is written and no size is charged.
  (void)self;
}
