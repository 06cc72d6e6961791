// The operating-system calls behind unbuffered cache-file writes, in one
// place per OS.
#pragma once

#include <cstddef>
#include <cstdint>

#include "plinth/export.h"
#include "plinth/types.h"

namespace plinth {
namespace native {

struct UnbufferedWriteHandle {
  int fd = -1;
  // True when the handle bypasses the OS file cache (O_DIRECT). False when
  // the file system refused that: the handle then writes through the cache
  // and the caller must sync the data before closing.
  bool direct = false;
};

// Opens an existing file for unbuffered, write-through, sequential,
// exclusive writing. Throws filesupport::file_not_found_exception when the
// file or its folder is missing, filesupport::io_error for other failures.
PLINTH_API UnbufferedWriteHandle OpenExistingForUnbufferedWrite(const ustring& path);

// Test control: while on, every open behaves as on a file system that
// refuses O_DIRECT, so the fallback can be exercised on any disk.
PLINTH_API void TEST_SimulateDirectIORefusal(bool refuse);

// The direct-I/O alignment (the logical sector size) of the volume mounted
// at (or holding) volumePath; false when it cannot be determined.
PLINTH_API bool GetVolumeSectorSize(const ustring& volumePath, std::uint32_t& sectorSize);

// Marks a file as not to be indexed by desktop search. Returns false where
// the file system cannot record the mark.
PLINTH_API bool MarkNotContentIndexed(const ustring& path);

// Memory aligned to `alignment` (a power of two); null on failure.
PLINTH_API void* AlignedAlloc(std::size_t size, std::size_t alignment);
PLINTH_API void AlignedFree(void* p);

}  // namespace native
}  // namespace plinth
