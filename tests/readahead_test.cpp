// vx::rk::ReadAheadInfo: the flag per thread kind, the skip interval, the
// display time, and the cancel callbacks in key order.
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <stdexcept>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"

using vx::rk::ReadAheadInfo;

namespace {

// The instance is process-wide: every test leaves it off, at interval 1 and
// with none of its keys registered.
class ReadAhead : public ::testing::Test {
 protected:
  void SetUp() override { info_ = ReadAheadInfo::Get(); }
  void TearDown() override {
    for (char& key : keys_) info_->UnRegisterCancelOutstandingRequestsCallback(&key);
    info_->SetDoReadAhead(false);
  }
  void* Key(int i) { return &keys_[i]; }
  void Register(int key, int tag) {
    info_->RegisterCancelOutstandingRequestsCallback(Key(key), [this, tag] { calls_.push_back(tag); });
  }
  bool OnRenderThread() {
    bool result = true;
    std::thread([&] {
      rkhost::control::SetCurrentThreadIsRenderThread(true);
      result = info_->DoReadAhead();
    }).join();
    return result;
  }

  boost::shared_ptr<ReadAheadInfo> info_;
  char keys_[6] = {};
  std::vector<int> calls_;
};

}  // namespace

TEST_F(ReadAhead, FlagCountsOnlyOnRenderThreadsAndEverySwitchResetsTheSkipInterval) {
  info_->SetReadAheadSkipInterval(4);
  info_->SetDoReadAhead(true);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);
  EXPECT_TRUE(OnRenderThread());
  EXPECT_FALSE(info_->DoReadAhead());  // the main thread
  EXPECT_FALSE(std::async(std::launch::async, [&] { return info_->DoReadAhead(); }).get());
  info_->SetReadAheadSkipInterval(-3);
  info_->SetDoReadAhead(false);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);
  EXPECT_FALSE(OnRenderThread());
}

TEST_F(ReadAhead, DisplayTimeIsCopiedWhole) {
  T_Time time{-1};
  EXPECT_FALSE(info_->GetActualDisplayTime(nullptr));
  const T_Time shown{0x0123456789ABCDEFLL};
  info_->SetActualDisplayTime(&shown);
  ASSERT_TRUE(info_->GetActualDisplayTime(&time));
  EXPECT_EQ(time.value, shown.value);
}

TEST_F(ReadAhead, SwitchingOffCallsEachCallbackOnceInKeyOrder) {
  for (int i : {3, 0, 5, 1, 4, 2}) Register(i, i);  // keys are ordered by address
  Register(4, 40);                                  // replaces
  info_->UnRegisterCancelOutstandingRequestsCallback(Key(5));
  info_->RegisterCancelOutstandingRequestsCallback(nullptr, [this] { calls_.push_back(-1); });  // ignored
  info_->SetDoReadAhead(true);
  EXPECT_TRUE(calls_.empty());  // switching on calls nothing
  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1, 2, 3, 40}));
  // Registrations stay: the next switch off calls them again.
  calls_.clear();
  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1, 2, 3, 40}));
}

TEST_F(ReadAhead, ACallbackErrorEndsTheWalkAndReachesTheCaller) {
  Register(0, 0);
  info_->RegisterCancelOutstandingRequestsCallback(Key(1), [this] {
    calls_.push_back(1);
    throw std::runtime_error("cancel failed");
  });
  Register(2, 2);
  info_->SetDoReadAhead(true);
  info_->SetReadAheadSkipInterval(3);
  EXPECT_THROW(info_->SetDoReadAhead(false), std::runtime_error);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1}));
  // Flag and interval were already switched when the callbacks ran.
  EXPECT_FALSE(OnRenderThread());
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);
  // The lock was released: another thread can register at once.
  auto registered = std::async(std::launch::async, [&] { Register(3, 3); });
  ASSERT_EQ(registered.wait_for(std::chrono::seconds(30)), std::future_status::ready);
}

TEST_F(ReadAhead, CallbacksMayUseTheInstanceAndEvenUnregisterThemselves) {
  int seenInterval = 0;
  info_->RegisterCancelOutstandingRequestsCallback(Key(0), [&] {
    calls_.push_back(0);
    seenInterval = ReadAheadInfo::Get()->GetReadAheadSkipInterval();
  });
  info_->RegisterCancelOutstandingRequestsCallback(Key(1), [this] {
    calls_.push_back(1);
    info_->UnRegisterCancelOutstandingRequestsCallback(Key(1));
  });
  Register(2, 2);
  info_->SetReadAheadSkipInterval(5);
  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1, 2}));
  EXPECT_EQ(seenInterval, 1);
  calls_.clear();
  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 2}));
}
