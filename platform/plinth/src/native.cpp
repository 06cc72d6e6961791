// POSIX stand-ins for the Windows calls behind unbuffered cache-file writes.
#include "plinth/native.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

#include "plinth/files.h"
#include "posix_util.h"

namespace plinth {
namespace native {

namespace {

std::atomic<bool> g_simulateDirectRefusal{false};

bool IsPowerOfTwo(std::uint64_t v) {
  return v != 0 && (v & (v - 1)) == 0;
}

bool ReadSysfsNumber(const std::string& path, std::uint32_t& value) {
  std::ifstream in(path);
  unsigned long v = 0;
  if (!(in >> v) || v == 0 || v > 0xFFFFFFFFul) return false;
  value = static_cast<std::uint32_t>(v);
  return true;
}

}  // namespace

void TEST_SimulateDirectIORefusal(bool refuse) {
  g_simulateDirectRefusal.store(refuse);
}

UnbufferedWriteHandle OpenExistingForUnbufferedWrite(const ustring& path) {
  const std::string native = detail::NativePath(path);
  // No O_CREAT: the writer creates the file exclusively beforehand and
  // must not resurrect one that was deleted meanwhile.
  UnbufferedWriteHandle handle;
  int fd = -1;
  if (!g_simulateDirectRefusal.load()) {
    fd = ::open(native.c_str(), O_WRONLY | O_DIRECT | O_DSYNC | O_CLOEXEC);
  } else {
    errno = EINVAL;
  }
  handle.direct = fd >= 0;
  if (fd < 0 && errno == EINVAL) {
    // The one place where a refused O_DIRECT (tmpfs and other file systems
    // without direct I/O) falls back to writing through the OS cache. O_DSYNC
    // still makes each write reach the device; the caller also syncs before
    // closing, as direct == false tells it to.
    fd = ::open(native.c_str(), O_WRONLY | O_DSYNC | O_CLOEXEC);
  }
  if (fd < 0) detail::ThrowSystemError("open for unbuffered writing", path, errno);
  // Exclusive, like a share mode of 0: a second writer is refused at once
  // rather than interleaving its blocks with ours.
  if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
    const int e = errno;
    ::close(fd);
    detail::ThrowSystemError("lock (held by another writer)", path, e);
  }
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  handle.fd = fd;
  return handle;
}

bool GetVolumeSectorSize(const ustring& volumePath, std::uint32_t& sectorSize) {
  std::string native;
  try {
    native = detail::NativePath(volumePath);
  } catch (const std::exception&) {
    return false;
  }
#ifdef STATX_DIOALIGN
  struct statx sx;
  if (::statx(AT_FDCWD, native.c_str(), 0, STATX_DIOALIGN, &sx) == 0 && (sx.stx_mask & STATX_DIOALIGN) != 0 &&
      IsPowerOfTwo(sx.stx_dio_offset_align)) {
    sectorSize = sx.stx_dio_offset_align;
    return true;
  }
#endif
  // Without the direct-I/O alignment from the kernel, the logical block
  // size of the device that holds the volume; a partition keeps its queue
  // limits in its parent device's folder.
  struct stat st;
  if (::stat(native.c_str(), &st) != 0) return false;
  const std::string dev =
      "/sys/dev/block/" + std::to_string(major(st.st_dev)) + ":" + std::to_string(minor(st.st_dev));
  std::uint32_t value = 0;
  if ((ReadSysfsNumber(dev + "/queue/logical_block_size", value) ||
       ReadSysfsNumber(dev + "/../queue/logical_block_size", value)) &&
      IsPowerOfTwo(value)) {
    sectorSize = value;
    return true;
  }
  return false;
}

bool MarkNotContentIndexed(const ustring& path) {
  // Linux has no "not content indexed" attribute; the nearest honest thing
  // is the freedesktop extended attribute that desktop indexers honour.
  // File systems without user extended attributes refuse it: false then.
  static const char kName[] = "user.xdg.robots.index";
  static const char kValue[] = "false";
  try {
    return ::setxattr(detail::NativePath(path).c_str(), kName, kValue, sizeof(kValue) - 1, 0) == 0;
  } catch (const std::exception&) {
    return false;
  }
}

void* AlignedAlloc(std::size_t size, std::size_t alignment) {
  if (!IsPowerOfTwo(alignment)) return nullptr;
  if (alignment < sizeof(void*)) alignment = sizeof(void*);
  void* p = nullptr;
  if (::posix_memalign(&p, alignment, size == 0 ? 1 : size) != 0) return nullptr;
  return p;
}

void AlignedFree(void* p) {
  std::free(p);
}

}  // namespace native
}  // namespace plinth
