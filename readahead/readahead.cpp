// vx::rk::ReadAheadInfo: the process-wide read-ahead state.
//
// The flag, the skip interval and the display time are atomics; the cancel
// callbacks are guarded by mMutex, which is recursive so that a callback may
// call the accessors on its own thread.
#include "rkcache/readahead.h"

#include <atomic>
#include <boost/thread/lock_types.hpp>
#include <cstring>

namespace vx {
namespace rk {

static_assert(sizeof(T_Time) == sizeof(std::int64_t), "T_Time is copied as one 8-byte word");

boost::shared_ptr<ReadAheadInfo> ReadAheadInfo::mInstance;
boost::once_flag ReadAheadInfo::mOnceFlag = BOOST_ONCE_INIT;

namespace {
// Set once mInstance is written. boost::call_once marks its flag done inside
// libboost_thread, which a ThreadSanitizer build does not instrument; this
// release/acquire pair orders the write of mInstance before every read in a
// way every build can see.
std::atomic<bool> S_instancePublished{false};
}  // namespace

ReadAheadInfo::ReadAheadInfo() = default;

ReadAheadInfo::~ReadAheadInfo() = default;

void ReadAheadInfo::CreateInstance() {
  // The function-local reference keeps the instance until static
  // destruction, whatever happens to mInstance.
  static const boost::shared_ptr<ReadAheadInfo> instance(new ReadAheadInfo());
  mInstance = instance;
  S_instancePublished.store(true, std::memory_order_release);
}

boost::shared_ptr<ReadAheadInfo> ReadAheadInfo::Get() {
  boost::call_once(mOnceFlag, &ReadAheadInfo::CreateInstance);
  S_instancePublished.load(std::memory_order_acquire);
  return mInstance;
}

bool ReadAheadInfo::DoReadAhead() const {
  // The thread question is asked only when the flag is set.
  return mDoReadAhead.load() == 1 && HK_IsOnRenderThread();
}

void ReadAheadInfo::SetDoReadAhead(bool on) {
  mDoReadAhead.store(on ? 1 : 0);
  mReadAheadSkipInterval.store(1);
  if (on) return;

  boost::unique_lock<boost::recursive_mutex> lock(mMutex);
  // Walk by key rather than by iterator, and call a copy: a callback that
  // (against the rules) registers or unregisters, itself included, then
  // cannot leave the walk on a dangling entry. Keys registered meanwhile
  // above the current one are still called.
  auto entry = mCancelCallbacks.begin();
  while (entry != mCancelCallbacks.end()) {
    void* const key = entry->first;
    const boost::function<void()> callback = entry->second;
    callback();  // an empty one throws boost::bad_function_call
    entry = mCancelCallbacks.upper_bound(key);
  }
}

int ReadAheadInfo::GetReadAheadSkipInterval() const {
  return mReadAheadSkipInterval.load();
}

void ReadAheadInfo::SetReadAheadSkipInterval(int interval) {
  mReadAheadSkipInterval.store(interval);
}

bool ReadAheadInfo::GetActualDisplayTime(T_Time* time) const {
  if (!time) return false;
  const std::int64_t bytes = mActualDisplayTime.load();
  std::memcpy(time, &bytes, sizeof bytes);
  return true;
}

void ReadAheadInfo::SetActualDisplayTime(const T_Time* time) {
  std::int64_t bytes;
  std::memcpy(&bytes, time, sizeof bytes);
  mActualDisplayTime.store(bytes);
}

void ReadAheadInfo::RegisterCancelOutstandingRequestsCallback(void* key,
                                                              const boost::function<void()>& callback) {
  if (!key) return;
  boost::unique_lock<boost::recursive_mutex> lock(mMutex);
  mCancelCallbacks[key] = callback;
}

void ReadAheadInfo::UnRegisterCancelOutstandingRequestsCallback(void* key) {
  if (!key) return;
  boost::unique_lock<boost::recursive_mutex> lock(mMutex);
  mCancelCallbacks.erase(key);
}

}  // namespace rk
}  // namespace vx
