#include "plinth/streams.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "posix_util.h"

namespace plinth {
namespace filesupport {

using detail::NativePath;
using detail::ThrowSystemError;

ByteStream_base::~ByteStream_base() = default;

void IByteStream::ReadExactly(void* data, std::uint32_t size) {
  const std::uint32_t got = ReadBlock(data, size);
  if (got != size) {
    throw io_error(
        ustring(), 0,
        "unexpected end of stream: wanted " + std::to_string(size) + " bytes, got " + std::to_string(got));
  }
}

// ---------------------------------------------------------------------------

OPlatformByteStream::OPlatformByteStream(bool handleSuppliedLater, const File& file,
                                         utility::Flags<unsigned> flags)
    : file_(file) {
  if (handleSuppliedLater) return;
  const int mode = O_WRONLY | O_CREAT | O_CLOEXEC | (flags.Has(kStreamTruncate) ? O_TRUNC : 0);
  fd_ = ::open(NativePath(file_.FullPath()).c_str(), mode, 0666);
  if (fd_ < 0) ThrowSystemError("open for writing", file_.FullPath(), errno);
}

OPlatformByteStream::~OPlatformByteStream() {
  try {
    CloseHandle();
  } catch (const std::exception&) {
    // A destructor cannot report; callers that care call CloseHandle first.
  }
}

void OPlatformByteStream::SetPlatformHandle(int fd, bool dataSyncOnClose) {
  if (fd_ >= 0 && fd_ != fd) ::close(fd_);
  fd_ = fd;
  syncOnClose_ = dataSyncOnClose;
}

void OPlatformByteStream::CloseHandle() {
  if (fd_ < 0) return;
  const int fd = fd_;
  fd_ = -1;
  int syncError = 0;
  if (syncOnClose_ && ::fdatasync(fd) != 0) syncError = errno;
  // close() is not retried on EINTR: on Linux the descriptor is gone anyway.
  const int closeResult = ::close(fd);
  const int closeError = closeResult != 0 && errno != EINTR ? errno : 0;
  if (syncError != 0) ThrowSystemError("sync", file_.FullPath(), syncError);
  if (closeError != 0) ThrowSystemError("close", file_.FullPath(), closeError);
}

void OPlatformByteStream::Write(unsigned char byte) {
  WriteBlock(&byte, 1);
}

void OPlatformByteStream::WriteBlock(const void* data, std::uint32_t size) {
  if (fd_ < 0) ThrowSystemError("write", file_.FullPath(), EBADF);
  const auto* p = static_cast<const unsigned char*>(data);
  std::uint32_t left = size;
  while (left > 0) {
    const ssize_t n = ::write(fd_, p, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      ThrowSystemError("write", file_.FullPath(), errno);
    }
    if (n == 0) ThrowSystemError("write", file_.FullPath(), ENOSPC);
    p += n;
    left -= static_cast<std::uint32_t>(n);
  }
}

void OPlatformByteStream::CurPos(std::int64_t position) {
  if (::lseek(fd_, static_cast<off_t>(position), SEEK_SET) < 0)
    ThrowSystemError("seek", file_.FullPath(), errno);
}

std::int64_t OPlatformByteStream::CurPos() const {
  const off_t pos = ::lseek(fd_, 0, SEEK_CUR);
  if (pos < 0) ThrowSystemError("seek", file_.FullPath(), errno);
  return pos;
}

void OPlatformByteStream::OSFlush() {
  if (::fdatasync(fd_) != 0) ThrowSystemError("sync", file_.FullPath(), errno);
}

void OPlatformByteStream::Truncate(std::int64_t length) {
  if (::ftruncate(fd_, static_cast<off_t>(length)) != 0)
    ThrowSystemError("truncate", file_.FullPath(), errno);
}

std::int64_t OPlatformByteStream::Length() const {
  struct stat st;
  if (::fstat(fd_, &st) != 0) ThrowSystemError("stat", file_.FullPath(), errno);
  return st.st_size;
}

int OPlatformByteStream::GetPlatformHandle() const {
  return fd_;
}

// ---------------------------------------------------------------------------

IPlatformByteStream::IPlatformByteStream(const File& file, utility::Flags<unsigned> /*flags*/) : file_(file) {
  fd_ = ::open(NativePath(file_.FullPath()).c_str(), O_RDONLY | O_CLOEXEC);
  if (fd_ < 0) ThrowSystemError("open for reading", file_.FullPath(), errno);
}

IPlatformByteStream::~IPlatformByteStream() {
  if (fd_ >= 0) ::close(fd_);
}

unsigned char IPlatformByteStream::Read() {
  unsigned char byte = 0;
  if (ReadBlock(&byte, 1) != 1) {
    throw io_error(file_.FullPath(), 0,
                   "read past the end of '" + detail::PathForMessage(file_.FullPath()) + "'");
  }
  return byte;
}

std::uint32_t IPlatformByteStream::ReadBlock(void* data, std::uint32_t size) {
  auto* p = static_cast<unsigned char*>(data);
  std::uint32_t got = 0;
  while (got < size) {
    const ssize_t n = ::read(fd_, p + got, size - got);
    if (n < 0) {
      if (errno == EINTR) continue;
      ThrowSystemError("read", file_.FullPath(), errno);
    }
    if (n == 0) break;
    got += static_cast<std::uint32_t>(n);
  }
  return got;
}

std::int64_t IPlatformByteStream::Length() const {
  struct stat st;
  if (::fstat(fd_, &st) != 0) ThrowSystemError("stat", file_.FullPath(), errno);
  return st.st_size;
}

// ---------------------------------------------------------------------------

// The alignment argument matters only to sources that read unbuffered; the
// platform input stream reads through the OS cache, so any buffer will do.
IBufferedByteStream::IBufferedByteStream(IByteStream& source, std::uint32_t bufferSize,
                                         std::uint32_t /*alignment*/)
    : source_(source), buffer_(std::max<std::uint32_t>(bufferSize, 1)) {}

IBufferedByteStream::~IBufferedByteStream() = default;

bool IBufferedByteStream::Fill() {
  pos_ = 0;
  end_ = source_.ReadBlock(buffer_.data(), static_cast<std::uint32_t>(buffer_.size()));
  return end_ > 0;
}

unsigned char IBufferedByteStream::Read() {
  if (pos_ == end_ && !Fill()) throw io_error(ustring(), 0, "read past the end of a buffered stream");
  return buffer_[pos_++];
}

std::uint32_t IBufferedByteStream::ReadBlock(void* data, std::uint32_t size) {
  auto* out = static_cast<unsigned char*>(data);
  std::uint32_t got = 0;
  while (got < size) {
    if (pos_ == end_) {
      // A request at least as large as the buffer skips the copy.
      if (size - got >= buffer_.size()) {
        const std::uint32_t n = source_.ReadBlock(out + got, size - got);
        got += n;
        break;
      }
      if (!Fill()) break;
    }
    const std::size_t n = std::min<std::size_t>(end_ - pos_, size - got);
    std::memcpy(out + got, buffer_.data() + pos_, n);
    pos_ += n;
    got += static_cast<std::uint32_t>(n);
  }
  return got;
}

}  // namespace filesupport
}  // namespace plinth
