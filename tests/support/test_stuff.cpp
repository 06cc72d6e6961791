#include "support/test_stuff.h"

namespace rktest {

TestStuff::TestStuff(std::uint32_t size, bool inMemory, bool trackMemory, std::shared_ptr<Journal> journal,
                     std::string name)
    : name_(std::move(name)), journal_(std::move(journal)), size_(size), trackMemory_(trackMemory) {
  SetInMemory(inMemory);
}

TestStuff::~TestStuff() {
  SetInMemory(false);
  Note("destroyed");
}

void TestStuff::SetInMemory(bool inMemory) {
  if (inMemory_.exchange(inMemory) == inMemory || !trackMemory_) return;
  if (inMemory) {
    tracked_.store(size_);
    HK_TrackBytes(static_cast<std::int64_t>(size_));
  } else {
    HK_TrackBytes(-static_cast<std::int64_t>(tracked_.exchange(0)));
  }
}

bool TestStuff::FreeMemory() {
  Note("FreeMemory");
  if (freeRefuses_.load() || !inMemory_.load()) return false;
  SetInMemory(false);
  return true;
}

}  // namespace rktest
