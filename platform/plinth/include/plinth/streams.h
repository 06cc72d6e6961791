// Byte streams over files.
//
// A stream belongs to one thread at a time. Failures throw
// plinth::filesupport::io_error / file_not_found_exception (files.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "plinth/export.h"
#include "plinth/files.h"
#include "plinth/types.h"

namespace plinth {
namespace filesupport {

class PLINTH_API ByteStream_base {
 public:
  virtual ~ByteStream_base();
};

class PLINTH_API OByteStream : public virtual ByteStream_base {
 public:
  virtual void Write(unsigned char byte) = 0;
  // Writes all `size` bytes or throws.
  virtual void WriteBlock(const void* data, std::uint32_t size) = 0;
};

class PLINTH_API IByteStream : public virtual ByteStream_base {
 public:
  // Throws io_error at the end of the stream.
  virtual unsigned char Read() = 0;
  // Reads up to `size` bytes; returns how many were read (fewer only at the end).
  virtual std::uint32_t ReadBlock(void* data, std::uint32_t size) = 0;
  // Reads exactly `size` bytes or throws io_error.
  void ReadExactly(void* data, std::uint32_t size);
};

// Flags for the platform streams.
inline constexpr unsigned kStreamRead = 1;      // IPlatformByteStream: open for reading
inline constexpr unsigned kStreamWrite = 1;     // OPlatformByteStream: open for writing
inline constexpr unsigned kStreamTruncate = 2;  // OPlatformByteStream: truncate on open

// An output stream on an operating-system file handle.
class PLINTH_API OPlatformByteStream : public OByteStream {
 public:
  // With handleSuppliedLater false the file is opened (created if missing)
  // for writing; with true the derived class opens it itself and passes the
  // handle through SetPlatformHandle.
  OPlatformByteStream(bool handleSuppliedLater, const File& file, utility::Flags<unsigned> flags);
  ~OPlatformByteStream() override;  // closes the handle (after a data sync if requested)

  void Write(unsigned char byte) override;
  void WriteBlock(const void* data, std::uint32_t size) override;
  virtual void CurPos(std::int64_t position);
  virtual std::int64_t CurPos() const;
  virtual void OSFlush();  // pushes written data to the device (fdatasync)
  virtual void Truncate(std::int64_t length);
  virtual std::int64_t Length() const;
  virtual int GetPlatformHandle() const;

  const File& GetFile() const { return file_; }

 protected:
  // Takes ownership of fd. With dataSyncOnClose the data is synced to the
  // device before the handle is closed.
  void SetPlatformHandle(int fd, bool dataSyncOnClose);
  // Closes the handle now; errors of the final sync or close throw io_error.
  void CloseHandle();

 private:
  File file_;
  int fd_ = -1;
  bool syncOnClose_ = false;
};

// An input stream on an operating-system file handle.
class PLINTH_API IPlatformByteStream : public IByteStream {
 public:
  IPlatformByteStream(const File& file, utility::Flags<unsigned> flags);
  ~IPlatformByteStream() override;
  unsigned char Read() override;
  std::uint32_t ReadBlock(void* data, std::uint32_t size) override;
  std::int64_t Length() const;

 private:
  File file_;
  int fd_ = -1;
};

// A buffered input stream over another input stream.
class PLINTH_API IBufferedByteStream : public IByteStream {
 public:
  // REQUIRES: source outlives this stream; bufferSize > 0.
  IBufferedByteStream(IByteStream& source, std::uint32_t bufferSize, std::uint32_t alignment);
  ~IBufferedByteStream() override;
  unsigned char Read() override;
  std::uint32_t ReadBlock(void* data, std::uint32_t size) override;

 private:
  bool Fill();
  IByteStream& source_;
  std::vector<unsigned char> buffer_;
  std::size_t pos_ = 0;
  std::size_t end_ = 0;
};

}  // namespace filesupport
}  // namespace plinth
