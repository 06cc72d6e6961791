// Files, folders, streams and the unbuffered-write layer, on a real file
// system: what the cache module relies on and the layer's safety rules.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <vector>

#include "plinth/files.h"
#include "plinth/native.h"
#include "plinth/streams.h"
#include "plinth/text.h"
#include "support/temp_dir.h"

namespace {

namespace fs = std::filesystem;
using namespace plinth::filesupport;
using plinth::utility::UTF16to8;
using plinth::utility::UTF8to16;

void WriteText(const std::string& path, const std::string& text) {
  std::ofstream(path, std::ios::binary) << text;
}

std::string ReadAll(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// What fn threw: the errno (-1 when nothing was thrown), the message, and
// whether it was the file-not-found kind.
struct Failure {
  int code = -1;
  std::string what;
  bool notFound = false;
};
template <class Fn>
Failure FailureOf(Fn&& fn) {
  try {
    fn();
  } catch (const io_error& e) {
    return {e.Code(), e.what(), dynamic_cast<const file_not_found_exception*>(&e) != nullptr};
  }
  return {};
}

TEST(PlinthFiles, RenameNeverReplacesAnExistingFile) {
  rktest::TempDir tmp;
  File f(tmp.AsDir(), u"01234567-aaaa.match.1A.hdr.vxcache.tmp");
  f.Create(true);
  WriteText(UTF16to8(f.FullPath()), "payload");
  File blocker(tmp.AsDir(), u"taken.vxcache");
  blocker.Create(true);

  File g = f;
  EXPECT_EQ(FailureOf([&] { g.Rename(u"taken.vxcache"); }).code, EEXIST);
  EXPECT_EQ(g, f);
  EXPECT_EQ(blocker.Size(0), 0u);
  g.Rename(u"final.vxcache");
  EXPECT_FALSE(f.Exists());
  EXPECT_EQ(ReadAll(UTF16to8(g.FullPath())), "payload");
}

TEST(PlinthFiles, DirDeleteRemovesContentsButNeverFollowsLinksOut) {
  rktest::TempDir tmp;
  const std::string base = tmp.Path();
  fs::create_directories(base + "/outside");
  WriteText(base + "/outside/keep.txt", "keep");
  const Dir cache(tmp.AsDir(), u"cache");
  Dir(Dir(cache, u"ab"), u"cd").Create();  // missing parents too
  WriteText(base + "/cache/ab/cd/f1", "x");
  fs::create_directory_symlink(base + "/outside", base + "/cache/ab/cd/deep-link");
  fs::create_symlink(base + "/outside/keep.txt", base + "/cache/file-link");
  fs::create_directory_symlink(base + "/outside", base + "/folder-link");

  cache.Delete();
  EXPECT_FALSE(fs::exists(fs::symlink_status(base + "/cache")));
  // A link in place of the folder itself is removed as a link.
  Dir(UTF8to16(base + "/folder-link")).Delete();
  EXPECT_FALSE(fs::exists(fs::symlink_status(base + "/folder-link")));
  EXPECT_EQ(ReadAll(base + "/outside/keep.txt"), "keep");
}

TEST(PlinthStreams, BufferedRoundTripAndTheErrorKindsReported) {
  rktest::TempDir tmp;
  const File f(tmp.AsDir(), u"stream.bin");
  std::vector<unsigned char> data(1000);
  for (std::size_t i = 0; i < data.size(); ++i) data[i] = static_cast<unsigned char>(i * 7 + 3);
  {
    OPlatformByteStream out(false, f, kStreamWrite | kStreamTruncate);
    out.WriteBlock(data.data(), 999);
    out.Write(data[999]);
    out.OSFlush();
  }
  {
    IPlatformByteStream raw(f, kStreamRead);
    IBufferedByteStream in(raw, 7, 4096);  // small buffer: reads cross its boundaries
    std::vector<unsigned char> back{in.Read()};
    for (std::uint32_t k = 0; back.size() < data.size(); ++k) {
      unsigned char chunk[20];
      const std::uint32_t n = in.ReadBlock(chunk, 1 + k * 5 % 20);
      ASSERT_GT(n, 0u);
      back.insert(back.end(), chunk, chunk + n);
    }
    EXPECT_EQ(back, data);
    EXPECT_THROW(in.Read(), io_error);
  }

  const Failure missing =
      FailureOf([&] { IPlatformByteStream(File(tmp.AsDir(), u"missing.bin"), kStreamRead); });
  EXPECT_TRUE(missing.notFound);
  EXPECT_EQ(missing.code, ENOENT);
  EXPECT_NE(missing.what.find("missing.bin"), std::string::npos) << missing.what;
  const Failure onFolder = FailureOf([&] { OPlatformByteStream(false, File(tmp.UPath()), kStreamWrite); });
  EXPECT_FALSE(onFolder.notFound);  // a folder is not a missing file
  EXPECT_EQ(onFolder.code, EISDIR);
  EXPECT_NE(onFolder.what.find("errno 21"), std::string::npos) << onFolder.what;
}

// Writes through the unbuffered handle, as the cache-file writer does.
class UnbufferedWriter : public OPlatformByteStream {
 public:
  explicit UnbufferedWriter(const File& file) : OPlatformByteStream(true, file, 1) {
    handle_ = plinth::native::OpenExistingForUnbufferedWrite(file.FullPath());
    SetPlatformHandle(handle_.fd, !handle_.direct);
  }
  bool Direct() const { return handle_.direct; }
  void Close() { CloseHandle(); }

 private:
  plinth::native::UnbufferedWriteHandle handle_;
};

// Writes `blocks` aligned blocks and checks the handle, the lock and the content.
void WriteAlignedBlocks(const File& f, std::size_t blockSize, int blocks, bool expectDirect) {
  void* buffer = plinth::native::AlignedAlloc(blockSize, blockSize);
  ASSERT_NE(buffer, nullptr);
  std::string expected;
  {
    UnbufferedWriter w(f);
    EXPECT_EQ(w.Direct(), expectDirect);
    const int fl = ::fcntl(w.GetPlatformHandle(), F_GETFL);
    EXPECT_EQ((fl & O_DIRECT) != 0, w.Direct());
    EXPECT_NE(fl & O_DSYNC, 0);
    // A second writer is refused while the first holds the file.
    EXPECT_EQ(FailureOf([&] { plinth::native::OpenExistingForUnbufferedWrite(f.FullPath()); }).code,
              EWOULDBLOCK);
    for (int b = 0; b < blocks; ++b) {
      std::memset(buffer, 'a' + b, blockSize);
      w.WriteBlock(buffer, static_cast<std::uint32_t>(blockSize));
      expected.append(blockSize, static_cast<char>('a' + b));
    }
    w.OSFlush();
    w.Close();
  }
  plinth::native::AlignedFree(buffer);
  EXPECT_EQ(ReadAll(UTF16to8(f.FullPath())), expected);
}

TEST(PlinthNative, UnbufferedWritesOnTheRealDisk) {
  rktest::TempDir tmp;
  // Callers fall back to 4096 when the size is unknown; a given one must be
  // a plausible power of two.
  std::uint32_t sector = 4096;
  if (plinth::native::GetVolumeSectorSize(tmp.UPath(), sector)) {
    EXPECT_GE(sector, 512u);
    EXPECT_LE(sector, 65536u);
    EXPECT_EQ(sector & (sector - 1), 0u);
  }

  const File f(tmp.AsDir(), u"data.vxcache.tmp");
  EXPECT_TRUE(FailureOf([&] { plinth::native::OpenExistingForUnbufferedWrite(f.FullPath()); }).notFound);
  EXPECT_FALSE(f.Exists());  // never created by the open
  f.Create(true);
  const int probe = ::open(UTF16to8(f.FullPath()).c_str(), O_WRONLY | O_DIRECT);
  if (probe < 0) GTEST_SKIP() << "the test folder's file system refuses O_DIRECT: " << std::strerror(errno);
  ::close(probe);
  WriteAlignedBlocks(f, std::max<std::size_t>(sector, 4096), 3, true);

  EXPECT_TRUE(plinth::native::MarkNotContentIndexed(f.FullPath()));
  char value[16] = {};
  const ssize_t n = ::getxattr(UTF16to8(f.FullPath()).c_str(), "user.xdg.robots.index", value, sizeof(value));
  EXPECT_EQ(std::string(value, n > 0 ? n : 0), "false");
  EXPECT_FALSE(plinth::native::MarkNotContentIndexed(tmp.UPath() + u"/missing"));
}

// A file system that refuses O_DIRECT gets a buffered, still synchronous handle.
TEST(PlinthNative, FallbackWhenDirectIOIsRefused) {
  rktest::TempDir tmp;
  const File f(tmp.AsDir(), u"fallback.bin");
  f.Create(true);
  plinth::native::TEST_SimulateDirectIORefusal(true);
  WriteAlignedBlocks(f, 4096, 2, false);
  plinth::native::TEST_SimulateDirectIORefusal(false);
}

}  // namespace
