// A temporary folder on a real file system (not tmpfs, so O_DIRECT works
// where the disk supports it), removed with its contents at destruction.
#pragma once

#include <string>

#include "plinth/files.h"

namespace rktest {

class TempDir {
 public:
  // Created below $RK_TEST_TMPDIR if set, else below the build folder's
  // "test-tmp" (falling back to /tmp).
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& Path() const { return path_; }
  plinth::ustring UPath() const;
  plinth::filesupport::Dir AsDir() const;

 private:
  std::string path_;
};

}  // namespace rktest
