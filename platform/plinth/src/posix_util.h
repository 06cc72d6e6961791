// Helpers shared by the POSIX implementation files: path conversion at the
// system-call boundary and the construction of io_error values.
#pragma once

#include <string>

#include "plinth/files.h"
#include "plinth/types.h"

namespace plinth {
namespace detail {

// The UTF-8 spelling of a UTF-16 path, as the system calls want it. Throws
// std::invalid_argument for ill-formed UTF-16.
std::string NativePath(const ustring& path);

// UTF-8 for messages: never throws, replaces what cannot be converted.
std::string PathForMessage(const ustring& path);

// The error for a failed system call `op` on path with errno `code`:
// file_not_found_exception for ENOENT and ENOTDIR, io_error otherwise.
[[noreturn]] void ThrowSystemError(const char* op, const ustring& path, int code);

}  // namespace detail
}  // namespace plinth
