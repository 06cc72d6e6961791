// Files, folders, file utilities, streams and the unbuffered-write layer,
// on a real file system.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <boost/date_time/posix_time/posix_time.hpp>
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
namespace pt = boost::posix_time;
using namespace plinth::filesupport;
using plinth::utility::FileUtils;
using plinth::utility::UTF16to8;
using plinth::utility::UTF8to16;
using Names = std::vector<std::string>;

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
  plinth::ustring path;
  bool notFound = false;
};
template <class Fn>
Failure FailureOf(Fn&& fn) {
  try {
    fn();
  } catch (const io_error& e) {
    return {e.Code(), e.what(), e.Path(), dynamic_cast<const file_not_found_exception*>(&e) != nullptr};
  }
  return {};
}

Names SubdirNames(const Dir& d, const boost::function<bool()>& cancel = {},
                  const plinth::ustring& pattern = {}) {
  Names names;
  for (auto it = d.BeginSubdirs(false, cancel, pattern); it != d.EndSubdirs(); ++it)
    names.push_back(UTF16to8(it->GetName()));
  return names;
}

// Paths below `base` of the files a recursive listing of `d` yields.
Names FilesBelow(const std::string& base, const Dir& d, const boost::function<bool()>& cancel = {},
                 const plinth::ustring& pattern = {}) {
  Names found;
  for (RecursiveFileIterator it(d, false, cancel, pattern), end; it != end; ++it)
    found.push_back(UTF16to8(it->FullPath()).substr(base.size()));
  return found;
}

TEST(PlinthFiles, FileNamesCreateRenameDelete) {
  rktest::TempDir tmp;
  const Dir dir = tmp.AsDir();
  File f(dir, u"01234567-aaaa.match.1A.hdr.vxcache.tmp");
  EXPECT_EQ(f.GetName(), u"01234567-aaaa.match.1A.hdr.vxcache.tmp");
  EXPECT_EQ(f.GetExtension(true), u".tmp");
  EXPECT_EQ(f.GetExtension(false), u"tmp");
  EXPECT_EQ(File(dir, u"noextension").GetExtension(true), u"");
  EXPECT_EQ(f.GetParent(), dir);
  EXPECT_EQ(f.FullPath(), tmp.UPath() + u"/01234567-aaaa.match.1A.hdr.vxcache.tmp");

  EXPECT_FALSE(f.Exists());
  f.Create(true);
  EXPECT_TRUE(f.Exists());
  const Failure again = FailureOf([&] { f.Create(true); });
  EXPECT_EQ(again.code, EEXIST);
  EXPECT_EQ(again.path, f.FullPath());
  EXPECT_NE(again.what.find("vxcache.tmp"), std::string::npos) << again.what;
  WriteText(UTF16to8(f.FullPath()), "12345");
  EXPECT_EQ(f.Size(0), 5u);
  f.Create(false);  // not exclusive: leaves an empty file
  EXPECT_EQ(f.Size(0), 0u);
  WriteText(UTF16to8(f.FullPath()), "payload");

  // Rename never replaces an existing file, and stays within the folder.
  File blocker(dir, u"taken.vxcache");
  blocker.Create(true);
  File g = f;
  EXPECT_EQ(FailureOf([&] { g.Rename(u"taken.vxcache"); }).code, EEXIST);
  EXPECT_EQ(g, f);
  EXPECT_EQ(blocker.Size(0), 0u);
  EXPECT_NE(FailureOf([&] { g.Rename(u"../escape"); }).code, -1);
  g.Rename(u"final.vxcache");
  EXPECT_EQ(g.GetName(), u"final.vxcache");
  EXPECT_FALSE(f.Exists());
  EXPECT_EQ(ReadAll(UTF16to8(g.FullPath())), "payload");

  g.Delete();
  EXPECT_FALSE(g.Exists());
  const Failure gone = FailureOf([&] { g.Delete(); });
  EXPECT_TRUE(gone.notFound);
  EXPECT_EQ(gone.code, ENOENT);
  EXPECT_TRUE(FailureOf([&] { File(dir, u"missing").Size(0); }).notFound);
  EXPECT_TRUE(FailureOf([&] { File(dir, u"no-folder/x").Create(true); }).notFound);
  Dir(dir, u"sub").Create();
  EXPECT_FALSE(File(dir, u"sub").Exists());  // a folder is not a file
}

TEST(PlinthFiles, CreatedIsTheBirthTimeWhereRecordedElseModified) {
  rktest::TempDir tmp;
  const pt::ptime before = pt::microsec_clock::universal_time() - pt::seconds(2);
  File f(tmp.AsDir(), u"born");
  f.Create(true);
  const pt::ptime after = pt::microsec_clock::universal_time() + pt::seconds(2);

  // Move the modification time far back; a birth time does not move.
  const std::string native = UTF16to8(f.FullPath());
  const struct timespec old[2] = {{978307200, 0}, {978307200, 0}};  // 2001-01-01
  ASSERT_EQ(::utimensat(AT_FDCWD, native.c_str(), old, 0), 0);
  EXPECT_EQ(f.Modified(), pt::ptime(boost::gregorian::date(2001, 1, 1)));
  struct statx sx;
  ASSERT_EQ(::statx(AT_FDCWD, native.c_str(), 0, STATX_BTIME, &sx), 0);
  if ((sx.stx_mask & STATX_BTIME) != 0) {
    EXPECT_GE(f.Created(), before);
    EXPECT_LE(f.Created(), after);
  } else {
    EXPECT_EQ(f.Created(), f.Modified());
  }

  FileUtils::UpdateFileModifiedTime(f.FullPath());
  EXPECT_GE(f.Modified(), before);
  EXPECT_LE(f.Modified(), after);
  EXPECT_TRUE(FailureOf([&] { FileUtils::UpdateFileModifiedTime(tmp.UPath() + u"/missing"); }).notFound);
  EXPECT_TRUE(FailureOf([&] { File(tmp.AsDir(), u"missing").Created(); }).notFound);
}

TEST(PlinthFiles, DirDeleteRemovesContentsButNeverFollowsLinksOut) {
  rktest::TempDir tmp;
  const std::string base = tmp.Path();
  fs::create_directories(base + "/outside");
  WriteText(base + "/outside/keep.txt", "keep");
  const Dir cache(tmp.AsDir(), u"cache");
  const Dir deep(Dir(cache, u"ab"), u"cd");
  deep.Create();  // missing parents too
  EXPECT_TRUE(deep.Exists());
  WriteText(base + "/cache/ab/cd/f1", "x");
  WriteText(base + "/cache/f2", "y");
  fs::create_directory_symlink(base + "/outside", base + "/cache/link-to-outside");
  fs::create_directory_symlink(base + "/outside", base + "/cache/ab/cd/deep-link");
  fs::create_symlink(base + "/outside/keep.txt", base + "/cache/file-link");
  fs::create_directory_symlink(base + "/outside", base + "/folder-link");

  cache.Delete();
  EXPECT_FALSE(fs::exists(fs::symlink_status(base + "/cache")));
  // A link in place of the folder itself is removed as a link.
  Dir(UTF8to16(base + "/folder-link")).Delete();
  EXPECT_FALSE(fs::exists(fs::symlink_status(base + "/folder-link")));
  EXPECT_EQ(ReadAll(base + "/outside/keep.txt"), "keep");

  EXPECT_TRUE(FailureOf([&] { Dir(tmp.UPath() + u"/never-made").Delete(); }).notFound);
  cache.Create();  // re-creation after delete, twice is fine
  cache.Create();
  EXPECT_TRUE(cache.Exists());
}

TEST(PlinthFiles, DirPathsAndSubfolderIteration) {
  rktest::TempDir tmp;
  const Dir root = tmp.AsDir();
  EXPECT_EQ(Dir(tmp.UPath() + u"/"), root);  // no trailing separator
  EXPECT_EQ(Dir(root, u"x/../y", false), Dir(root, u"y"));
  EXPECT_EQ(Dir(root, u"y", true), Dir(root, u"y", false));
  EXPECT_EQ(Dir(root, u"y").GetName(), u"y");
  EXPECT_EQ(Dir(root, u"y").GetParent(), root);

  for (const char16_t* n : {u"9.1", u"10.0", u"1.0", u"10.0-beta"}) Dir(root, n).Create();
  WriteText(tmp.Path() + "/a-file", "");
  fs::create_directory_symlink(tmp.Path() + "/1.0", tmp.Path() + "/0-link");
  EXPECT_EQ(SubdirNames(root), (Names{"1.0", "10.0", "10.0-beta", "9.1"}));
  EXPECT_EQ(SubdirNames(root, {}, u"10."), (Names{"10.0", "10.0-beta"}));

  // A snapshot: deleting while iterating neither skips nor breaks.
  int visited = 0;
  for (auto it = root.BeginSubdirs(); it != root.EndSubdirs(); ++it, ++visited) it->Delete();
  EXPECT_EQ(visited, 4);
  EXPECT_TRUE(SubdirNames(root).empty());
  EXPECT_TRUE(SubdirNames(Dir(root, u"missing")).empty());
  EXPECT_THROW(root.BeginSubdirs(true), std::invalid_argument);

  const Dir two(root, u"two");
  for (const char16_t* n : {u"a", u"b"}) Dir(two, n).Create();
  int calls = 0;
  EXPECT_EQ(SubdirNames(two, [&calls] { return ++calls > 1; }).size(), 1u);  // cancelled after one entry
}

TEST(PlinthFiles, RecursiveFileIteratorListsEveryFileBelowWithoutLinks) {
  rktest::TempDir tmp;
  const std::string base = tmp.Path();
  fs::create_directories(base + "/cache/ab");
  fs::create_directories(base + "/cache/cd/ef");
  fs::create_directories(base + "/outside");
  for (const char* p : {"/cache/top.vxcache", "/cache/ab/one.vxcache", "/cache/ab/one.vxcache.tmp",
                        "/cache/cd/ef/two.VXCACHE", "/outside/foreign.vxcache"}) {
    WriteText(base + p, "z");
  }
  fs::create_directory_symlink(base + "/outside", base + "/cache/link");
  fs::create_symlink(base + "/outside/foreign.vxcache", base + "/cache/file-link.vxcache");

  const Dir cache(UTF8to16(base + "/cache"));
  const Names all = FilesBelow(base, cache);
  EXPECT_EQ(all, (Names{"/cache/ab/one.vxcache", "/cache/ab/one.vxcache.tmp", "/cache/cd/ef/two.VXCACHE",
                        "/cache/top.vxcache"}));
  EXPECT_EQ(FilesBelow(base, cache, {}, u".tmp"), Names{"/cache/ab/one.vxcache.tmp"});
  EXPECT_TRUE(FilesBelow(base, Dir(UTF8to16(base + "/none"))).empty());
  // Cancel is polled during the walk: true from the start lists nothing,
  // true after a few polls cuts the listing short.
  EXPECT_TRUE(FilesBelow(base, cache, [] { return true; }).empty());
  int polls = 0;
  EXPECT_LT(FilesBelow(base, cache, [&polls] { return ++polls > 3; }).size(), all.size());
}

TEST(PlinthFiles, FileUtilsVolumeSpaceNamesAndFolders) {
  rktest::TempDir tmp;
  struct statvfs before, after;
  ASSERT_EQ(::statvfs(tmp.Path().c_str(), &before), 0);
  const std::uint64_t free = FileUtils::GetVolumeFreeSpace(tmp.UPath());
  ASSERT_EQ(::statvfs(tmp.Path().c_str(), &after), 0);
  const std::uint64_t a = std::uint64_t(before.f_bavail) * before.f_frsize;
  const std::uint64_t b = std::uint64_t(after.f_bavail) * after.f_frsize;
  EXPECT_GT(free, 0u);
  EXPECT_GE(free, std::min(a, b));
  EXPECT_LE(free, std::max(a, b));
  EXPECT_TRUE(FailureOf([&] { FileUtils::GetVolumeFreeSpace(tmp.UPath() + u"/missing"); }).notFound);

  // The volume path is the mount point: same device as the folder, and its
  // parent (if any) on another device.
  const std::string volume = UTF16to8(FileUtils::GetVolumePath(tmp.UPath() + u"/not/yet/there"));
  struct stat folderSt, volumeSt, parentSt;
  ASSERT_EQ(::stat(tmp.Path().c_str(), &folderSt), 0);
  ASSERT_EQ(::stat(volume.c_str(), &volumeSt), 0);
  EXPECT_EQ(folderSt.st_dev, volumeSt.st_dev);
  if (volume != "/") {
    ASSERT_EQ(::stat(fs::path(volume).parent_path().c_str(), &parentSt), 0);
    EXPECT_NE(parentSt.st_dev, volumeSt.st_dev) << volume;
  }
  EXPECT_EQ(tmp.Path().rfind(volume, 0), 0u) << volume;

  EXPECT_EQ(FileUtils::ReplaceIllegalFileNameCharacters(u"WS<07>:\"a/b\\c|d?e*\x01\x1f\u00e9 ok.-", u'-'),
            u"WS-07---a-b-c-d-e---\u00e9 ok.-");

  EXPECT_TRUE(FileUtils::EnsureDirectoryExists(tmp.UPath() + u"/p/q/r"));
  EXPECT_TRUE(Dir(tmp.UPath() + u"/p/q/r").Exists());
  EXPECT_TRUE(FileUtils::EnsureDirectoryExists(tmp.UPath() + u"/p/q/r"));
  WriteText(tmp.Path() + "/plain", "");
  EXPECT_FALSE(FileUtils::EnsureDirectoryExists(tmp.UPath() + u"/plain/sub"));
}

TEST(PlinthStreams, WriteReadBufferedAcrossBoundariesAndErrors) {
  rktest::TempDir tmp;
  const File f(tmp.AsDir(), u"stream.bin");
  std::vector<unsigned char> data(1000);
  for (std::size_t i = 0; i < data.size(); ++i) data[i] = static_cast<unsigned char>(i * 7 + 3);
  {
    OPlatformByteStream out(false, f, kStreamWrite | kStreamTruncate);
    out.WriteBlock(data.data(), 999);
    out.Write(data[999]);
    EXPECT_EQ(out.CurPos(), 1000);
    EXPECT_EQ(out.Length(), 1000);
    out.OSFlush();
  }
  {
    IPlatformByteStream raw(f, kStreamRead);
    EXPECT_EQ(raw.Length(), 1000);
    IBufferedByteStream in(raw, 7, 4096);  // small buffer: every read crosses boundaries
    std::vector<unsigned char> back{in.Read()};
    for (std::uint32_t k = 0; back.size() < data.size(); ++k) {
      unsigned char chunk[20];
      const std::uint32_t n = in.ReadBlock(chunk, 1 + k * 5 % 20);
      ASSERT_GT(n, 0u);
      back.insert(back.end(), chunk, chunk + n);
    }
    EXPECT_EQ(back, data);
    unsigned char extra[11];
    EXPECT_EQ(in.ReadBlock(extra, 4), 0u);
    EXPECT_THROW(in.Read(), io_error);

    IPlatformByteStream raw2(f, kStreamRead);
    IBufferedByteStream in2(raw2, 64, 4096);
    std::vector<unsigned char> most(990);
    in2.ReadExactly(most.data(), 990);
    EXPECT_TRUE(std::equal(most.begin(), most.end(), data.begin()));
    EXPECT_THROW(in2.ReadExactly(extra, 11), io_error);  // only 10 left
  }
  {
    // Reopening without truncation keeps the content; Truncate shortens.
    OPlatformByteStream out(false, f, kStreamWrite);
    EXPECT_EQ(out.Length(), 1000);
    out.Truncate(10);
    out.CurPos(10);
    out.Write(0xEE);
    EXPECT_EQ(out.Length(), 11);
  }
  EXPECT_EQ(f.Size(0), 11u);

  const Failure missing =
      FailureOf([&] { IPlatformByteStream(File(tmp.AsDir(), u"missing.bin"), kStreamRead); });
  EXPECT_TRUE(missing.notFound);
  EXPECT_EQ(missing.code, ENOENT);
  EXPECT_NE(missing.what.find("missing.bin"), std::string::npos) << missing.what;
  const Failure underFile =
      FailureOf([&] { IPlatformByteStream(File(f.FullPath() + u"/inner"), kStreamRead); });
  EXPECT_TRUE(underFile.notFound);
  EXPECT_EQ(underFile.code, ENOTDIR);
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

// Writes `blocks` aligned blocks and checks the handle and the content.
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
  // Where neither the kernel nor /sys tells the alignment (a chroot without
  // /sys, say), callers fall back to 4096; a value that is given must be a
  // plausible power of two.
  std::uint32_t sector = 4096;
  if (plinth::native::GetVolumeSectorSize(tmp.UPath(), sector)) {
    EXPECT_GE(sector, 512u);
    EXPECT_LE(sector, 65536u);
    EXPECT_EQ(sector & (sector - 1), 0u);
  }

  const File f(tmp.AsDir(), u"data.vxcache.tmp");
  EXPECT_TRUE(FailureOf([&] { plinth::native::OpenExistingForUnbufferedWrite(f.FullPath()); }).notFound);
  EXPECT_FALSE(f.Exists());  // never created by the open
  EXPECT_TRUE(
      FailureOf([&] { plinth::native::OpenExistingForUnbufferedWrite(tmp.UPath() + u"/none/x"); }).notFound);
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

// A file system that refuses O_DIRECT (EINVAL, as tmpfs on older kernels)
// gets a buffered, still synchronous handle.
TEST(PlinthNative, FallbackWhenDirectIOIsRefused) {
  rktest::TempDir tmp;
  const File f(tmp.AsDir(), u"fallback.bin");
  f.Create(true);
  plinth::native::TEST_SimulateDirectIORefusal(true);
  WriteAlignedBlocks(f, 4096, 2, false);
  plinth::native::TEST_SimulateDirectIORefusal(false);
}

TEST(PlinthNative, AlignedAllocation) {
  for (std::size_t alignment : {1u, 8u, 512u, 4096u, 65536u}) {
    void* p = plinth::native::AlignedAlloc(100, alignment);
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(p) % alignment, 0u);
    std::memset(p, 0, 100);
    plinth::native::AlignedFree(p);
  }
  EXPECT_EQ(plinth::native::AlignedAlloc(100, 3000), nullptr);
  plinth::native::AlignedFree(nullptr);
}

}  // namespace
