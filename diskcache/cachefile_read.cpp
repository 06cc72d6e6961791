// Reading an item's payload back from its cache file.
//
// Runs on the thread that checks the item out, usually while that thread
// holds the cache lock (so the item cannot change while its data arrives);
// it takes no lock for the read itself. A failed read deletes the cache
// file: a file that cannot be read back is worth nothing.
#include <exception>

#include "diskcache/pacing.h"
#include "frame/globals.h"
#include "frame/profile.h"
#include "frame/trace.h"
#include "plinth/files.h"
#include "plinth/streams.h"
#include "rkcache/lifecycle.h"
#include "rkcache/sortdir.h"
#include "rkcache/stuff.h"

namespace {

constexpr std::uint32_t kReadBufferBytes = 2097152;  // one buffered stream of 2 MiB per read
constexpr std::uint32_t kReadBufferAlignment = 4096;

}  // namespace

void RK_Stuff::PrepAndRead() {
  RK_PROFILE_SCOPE(RKp_Profile_StuffPrepAndRead);

  // The file object is shared: a copy of the link keeps it alive even if
  // another thread deletes the item's cache file meanwhile.
  boost::shared_ptr<plinth::filesupport::File> file;
  {
    RK_ScCacheLock lock;
    file = diskCacheFile;
  }
  // A subclass may claim to be on disk without holding a file: there is
  // nothing to read then, and the item simply stays out of memory.
  if (!file) return;

  const boost::posix_time::ptime start = RK_Now();
  int code = 0;
  try {
    // A check-out is waiting for this data: background writes give way.
    RK_DeprioritizeBackgroundWrites();
    RK_TRACE("RK_Stuff", 10, "RK_Stuff::PrepAndRead", "pre-timestamp");
    // The modification time records the use, so the disk cache's own
    // housekeeping sees the file as recent; failing to touch it is harmless.
    try {
      plinth::utility::FileUtils::UpdateFileModifiedTime(file->FullPath());
    } catch (...) {
    }
    RK_TRACE("RK_Stuff", 10, "RK_Stuff::PrepAndRead", "post-timestamp");

    plinth::filesupport::IPlatformByteStream raw(*file, plinth::filesupport::kStreamRead);
    plinth::filesupport::IBufferedByteStream buffered(raw, kReadBufferBytes, kReadBufferAlignment);
    Read(buffered);

    if (const boost::shared_ptr<RK_SortDir> dir = RK_GlobalSortDir()) dir->changeCount.fetch_add(1);

    const std::uint32_t bytes = GetSizeInBytes();
    const double seconds = (RK_Now() - start).total_milliseconds() / 1000.0;
    RKp_OfferDiskSpeedSample(false, bytes, seconds);
  } catch (int thrown) {
    code = thrown;
  } catch (const std::exception& e) {
    code = HK_TranslateAndReportException(e);
  }
  if (code != 0) {
    DeleteDiskCacheFile();
    throw code;
  }
}
