#include "support/test_stuff.h"

#include <algorithm>

namespace rktest {

void Journal::Add(const std::string& event) {
  std::lock_guard<std::mutex> lock(mutex_);
  events_.push_back(event);
}

std::vector<std::string> Journal::Events() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return events_;
}

int Journal::Count(const std::string& event) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return static_cast<int>(std::count(events_.begin(), events_.end(), event));
}

void Journal::Clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  events_.clear();
}

TestStuff::TestStuff(std::uint32_t size, bool inMemory, bool trackMemory, std::shared_ptr<Journal> journal,
                     std::string name)
    : name_(std::move(name)),
      journal_(std::move(journal)),
      size_(size),
      inMemory_(false),
      trackMemory_(trackMemory) {
  SetInMemory(inMemory);
}

boost::intrusive_ptr<TestStuff> TestStuff::Make(std::uint32_t size, bool inMemory, bool trackMemory,
                                                std::shared_ptr<Journal> journal, std::string name) {
  return boost::intrusive_ptr<TestStuff>(
      new TestStuff(size, inMemory, trackMemory, std::move(journal), std::move(name)));
}

TestStuff::~TestStuff() {
  SetInMemory(false);
  Note("destroyed");
}

void TestStuff::Note(const std::string& what) const {
  if (journal_) journal_->Add(name_ + ":" + what);
}

void TestStuff::SetInMemory(bool inMemory) {
  bool was = inMemory_.exchange(inMemory);
  if (!trackMemory_ || was == inMemory) return;
  if (inMemory) {
    tracked_.store(size_.load());
    HK_TrackBytes(static_cast<std::int64_t>(tracked_.load()));
  } else {
    HK_TrackBytes(-static_cast<std::int64_t>(tracked_.exchange(0)));
  }
}

void TestStuff::SetOnDisk(std::optional<bool> onDisk) {
  onDisk_.store(onDisk ? (*onDisk ? 1 : 0) : -1);
}

bool TestStuff::IdenticalRequest(const RK_Stuff* request) const {
  Note("IdenticalRequest");
  return identical_ ? identical_(request) : RK_Stuff::IdenticalRequest(request);
}

bool TestStuff::CanSatisfyRequest(const RK_Stuff* request) const {
  Note("CanSatisfyRequest");
  return canSatisfy_ ? canSatisfy_(request) : RK_Stuff::CanSatisfyRequest(request);
}

std::uint32_t TestStuff::GetSizeInBytes() {
  return size_.load();
}

bool TestStuff::FreeMemory() {
  Note("FreeMemory");
  if (freeRefuses_.load() || !inMemory_.load()) return false;
  SetInMemory(false);
  return true;
}

bool TestStuff::IsInMemory() {
  if (int code = throwIsInMemory_.load()) throw code;
  return inMemory_.load();
}

bool TestStuff::IsOnDisk() const {
  int forced = onDisk_.load();
  return forced < 0 ? RK_Stuff::IsOnDisk() : forced == 1;
}

void TestStuff::YourDiskCacheFileWasDeleted() const {
  Note("YourDiskCacheFileWasDeleted");
}

}  // namespace rktest
