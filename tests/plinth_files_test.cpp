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
using plinth::ustring;
using plinth::filesupport::Dir;
using plinth::filesupport::File;
using plinth::filesupport::file_not_found_exception;
using plinth::filesupport::io_error;
using plinth::utility::FileUtils;
using plinth::utility::UTF16to8;
using plinth::utility::UTF8to16;

void WriteText(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary);
  out << text;
}

std::string ReadAll(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::vector<std::string> Names(Dir d) {
  std::vector<std::string> names;
  for (auto it = d.BeginSubdirs(); it != d.EndSubdirs(); ++it) names.push_back(UTF16to8(it->GetName()));
  return names;
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
  EXPECT_EQ(f.Size(0), 0u);
  try {
    f.Create(true);
    ADD_FAILURE() << "exclusive create of an existing file succeeded";
  } catch (const io_error& e) {
    EXPECT_EQ(e.Code(), EEXIST);
    EXPECT_EQ(e.Path(), f.FullPath());
    EXPECT_NE(std::string(e.what()).find("vxcache.tmp"), std::string::npos) << e.what();
  }
  WriteText(UTF16to8(f.FullPath()), "12345");
  EXPECT_EQ(f.Size(0), 5u);
  f.Create(false);  // not exclusive: leaves an empty file
  EXPECT_EQ(f.Size(0), 0u);
  WriteText(UTF16to8(f.FullPath()), "payload");

  File blocker(dir, u"taken.vxcache");
  blocker.Create(true);
  File g = f;
  try {
    g.Rename(u"taken.vxcache");
    ADD_FAILURE() << "rename replaced an existing file";
  } catch (const io_error& e) {
    EXPECT_EQ(e.Code(), EEXIST);
  }
  EXPECT_EQ(g, f);
  EXPECT_EQ(blocker.Size(0), 0u);
  EXPECT_THROW(g.Rename(u"../escape"), io_error);

  g.Rename(u"final.vxcache");
  EXPECT_EQ(g.GetName(), u"final.vxcache");
  EXPECT_FALSE(f.Exists());
  EXPECT_TRUE(g.Exists());
  EXPECT_EQ(ReadAll(UTF16to8(g.FullPath())), "payload");

  g.Delete();
  EXPECT_FALSE(g.Exists());
  try {
    g.Delete();
    ADD_FAILURE() << "deleting a missing file succeeded";
  } catch (const file_not_found_exception& e) {
    EXPECT_EQ(e.Code(), ENOENT);
  }
  EXPECT_THROW(File(dir, u"missing").Size(0), file_not_found_exception);
  EXPECT_THROW(File(dir, u"no-folder/x").Create(true), file_not_found_exception);
  // A folder is not a file.
  Dir(dir, u"sub").Create();
  EXPECT_FALSE(File(dir, u"sub").Exists());
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
  EXPECT_THROW(FileUtils::UpdateFileModifiedTime(tmp.UPath() + u"/missing"), file_not_found_exception);
  EXPECT_THROW(File(tmp.AsDir(), u"missing").Created(), file_not_found_exception);
}

TEST(PlinthFiles, DirDeleteRemovesContentsButNeverFollowsLinksOut) {
  rktest::TempDir tmp;
  const Dir outside(tmp.AsDir(), u"outside");
  outside.Create();
  WriteText(UTF16to8(outside.FullPath()) + "/keep.txt", "keep");

  const Dir cache(tmp.AsDir(), u"cache");
  const Dir deep(Dir(cache, u"ab"), u"cd");
  deep.Create();  // missing parents too
  EXPECT_TRUE(deep.Exists());
  WriteText(UTF16to8(deep.FullPath()) + "/f1", "x");
  WriteText(UTF16to8(cache.FullPath()) + "/f2", "y");
  const std::string c = UTF16to8(cache.FullPath());
  fs::create_directory_symlink(UTF16to8(outside.FullPath()), c + "/link-to-outside");
  fs::create_directory_symlink(UTF16to8(outside.FullPath()), UTF16to8(deep.FullPath()) + "/deep-link");
  fs::create_symlink(UTF16to8(outside.FullPath()) + "/keep.txt", c + "/file-link");

  cache.Delete();
  EXPECT_FALSE(cache.Exists());
  EXPECT_FALSE(fs::exists(fs::symlink_status(c)));
  EXPECT_TRUE(outside.Exists());
  EXPECT_EQ(ReadAll(UTF16to8(outside.FullPath()) + "/keep.txt"), "keep");

  // A link in place of the folder itself is removed as a link.
  const std::string linkPath = UTF16to8(tmp.UPath()) + "/folder-link";
  fs::create_directory_symlink(UTF16to8(outside.FullPath()), linkPath);
  Dir(UTF8to16(linkPath)).Delete();
  EXPECT_FALSE(fs::exists(fs::symlink_status(linkPath)));
  EXPECT_EQ(ReadAll(UTF16to8(outside.FullPath()) + "/keep.txt"), "keep");

  EXPECT_THROW(Dir(tmp.UPath() + u"/never-made").Delete(), file_not_found_exception);
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
  WriteText(UTF16to8(tmp.UPath()) + "/a-file", "");
  fs::create_directory_symlink(UTF16to8(Dir(root, u"1.0").FullPath()), UTF16to8(tmp.UPath()) + "/0-link");

  EXPECT_EQ(Names(root), (std::vector<std::string>{"1.0", "10.0", "10.0-beta", "9.1"}));
  std::vector<std::string> filtered;
  for (auto it = root.BeginSubdirs(false, {}, u"10."); it != root.EndSubdirs(); ++it) {
    filtered.push_back(UTF16to8(it->GetName()));
  }
  EXPECT_EQ(filtered, (std::vector<std::string>{"10.0", "10.0-beta"}));

  // A snapshot: deleting while iterating neither skips nor breaks.
  int visited = 0;
  for (auto it = root.BeginSubdirs(); it != root.EndSubdirs(); ++it) {
    it->Delete();
    ++visited;
  }
  EXPECT_EQ(visited, 4);
  EXPECT_TRUE(Names(root).empty());
  EXPECT_TRUE(Names(Dir(root, u"missing")).empty());
  EXPECT_THROW(root.BeginSubdirs(true), std::invalid_argument);

  int calls = 0;
  Dir(root, u"a").Create();
  Dir(root, u"b").Create();
  auto it = root.BeginSubdirs(false, [&calls] { return ++calls > 1; });
  ASSERT_NE(it, root.EndSubdirs());
  EXPECT_EQ(++it, root.EndSubdirs());  // cancelled after the first entry
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

  using plinth::filesupport::RecursiveFileIterator;
  std::vector<std::string> found;
  const Dir cache(UTF8to16(base + "/cache"));
  for (RecursiveFileIterator it(cache), end; it != end; ++it) {
    found.push_back(UTF16to8(it->FullPath()).substr(base.size()));
  }
  EXPECT_EQ(found, (std::vector<std::string>{"/cache/ab/one.vxcache", "/cache/ab/one.vxcache.tmp",
                                             "/cache/cd/ef/two.VXCACHE", "/cache/top.vxcache"}));

  std::size_t matching = 0;
  for (RecursiveFileIterator it(cache, false, {}, u".tmp"), end; it != end; ++it) ++matching;
  EXPECT_EQ(matching, 1u);
  EXPECT_EQ(RecursiveFileIterator(Dir(UTF8to16(base + "/none"))), RecursiveFileIterator());
  // Cancel is polled during the walk: true from the start lists nothing,
  // true after a few entries cuts the listing short.
  EXPECT_EQ(RecursiveFileIterator(cache, false, [] { return true; }), RecursiveFileIterator());
  int polls = 0;
  std::size_t early = 0;
  for (RecursiveFileIterator it(cache, false, [&polls] { return ++polls > 3; }), end; it != end; ++it)
    ++early;
  EXPECT_LT(early, found.size());
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
  EXPECT_THROW(FileUtils::GetVolumeFreeSpace(tmp.UPath() + u"/missing"), file_not_found_exception);

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
  using namespace plinth::filesupport;
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
    std::vector<unsigned char> back;
    back.push_back(in.Read());
    std::size_t sizes[] = {3, 7, 8, 1, 20, 13};
    std::size_t k = 0;
    while (back.size() < data.size()) {
      std::vector<unsigned char> chunk(sizes[k++ % 6]);
      const std::uint32_t n = in.ReadBlock(chunk.data(), static_cast<std::uint32_t>(chunk.size()));
      ASSERT_GT(n, 0u);
      back.insert(back.end(), chunk.begin(), chunk.begin() + n);
    }
    EXPECT_EQ(back, data);
    unsigned char extra[4];
    EXPECT_EQ(in.ReadBlock(extra, 4), 0u);
    EXPECT_THROW(in.Read(), io_error);
  }
  {
    IPlatformByteStream raw(f, kStreamRead);
    IBufferedByteStream in(raw, 64, 4096);
    std::vector<unsigned char> all(990);
    in.ReadExactly(all.data(), 990);
    EXPECT_TRUE(std::equal(all.begin(), all.end(), data.begin()));
    unsigned char rest[11];
    EXPECT_THROW(in.ReadExactly(rest, 11), io_error);  // only 10 left
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

  try {
    IPlatformByteStream missing(File(tmp.AsDir(), u"missing.bin"), kStreamRead);
    ADD_FAILURE() << "opened a missing file";
  } catch (const file_not_found_exception& e) {
    EXPECT_EQ(e.Code(), ENOENT);
    EXPECT_NE(std::string(e.what()).find("missing.bin"), std::string::npos) << e.what();
  }
  try {
    IPlatformByteStream underFile(File(tmp.UPath() + u"/stream.bin/inner"), kStreamRead);
    ADD_FAILURE() << "opened a file below a file";
  } catch (const file_not_found_exception& e) {
    EXPECT_EQ(e.Code(), ENOTDIR);
  }
  try {
    OPlatformByteStream onFolder(false, File(tmp.UPath()), kStreamWrite);
    ADD_FAILURE() << "opened a folder for writing";
  } catch (const file_not_found_exception&) {
    ADD_FAILURE() << "a folder is not a missing file";
  } catch (const io_error& e) {
    EXPECT_EQ(e.Code(), EISDIR);
    EXPECT_NE(std::string(e.what()).find("errno 21"), std::string::npos) << e.what();
  }
}

// Writes through the unbuffered handle, as the cache-file writer does.
class UnbufferedWriter : public plinth::filesupport::OPlatformByteStream {
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
  ASSERT_EQ(reinterpret_cast<std::uintptr_t>(buffer) % blockSize, 0u);
  std::string expected;
  {
    UnbufferedWriter w(f);
    EXPECT_EQ(w.Direct(), expectDirect);
    const int fl = ::fcntl(w.GetPlatformHandle(), F_GETFL);
    EXPECT_EQ((fl & O_DIRECT) != 0, w.Direct());
    EXPECT_NE(fl & O_DSYNC, 0);
    // A second writer is refused while the first holds the file.
    try {
      plinth::native::OpenExistingForUnbufferedWrite(f.FullPath());
      ADD_FAILURE() << "a second writer opened a locked file";
    } catch (const io_error& e) {
      EXPECT_EQ(e.Code(), EWOULDBLOCK);
    }
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
  std::uint32_t sector = 0;
  if (plinth::native::GetVolumeSectorSize(tmp.UPath(), sector)) {
    EXPECT_GE(sector, 512u);
    EXPECT_LE(sector, 65536u);
    EXPECT_EQ(sector & (sector - 1), 0u);
  } else {
    sector = 4096;
  }

  const File f(tmp.AsDir(), u"data.vxcache.tmp");
  EXPECT_THROW(plinth::native::OpenExistingForUnbufferedWrite(f.FullPath()), file_not_found_exception);
  EXPECT_FALSE(f.Exists());  // never created by the open
  EXPECT_THROW(plinth::native::OpenExistingForUnbufferedWrite(tmp.UPath() + u"/none/x"),
               file_not_found_exception);
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

TEST(PlinthNative, FallbackWhenDirectIOIsRefused) {
  rktest::TempDir tmp;
  const File f(tmp.AsDir(), u"fallback.bin");
  f.Create(true);
  plinth::native::TEST_SimulateDirectIORefusal(true);
  WriteAlignedBlocks(f, 4096, 2, false);
  plinth::native::TEST_SimulateDirectIORefusal(false);
}

TEST(PlinthNative, FallbackOnTmpfs) {
  if (!fs::is_directory("/dev/shm")) GTEST_SKIP() << "no /dev/shm on this machine";
  const std::string path = "/dev/shm/plinth-fallback-" + std::to_string(::getpid());
  WriteText(path, "");
  const int probe = ::open(path.c_str(), O_WRONLY | O_DIRECT);
  if (probe >= 0) {
    ::close(probe);
    fs::remove(path);
    GTEST_SKIP() << "this kernel's tmpfs accepts O_DIRECT, so it cannot show the fallback";
  }
  WriteAlignedBlocks(File(UTF8to16(path)), 4096, 2, false);
  fs::remove(path);
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
