// vx::rk::ReadAheadInfo: the flag per thread kind, the skip interval, the
// display time, and the cancel callbacks in key order.
#include <gtest/gtest.h>

#include <boost/function.hpp>
#include <chrono>
#include <future>
#include <stdexcept>
#include <thread>
#include <vector>

#include "host/control.h"
#include "rkcache/rkcache.h"

namespace ctl = rkhost::control;
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

  // Runs f on a thread marked as a render thread.
  template <class F>
  static auto OnRenderThread(F f) {
    decltype(f()) result{};
    std::thread([&] {
      ctl::SetCurrentThreadIsRenderThread(true);
      result = f();
    }).join();
    return result;
  }

  boost::shared_ptr<ReadAheadInfo> info_;
  char keys_[6] = {};
  std::vector<int> calls_;
};

}  // namespace

TEST_F(ReadAhead, FlagCountsOnlyOnRenderThreadsAndEverySwitchResetsTheSkipInterval) {
  EXPECT_EQ(ReadAheadInfo::Get(), info_);
  EXPECT_FALSE(OnRenderThread([&] { return info_->DoReadAhead(); }));
  info_->SetReadAheadSkipInterval(4);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 4);
  info_->SetDoReadAhead(true);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);
  EXPECT_TRUE(OnRenderThread([&] { return info_->DoReadAhead(); }));
  EXPECT_FALSE(info_->DoReadAhead());  // the main thread
  EXPECT_FALSE(std::async(std::launch::async, [&] { return info_->DoReadAhead(); }).get());

  info_->SetReadAheadSkipInterval(-3);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), -3);
  info_->SetDoReadAhead(false);
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);
  EXPECT_FALSE(OnRenderThread([&] { return info_->DoReadAhead(); }));
}

TEST_F(ReadAhead, DisplayTimeIsCopiedWhole) {
  T_Time time{-1};
  EXPECT_FALSE(info_->GetActualDisplayTime(nullptr));
  ASSERT_TRUE(info_->GetActualDisplayTime(&time));
  EXPECT_EQ(time.value, 0);

  const T_Time shown{0x0123456789ABCDEFLL};
  info_->SetActualDisplayTime(&shown);
  ASSERT_TRUE(info_->GetActualDisplayTime(&time));
  EXPECT_EQ(time.value, shown.value);
}

TEST_F(ReadAhead, SwitchingOffCallsEachCallbackOnceInKeyOrder) {
  // Registered out of order; keys are ordered by address.
  for (int i : {3, 0, 5, 1, 4, 2}) {
    info_->RegisterCancelOutstandingRequestsCallback(Key(i), [this, i] { calls_.push_back(i); });
  }
  // Replacing keeps only the second callback.
  info_->RegisterCancelOutstandingRequestsCallback(Key(4), [this] { calls_.push_back(40); });
  info_->UnRegisterCancelOutstandingRequestsCallback(Key(5));
  // A null key is ignored; unregistering an unknown key does nothing.
  info_->RegisterCancelOutstandingRequestsCallback(nullptr, [this] { calls_.push_back(-1); });
  info_->UnRegisterCancelOutstandingRequestsCallback(nullptr);
  int unknown = 0;
  info_->UnRegisterCancelOutstandingRequestsCallback(&unknown);

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
  info_->RegisterCancelOutstandingRequestsCallback(Key(0), [this] { calls_.push_back(0); });
  info_->RegisterCancelOutstandingRequestsCallback(Key(1), [this] {
    calls_.push_back(1);
    throw std::runtime_error("cancel failed");
  });
  info_->RegisterCancelOutstandingRequestsCallback(Key(2), [this] { calls_.push_back(2); });
  info_->SetDoReadAhead(true);
  info_->SetReadAheadSkipInterval(3);

  EXPECT_THROW(info_->SetDoReadAhead(false), std::runtime_error);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1}));
  // Flag and interval were already switched when the callbacks ran.
  EXPECT_FALSE(OnRenderThread([&] { return info_->DoReadAhead(); }));
  EXPECT_EQ(info_->GetReadAheadSkipInterval(), 1);

  // The lock was released: another thread can register at once.
  auto registered = std::async(std::launch::async, [&] {
    info_->RegisterCancelOutstandingRequestsCallback(Key(3), [this] { calls_.push_back(3); });
  });
  ASSERT_EQ(registered.wait_for(std::chrono::seconds(30)), std::future_status::ready);

  // An empty callback fails the same way.
  info_->UnRegisterCancelOutstandingRequestsCallback(Key(1));
  info_->RegisterCancelOutstandingRequestsCallback(Key(2), boost::function<void()>());
  calls_.clear();
  EXPECT_THROW(info_->SetDoReadAhead(false), boost::bad_function_call);
  EXPECT_EQ(calls_, std::vector<int>{0});
}

TEST_F(ReadAhead, CallbacksMayUseTheInstanceAndEvenUnregisterThemselves) {
  int seenInterval = 0;
  bool seenFlag = true;
  info_->RegisterCancelOutstandingRequestsCallback(Key(0), [&] {
    calls_.push_back(0);
    seenInterval = ReadAheadInfo::Get()->GetReadAheadSkipInterval();
    seenFlag = ReadAheadInfo::Get()->DoReadAhead();
  });
  info_->RegisterCancelOutstandingRequestsCallback(Key(1), [this] {
    calls_.push_back(1);
    info_->UnRegisterCancelOutstandingRequestsCallback(Key(1));
  });
  info_->RegisterCancelOutstandingRequestsCallback(Key(2), [this] { calls_.push_back(2); });
  info_->SetReadAheadSkipInterval(5);

  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 1, 2}));
  EXPECT_EQ(seenInterval, 1);
  EXPECT_FALSE(seenFlag);

  calls_.clear();
  info_->SetDoReadAhead(false);
  EXPECT_EQ(calls_, (std::vector<int>{0, 2}));
}
