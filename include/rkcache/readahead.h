// vx::rk::ReadAheadInfo: process-wide read-ahead state that the host's
// threads share: whether read-ahead is on, the skip interval, the time on
// display, and callbacks that cancel outstanding read-ahead requests.
//
// The module keeps this state in one place and runs the cancel callbacks
// when read-ahead is switched off; it never reads the state itself.
// Threads: every operation may be called from any thread; none takes the
// cache lock. Callbacks run on the thread that switches read-ahead off,
// under the singleton's own recursive lock, and must not register or
// unregister callbacks.
#pragma once

#include <atomic>
#include <boost/function.hpp>
#include <boost/noncopyable.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/thread/once.hpp>
#include <boost/thread/recursive_mutex.hpp>
#include <cstdint>
#include <map>

#include "host/hk.h"
#include "rkcache/export.h"

namespace vx {
namespace rk {

class RK_EXPORT ReadAheadInfo : private boost::noncopyable {
 public:
  virtual ~ReadAheadInfo();

  // The one instance, created on first use.
  static boost::shared_ptr<ReadAheadInfo> Get();

  // True only while read-ahead is on and the caller is a render thread.
  bool DoReadAhead() const;
  // Switches read-ahead on or off and resets the skip interval to 1;
  // switching off calls every cancel callback once, in ascending key order.
  // An exception from a callback (boost::bad_function_call for an empty
  // one) ends the loop and passes to the caller.
  void SetDoReadAhead(bool on);
  int GetReadAheadSkipInterval() const;
  void SetReadAheadSkipInterval(int interval);
  // False (and nothing written) for a null pointer.
  bool GetActualDisplayTime(T_Time* time) const;
  // REQUIRES: time non-null.
  void SetActualDisplayTime(const T_Time* time);
  // A null key is ignored; a second registration under a key replaces the first.
  void RegisterCancelOutstandingRequestsCallback(void* key, const boost::function<void()>& callback);
  void UnRegisterCancelOutstandingRequestsCallback(void* key);

 private:
  RK_INTERNAL ReadAheadInfo();
  RK_INTERNAL static void CreateInstance();

  std::atomic<int> mDoReadAhead{0};
  std::atomic<int> mReadAheadSkipInterval{1};
  // The host's 8-byte time record, copied whole and never interpreted. Kept
  // as one atomic word so that it can be copied without a lock and without a
  // torn read while another thread sets it.
  std::atomic<std::int64_t> mActualDisplayTime{0};
  mutable boost::recursive_mutex mMutex;
  std::map<void*, boost::function<void()>> mCancelCallbacks;  // mMutex

  RK_INTERNAL static boost::shared_ptr<ReadAheadInfo> mInstance;
  RK_INTERNAL static boost::once_flag mOnceFlag;
};

}  // namespace rk
}  // namespace vx
