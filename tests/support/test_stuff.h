// A test item whose state and answers the test sets; it records what it was
// asked (and its death) in a journal that outlives it.
#pragma once

#include <algorithm>
#include <atomic>
#include <boost/intrusive_ptr.hpp>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "rkcache/rkcache.h"

namespace rktest {

// Events done to test items, in order. Thread-safe.
class Journal {
 public:
  void Add(const std::string& event) {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back(event);
  }
  std::vector<std::string> Events() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return events_;
  }
  int Count(const std::string& event) const {
    std::lock_guard<std::mutex> lock(mutex_);
    return static_cast<int>(std::count(events_.begin(), events_.end(), event));
  }
  void Clear() {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.clear();
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> events_;
};

class TestStuff : public RK_Stuff {
 public:
  // With trackMemory, the item's bytes count in host memory statistic 6
  // while it is in memory.
  explicit TestStuff(std::uint32_t size = 1000, bool inMemory = true, bool trackMemory = false,
                     std::shared_ptr<Journal> journal = nullptr, std::string name = "item");
  static boost::intrusive_ptr<TestStuff> Make(std::uint32_t size = 1000, bool inMemory = true,
                                              bool trackMemory = false,
                                              std::shared_ptr<Journal> journal = nullptr,
                                              std::string name = "item") {
    return new TestStuff(size, inMemory, trackMemory, std::move(journal), std::move(name));
  }

  void SetInMemory(bool inMemory);  // adjusts the tracked bytes
  void SetOnDisk(std::optional<bool> onDisk) { onDisk_.store(onDisk ? (*onDisk ? 1 : 0) : -1); }
  void SetCanDiskCache(bool can) { canDiskCache_.store(can); }
  // Answers of IdenticalRequest / CanSatisfyRequest; default: the base's.
  void SetIdentical(std::function<bool(const RK_Stuff*)> f) { identical_ = std::move(f); }
  void SetCanSatisfy(std::function<bool(const RK_Stuff*)> f) { canSatisfy_ = std::move(f); }
  void SetFreeMemoryRefuses(bool refuses) { freeRefuses_.store(refuses); }
  void SetThrowFromIsInMemory(int code) { throwIsInMemory_.store(code); }  // 0: no throw
  const std::string& Name() const { return name_; }
  const std::shared_ptr<Journal>& GetJournal() const { return journal_; }

  bool IdenticalRequest(const RK_Stuff* request) const override {
    Note("IdenticalRequest");
    return identical_ ? identical_(request) : RK_Stuff::IdenticalRequest(request);
  }
  bool CanSatisfyRequest(const RK_Stuff* request) const override {
    Note("CanSatisfyRequest");
    return canSatisfy_ ? canSatisfy_(request) : RK_Stuff::CanSatisfyRequest(request);
  }
  std::uint32_t GetSizeInBytes() override { return size_; }
  bool FreeMemory() override;
  bool IsInMemory() override {
    if (int code = throwIsInMemory_.load()) throw code;
    return inMemory_.load();
  }
  bool CanDiskCache() const override { return canDiskCache_.load(); }
  bool IsOnDisk() const override {
    const int forced = onDisk_.load();
    return forced < 0 ? RK_Stuff::IsOnDisk() : forced == 1;
  }
  void YourDiskCacheFileWasDeleted() const override { Note("YourDiskCacheFileWasDeleted"); }

 protected:
  ~TestStuff() override;

 private:
  void Note(const std::string& what) const {
    if (journal_) journal_->Add(name_ + ":" + what);
  }

  std::string name_;
  std::shared_ptr<Journal> journal_;
  const std::uint32_t size_;
  std::atomic<bool> inMemory_{false};
  std::atomic<int> onDisk_{-1};  // -1: base answer, 0 / 1: forced
  std::atomic<bool> canDiskCache_{false};
  std::atomic<bool> freeRefuses_{false};
  std::atomic<int> throwIsInMemory_{0};
  const bool trackMemory_;
  std::atomic<std::uint64_t> tracked_{0};
  std::function<bool(const RK_Stuff*)> identical_;
  std::function<bool(const RK_Stuff*)> canSatisfy_;
};

using TestStuffPtr = boost::intrusive_ptr<TestStuff>;

}  // namespace rktest
