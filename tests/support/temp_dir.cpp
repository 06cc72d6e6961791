#include "support/temp_dir.h"

#include <cstdlib>
#include <filesystem>
#include <random>
#include <stdexcept>

#include "plinth/text.h"

namespace rktest {

namespace fs = std::filesystem;

namespace {

fs::path BaseFolder() {
  if (const char* env = std::getenv("RK_TEST_TMPDIR")) return fs::path(env);
  std::error_code ec;
  fs::path local = fs::current_path(ec) / "test-tmp";
  if (!ec) return local;
  return fs::temp_directory_path();
}

}  // namespace

TempDir::TempDir() {
  fs::path base = BaseFolder();
  fs::create_directories(base);
  std::random_device rd;
  std::mt19937_64 gen(rd());
  for (int attempt = 0; attempt < 100; ++attempt) {
    fs::path candidate = base / ("rk-" + std::to_string(gen()));
    std::error_code ec;
    if (fs::create_directory(candidate, ec)) {
      path_ = fs::absolute(candidate).string();
      return;
    }
  }
  throw std::runtime_error("cannot create a temporary folder below " + base.string());
}

TempDir::~TempDir() {
  std::error_code ec;
  fs::remove_all(path_, ec);
}

plinth::ustring TempDir::UPath() const { return plinth::utility::UTF8to16(path_); }

plinth::filesupport::Dir TempDir::AsDir() const { return plinth::filesupport::Dir(UPath()); }

}  // namespace rktest
