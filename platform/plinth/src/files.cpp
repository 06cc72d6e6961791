// Files and folders over std::filesystem and POSIX calls. Paths are UTF-16
// at the interface and UTF-8 at every system call (detail::NativePath).
#include "plinth/files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <boost/date_time/posix_time/conversion.hpp>
#include <boost/date_time/posix_time/posix_time_duration.hpp>
#include <boost/locale/encoding_utf.hpp>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>

#include "plinth/text.h"
#include "posix_util.h"

namespace plinth {

namespace fs = std::filesystem;

namespace detail {

std::string NativePath(const ustring& path) {
  return utility::UTF16to8(path);
}

std::string PathForMessage(const ustring& path) {
  return boost::locale::conv::utf_to_utf<char>(path, boost::locale::conv::skip);
}

void ThrowSystemError(const char* op, const ustring& path, int code) {
  if (code == ENOENT || code == ENOTDIR) throw filesupport::file_not_found_exception(path, code);
  throw filesupport::io_error(path, code,
                              std::string(op) + " '" + PathForMessage(path) + "': " + std::strerror(code) +
                                  " (errno " + std::to_string(code) + ")");
}

}  // namespace detail

namespace filesupport {

namespace {

using detail::NativePath;
using detail::ThrowSystemError;

ustring ToU16(const fs::path& p) {
  return utility::UTF8to16(p.string());
}

// Absolute, lexically normal, without a trailing separator (except "/").
ustring NormalisePath(const ustring& path) {
  if (path.empty()) return path;
  fs::path p = fs::path(NativePath(path));
  if (p.is_relative()) p = fs::absolute(p);
  std::string s = p.lexically_normal().string();
  while (s.size() > 1 && s.back() == '/') s.pop_back();
  return utility::UTF8to16(s);
}

ustring LastComponent(const ustring& path) {
  const auto slash = path.find_last_of(kPathSeparator);
  return slash == ustring::npos ? path : path.substr(slash + 1);
}

ustring ParentOf(const ustring& path) {
  const auto slash = path.find_last_of(kPathSeparator);
  if (slash == ustring::npos) return ustring();
  if (slash == 0) return ustring(1, kPathSeparator);
  return path.substr(0, slash);
}

ustring Join(const ustring& folder, const ustring& name) {
  if (!folder.empty() && folder.back() == kPathSeparator) return folder + name;
  return folder + kPathSeparator + name;
}

boost::posix_time::ptime ToPtime(std::int64_t seconds, std::uint32_t nanoseconds) {
  return boost::posix_time::from_time_t(static_cast<std::time_t>(seconds)) +
         boost::posix_time::microseconds(nanoseconds / 1000);
}

bool IsNameMatch(const ustring& name, const ustring& pattern) {
  return pattern.empty() || name.find(pattern) != ustring::npos;
}

// Removes everything inside the open folder dirFd, never leaving it: each
// entry is examined with AT_SYMLINK_NOFOLLOW and sub-folders are opened with
// O_NOFOLLOW relative to their parent's descriptor, so a link (or a folder
// swapped for a link meanwhile) is unlinked, never entered.
void RemoveContents(int dirFd, const ustring& pathForErrors) {
  DIR* dir = ::fdopendir(dirFd);
  if (dir == nullptr) {
    const int e = errno;
    ::close(dirFd);
    ThrowSystemError("opendir", pathForErrors, e);
  }
  struct Closer {
    DIR* d;
    ~Closer() { ::closedir(d); }
  } closer{dir};
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(dir);
    if (entry == nullptr) {
      if (errno != 0) ThrowSystemError("readdir", pathForErrors, errno);
      break;
    }
    const char* name = entry->d_name;
    if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) continue;
    const ustring childPath = Join(pathForErrors, utility::UTF8to16(name));
    struct stat st;
    if (::fstatat(dirFd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
      if (errno == ENOENT) continue;  // removed by someone else meanwhile
      ThrowSystemError("stat", childPath, errno);
    }
    if (S_ISDIR(st.st_mode)) {
      const int childFd = ::openat(dirFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
      if (childFd < 0) ThrowSystemError("open", childPath, errno);
      RemoveContents(childFd, childPath);
      if (::unlinkat(dirFd, name, AT_REMOVEDIR) != 0 && errno != ENOENT) {
        ThrowSystemError("rmdir", childPath, errno);
      }
    } else if (::unlinkat(dirFd, name, 0) != 0 && errno != ENOENT) {
      ThrowSystemError("unlink", childPath, errno);
    }
  }
  // The descriptor belongs to the DIR stream: Closer closes both.
}

}  // namespace

io_error::io_error(const ustring& path, int code, const std::string& what)
    : std::runtime_error(what), path_(path), code_(code) {}

file_not_found_exception::file_not_found_exception(const ustring& path)
    : file_not_found_exception(path, ENOENT) {}

file_not_found_exception::file_not_found_exception(const ustring& path, int code)
    : io_error(path, code,
               "file not found '" + detail::PathForMessage(path) + "': " + std::strerror(code) + " (errno " +
                   std::to_string(code) + ")") {}

// ---------------------------------------------------------------------------
// File

File::File(const Dir& folder, const ustring& name) : path_(Join(folder.FullPath(), name)) {}

File::File(const ustring& fullPath) : path_(NormalisePath(fullPath)) {}

ustring File::GetName() const {
  return LastComponent(path_);
}

ustring File::GetExtension(bool withDot) const {
  const ustring name = GetName();
  const auto dot = name.find_last_of(u'.');
  if (dot == ustring::npos) return ustring();
  return name.substr(withDot ? dot : dot + 1);
}

Dir File::GetParent() const {
  return Dir(ParentOf(path_));
}

bool File::Exists() const {
  struct stat st;
  return !path_.empty() && ::stat(NativePath(path_).c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

void File::Create(bool exclusive) const {
  // Not exclusive: an existing file is emptied, so the result is always an
  // empty file.
  const int flags = O_WRONLY | O_CREAT | O_CLOEXEC | (exclusive ? O_EXCL : O_TRUNC);
  const int fd = ::open(NativePath(path_).c_str(), flags, 0666);
  if (fd < 0) ThrowSystemError("create", path_, errno);
  if (::close(fd) != 0 && errno != EINTR) ThrowSystemError("close", path_, errno);
}

void File::Delete() const {
  if (::unlink(NativePath(path_).c_str()) != 0) ThrowSystemError("delete", path_, errno);
}

void File::Rename(const ustring& newName) {
  if (newName.empty() || newName.find(kPathSeparator) != ustring::npos || newName == u"." ||
      newName == u"..") {
    throw io_error(path_, EINVAL, "rename '" + detail::PathForMessage(path_) + "': invalid new name");
  }
  const ustring target = Join(ParentOf(path_), newName);
  // Never replace an existing file: two writers of one name must not
  // silently overwrite each other's result.
  if (::renameat2(AT_FDCWD, NativePath(path_).c_str(), AT_FDCWD, NativePath(target).c_str(),
                  RENAME_NOREPLACE) != 0) {
    const int e = errno;
    if (e != EINVAL && e != ENOSYS) ThrowSystemError("rename", path_, e);
    // The file system has no atomic no-replace rename: a hard link fails
    // atomically when the target exists; then drop the old name.
    if (::link(NativePath(path_).c_str(), NativePath(target).c_str()) != 0)
      ThrowSystemError("rename", path_, errno);
    if (::unlink(NativePath(path_).c_str()) != 0) ThrowSystemError("rename", path_, errno);
  }
  path_ = target;
}

std::uint64_t File::Size(int selector) const {
  if (selector != 0) return 0;
  struct stat st;
  if (::stat(NativePath(path_).c_str(), &st) != 0) ThrowSystemError("stat", path_, errno);
  return static_cast<std::uint64_t>(st.st_size);
}

boost::posix_time::ptime File::Created() const {
  struct statx sx;
  if (::statx(AT_FDCWD, NativePath(path_).c_str(), 0, STATX_BTIME | STATX_MTIME, &sx) != 0) {
    ThrowSystemError("statx", path_, errno);
  }
  // Not every file system records a birth time; the modification time is
  // the nearest honest answer there.
  if ((sx.stx_mask & STATX_BTIME) != 0) return ToPtime(sx.stx_btime.tv_sec, sx.stx_btime.tv_nsec);
  return ToPtime(sx.stx_mtime.tv_sec, sx.stx_mtime.tv_nsec);
}

boost::posix_time::ptime File::Modified() const {
  struct stat st;
  if (::stat(NativePath(path_).c_str(), &st) != 0) ThrowSystemError("stat", path_, errno);
  return ToPtime(st.st_mtim.tv_sec, static_cast<std::uint32_t>(st.st_mtim.tv_nsec));
}

// ---------------------------------------------------------------------------
// Dir

Dir::Dir(const ustring& path) : path_(NormalisePath(path)) {}

Dir::Dir(const Dir& parent, const ustring& name, bool resolve) {
  const ustring joined = Join(parent.FullPath(), name);
  if (resolve) {
    path_ = joined;
    while (path_.size() > 1 && path_.back() == kPathSeparator) path_.pop_back();
  } else {
    path_ = NormalisePath(joined);
  }
}

ustring Dir::GetName() const {
  return LastComponent(path_);
}

Dir Dir::GetParent() const {
  return Dir(ParentOf(path_));
}

bool Dir::Exists() const {
  struct stat st;
  return !path_.empty() && ::stat(NativePath(path_).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

void Dir::Create() const {
  std::error_code ec;
  fs::create_directories(fs::path(NativePath(path_)), ec);
  if (ec) ThrowSystemError("create folder", path_, ec.value());
  if (!Exists()) ThrowSystemError("create folder", path_, ENOTDIR);
}

void Dir::Delete() const {
  const std::string native = NativePath(path_);
  struct stat st;
  if (::lstat(native.c_str(), &st) != 0) ThrowSystemError("delete folder", path_, errno);
  if (!S_ISDIR(st.st_mode)) {
    // A link in place of the folder is removed as a link, never followed.
    if (S_ISLNK(st.st_mode)) {
      if (::unlink(native.c_str()) != 0) ThrowSystemError("delete folder", path_, errno);
      return;
    }
    ThrowSystemError("delete folder", path_, ENOTDIR);
  }
  const int fd = ::open(native.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) ThrowSystemError("delete folder", path_, errno);
  RemoveContents(fd, path_);
  if (::rmdir(native.c_str()) != 0) ThrowSystemError("delete folder", path_, errno);
}

SubdirIterator Dir::BeginSubdirs(bool recursive, const boost::function<bool()>& cancel,
                                 const ustring& namePattern) const {
  if (recursive) throw std::invalid_argument("BeginSubdirs: recursive listing is not supported");
  auto items = boost::shared_ptr<std::vector<Dir>>(new std::vector<Dir>);
  std::error_code ec;
  fs::directory_iterator it(fs::path(NativePath(path_)), ec);
  if (ec) {
    if (ec.value() == ENOENT || ec.value() == ENOTDIR) return SubdirIterator();
    ThrowSystemError("list folder", path_, ec.value());
  }
  for (; it != fs::directory_iterator(); it.increment(ec)) {
    if (cancel && cancel()) break;
    std::error_code statusEc;
    // symlink_status: a link to a folder is not a sub-folder of this one.
    if (!it->is_directory(statusEc) || it->is_symlink(statusEc)) continue;
    const ustring name = utility::UTF8to16(it->path().filename().string());
    if (IsNameMatch(name, namePattern)) items->push_back(Dir(*this, name, true));
  }
  if (ec) ThrowSystemError("list folder", path_, ec.value());
  std::sort(items->begin(), items->end(),
            [](const Dir& a, const Dir& b) { return a.FullPath() < b.FullPath(); });
  SubdirIterator result;
  if (!items->empty()) result.items_ = items;
  return result;
}

const Dir& SubdirIterator::operator*() const {
  return (*items_)[index_];
}

SubdirIterator& SubdirIterator::operator++() {
  if (items_ && ++index_ >= items_->size()) {
    items_.reset();
    index_ = 0;
  }
  return *this;
}

bool SubdirIterator::operator==(const SubdirIterator& o) const {
  return items_ == o.items_ && index_ == o.index_;
}

// ---------------------------------------------------------------------------
// RecursiveFileIterator

RecursiveFileIterator::RecursiveFileIterator(const Dir& folder, bool followLinks,
                                             const boost::function<bool()>& cancel,
                                             const ustring& namePattern, const void* filter,
                                             bool /*includeHidden*/) {
  if (followLinks) throw std::invalid_argument("RecursiveFileIterator: following links is not supported");
  if (filter != nullptr) throw std::invalid_argument("RecursiveFileIterator: filters are not supported");
  auto items = boost::shared_ptr<std::vector<File>>(new std::vector<File>);
  std::error_code ec;
  // Links are never followed (default options): a link to a folder outside
  // is not walked.
  fs::recursive_directory_iterator it(fs::path(NativePath(folder.FullPath())), ec);
  if (ec) {
    if (ec.value() == ENOENT || ec.value() == ENOTDIR) return;
    ThrowSystemError("list folder", folder.FullPath(), ec.value());
  }
  for (; it != fs::recursive_directory_iterator(); it.increment(ec)) {
    if (cancel && cancel()) break;
    std::error_code statusEc;
    if (!it->is_regular_file(statusEc) || it->is_symlink(statusEc)) continue;
    const ustring name = utility::UTF8to16(it->path().filename().string());
    if (IsNameMatch(name, namePattern)) items->push_back(File(ToU16(it->path())));
  }
  if (ec) ThrowSystemError("list folder", folder.FullPath(), ec.value());
  std::sort(items->begin(), items->end(),
            [](const File& a, const File& b) { return a.FullPath() < b.FullPath(); });
  if (!items->empty()) items_ = items;
}

const File& RecursiveFileIterator::operator*() const {
  return (*items_)[index_];
}

RecursiveFileIterator& RecursiveFileIterator::operator++() {
  if (items_ && ++index_ >= items_->size()) {
    items_.reset();
    index_ = 0;
  }
  return *this;
}

bool RecursiveFileIterator::operator==(const RecursiveFileIterator& o) const {
  return items_ == o.items_ && index_ == o.index_;
}

}  // namespace filesupport

// ---------------------------------------------------------------------------
// FileUtils

namespace utility {

using detail::NativePath;
using detail::ThrowSystemError;

bool FileUtils::EnsureDirectoryExists(const ustring& path) {
  try {
    const std::string native = NativePath(path);
    std::error_code ec;
    fs::create_directories(fs::path(native), ec);
    struct stat st;
    return ::stat(native.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
  } catch (const std::exception&) {
    return false;
  }
}

ustring FileUtils::GetVolumePath(const ustring& path) {
  std::error_code ec;
  fs::path p = fs::weakly_canonical(fs::absolute(fs::path(NativePath(path))), ec);
  if (ec) ThrowSystemError("volume of", path, ec.value());
  // Start at the nearest folder that exists, then climb while the device
  // stays the same: the last folder on this device is the mount point.
  struct stat st;
  while (::stat(p.c_str(), &st) != 0) {
    if (errno != ENOENT && errno != ENOTDIR) ThrowSystemError("volume of", path, errno);
    if (p == p.root_path()) ThrowSystemError("volume of", path, errno);
    p = p.parent_path();
  }
  const dev_t device = st.st_dev;
  while (p != p.root_path()) {
    const fs::path parent = p.parent_path();
    struct stat parentSt;
    if (::stat(parent.c_str(), &parentSt) != 0 || parentSt.st_dev != device) break;
    p = parent;
  }
  return UTF8to16(p.string());
}

std::uint64_t FileUtils::GetVolumeFreeSpace(const ustring& path) {
  struct statvfs vfs;
  if (::statvfs(NativePath(path).c_str(), &vfs) != 0) ThrowSystemError("free space of", path, errno);
  return static_cast<std::uint64_t>(vfs.f_bavail) * static_cast<std::uint64_t>(vfs.f_frsize);
}

ustring FileUtils::ReplaceIllegalFileNameCharacters(const ustring& name, char16_t replacement) {
  static const ustring kIllegal = u"<>:\"/\\|?*";
  ustring out = name;
  for (char16_t& c : out) {
    if (c < 0x20 || kIllegal.find(c) != ustring::npos) c = replacement;
  }
  return out;
}

void FileUtils::UpdateFileModifiedTime(const ustring& path) {
  const struct timespec times[2] = {{0, UTIME_OMIT}, {0, UTIME_NOW}};
  if (::utimensat(AT_FDCWD, NativePath(path).c_str(), times, 0) != 0) {
    ThrowSystemError("set modification time of", path, errno);
  }
}

}  // namespace utility
}  // namespace plinth
