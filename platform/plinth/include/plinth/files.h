// Files and folders.
//
// File and Dir are values naming a path; they hold no open handle. Names and
// paths are UTF-16 at this interface. Failures of operations that change the
// file system throw plinth::filesupport::io_error (or its subclass
// file_not_found_exception when the file or a folder on its path is missing).
// Thread safety: distinct objects may be used on distinct threads freely.
#pragma once

#include <boost/date_time/posix_time/ptime.hpp>
#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "plinth/export.h"
#include "plinth/types.h"

namespace plinth {
namespace filesupport {

class Dir;
class File;

// A failure of a file operation or stream. what() names the path and the
// system's reason; Code() is the errno value (0 if none).
class PLINTH_API io_error : public std::runtime_error {
 public:
  io_error(const ustring& path, int code, const std::string& what);
  const ustring& Path() const { return path_; }
  int Code() const { return code_; }

 private:
  ustring path_;
  int code_;
};

// The file, or a folder on its path, does not exist.
class PLINTH_API file_not_found_exception : public io_error {
 public:
  explicit file_not_found_exception(const ustring& path);   // Code() is ENOENT
  file_not_found_exception(const ustring& path, int code);  // ENOENT or ENOTDIR
};

// Native view of a file's path.
class PLINTH_API FileHelper {
 public:
  explicit FileHelper(ustring path) : path_(std::move(path)) {}
  // The path as the operating system spells it (absolute, native separators).
  ustring FullNativePath() const { return path_; }

 private:
  ustring path_;
};

class PLINTH_API File {
 public:
  File() = default;  // empty: names nothing
  File(const Dir& folder, const ustring& name);
  explicit File(const ustring& fullPath);

  bool IsEmpty() const { return path_.empty(); }
  ustring FullPath() const { return path_; }
  ustring GetName() const;                   // last component, extension included
  ustring GetExtension(bool withDot) const;  // "" when the name has no '.'
  Dir GetParent() const;
  FileHelper Helper() const { return FileHelper(path_); }

  bool Exists() const;  // a regular file (not a folder) exists at the path
  // Creates an empty file. With exclusive true an existing file is an error
  // (io_error with EEXIST): two writers racing for one name cannot both win.
  void Create(bool exclusive) const;
  void Delete() const;  // throws file_not_found_exception when absent
  // Renames within the same folder; this object then names the new file.
  // An existing file of the new name is never replaced (io_error, EEXIST).
  void Rename(const ustring& newName);
  // Selector 0: the length in bytes. Other selectors are reserved (0 is returned).
  std::uint64_t Size(int selector) const;
  // Creation (birth) time in UTC; the modification time where the file
  // system does not record birth times.
  boost::posix_time::ptime Created() const;
  boost::posix_time::ptime Modified() const;

  friend bool operator==(const File& a, const File& b) { return a.path_ == b.path_; }
  friend bool operator!=(const File& a, const File& b) { return !(a == b); }

 private:
  ustring path_;
};

// Iterates over the immediate sub-folders of a folder, as a snapshot taken
// when the iteration begins (safe to delete entries while iterating).
class PLINTH_API SubdirIterator {
 public:
  SubdirIterator() = default;  // the end
  const Dir& operator*() const;
  const Dir* operator->() const { return &**this; }
  SubdirIterator& operator++();
  bool operator==(const SubdirIterator& o) const;
  bool operator!=(const SubdirIterator& o) const { return !(*this == o); }

 private:
  friend class Dir;
  boost::shared_ptr<std::vector<Dir>> items_;
  std::size_t index_ = 0;
};

class PLINTH_API Dir {
 public:
  Dir() = default;  // empty: names nothing
  explicit Dir(const ustring& path);
  // A sub-folder of parent. `resolve` asks for the path to be taken as is
  // (true) or normalised lexically (false); both name the same folder.
  Dir(const Dir& parent, const ustring& name, bool resolve = false);

  bool IsEmpty() const { return path_.empty(); }
  ustring FullPath() const { return path_; }  // absolute, no trailing separator
  ustring GetName() const;                    // last component
  Dir GetParent() const;

  bool Exists() const;  // a folder exists at the path
  void Create() const;  // creates the folder (and missing parents); no error if it exists
  // Deletes the folder with everything in it. Symbolic links inside are
  // removed as links; nothing outside the folder is ever touched.
  void Delete() const;

  // Immediate sub-folders (not symbolic links to folders), sorted by name.
  // A folder that does not exist yields nothing. The arguments (recursive
  // must be false; cancel and namePattern may be empty) narrow the listing:
  // a non-empty pattern keeps names that contain it.
  SubdirIterator BeginSubdirs(bool recursive = false, const boost::function<bool()>& cancel = {},
                              const ustring& namePattern = {}) const;
  SubdirIterator EndSubdirs() const { return SubdirIterator(); }

  friend bool operator==(const Dir& a, const Dir& b) { return a.path_ == b.path_; }
  friend bool operator!=(const Dir& a, const Dir& b) { return !(a == b); }

 private:
  ustring path_;
};

// Every regular file below a folder, sub-folders included, as a snapshot.
// Symbolic links are not followed. A missing folder yields nothing.
class PLINTH_API RecursiveFileIterator {
 public:
  RecursiveFileIterator() = default;  // the end
  // followLinks must be false. cancel, when set and returning true, stops
  // the listing early. A non-empty namePattern keeps names containing it.
  // filter and includeHidden are accepted for interface compatibility:
  // filter must be null; hidden files are always included.
  explicit RecursiveFileIterator(const Dir& folder, bool followLinks = false,
                                 const boost::function<bool()>& cancel = {}, const ustring& namePattern = {},
                                 const void* filter = nullptr, bool includeHidden = false);
  const File& operator*() const;
  const File* operator->() const { return &**this; }
  RecursiveFileIterator& operator++();
  bool operator==(const RecursiveFileIterator& o) const;
  bool operator!=(const RecursiveFileIterator& o) const { return !(*this == o); }

 private:
  boost::shared_ptr<std::vector<File>> items_;
  std::size_t index_ = 0;
};

}  // namespace filesupport

namespace utility {

class PLINTH_API FileUtils {
 public:
  // Creates every missing level of the path; false if that failed.
  static bool EnsureDirectoryExists(const ustring& path);
  // The mount point of the volume that holds the path. Throws io_error.
  static ustring GetVolumePath(const ustring& path);
  // Bytes available to an unprivileged writer on the path's volume. Throws io_error.
  static std::uint64_t GetVolumeFreeSpace(const ustring& path);
  // Replaces every character that is illegal in a file name on any of the
  // supported systems (control characters and < > : " / \ | ? *) by replacement.
  static ustring ReplaceIllegalFileNameCharacters(const ustring& name, char16_t replacement);
  // Sets the file's modification time to now. Throws io_error.
  static void UpdateFileModifiedTime(const ustring& path);
};

}  // namespace utility
}  // namespace plinth
