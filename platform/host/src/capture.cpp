// What the services were asked to do, kept for control::Snapshot. Each list
// is a bounded ring (control::kCaptureLimit) that grows only as entries come,
// and a long-running host keeps only the latest entries.
#include <boost/circular_buffer.hpp>
#include <mutex>
#include <utility>

#include "internal.h"

namespace rkhost {
namespace {

struct CaptureStore {
  std::mutex mutex;
  // All guarded by mutex.
  boost::circular_buffer_space_optimized<control::ErrorReport> errorReports{control::kCaptureLimit};
  boost::circular_buffer_space_optimized<control::Verification> verifications{control::kCaptureLimit};
  boost::circular_buffer_space_optimized<control::ExceptionReport> exceptions{control::kCaptureLimit};
  boost::circular_buffer_space_optimized<control::LogLine> logLines{control::kCaptureLimit};
};

// Built on first use and never destroyed, so that reports made while other
// libraries' statics are torn down still find it.
CaptureStore& Store() {
  static CaptureStore* store = new CaptureStore;
  return *store;
}

template <class T>
void Push(boost::circular_buffer_space_optimized<T>& ring, T&& entry) {
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  ring.push_back(std::move(entry));
}

}  // namespace

namespace detail {

void CaptureErrorReport(control::ErrorReport report) {
  Push(Store().errorReports, std::move(report));
}

void CaptureVerification(control::Verification verification) {
  Push(Store().verifications, std::move(verification));
}

void CaptureException(control::ExceptionReport report) {
  Push(Store().exceptions, std::move(report));
}

void CaptureLogLine(control::LogLine line) {
  Push(Store().logLines, std::move(line));
}

}  // namespace detail

namespace control {

Captured Snapshot() {
  CaptureStore& store = Store();
  Captured copy;
  std::lock_guard<std::mutex> lock(store.mutex);
  copy.errorReports.assign(store.errorReports.begin(), store.errorReports.end());
  copy.verifications.assign(store.verifications.begin(), store.verifications.end());
  copy.exceptionReports.assign(store.exceptions.begin(), store.exceptions.end());
  copy.exceptions.reserve(store.exceptions.size());
  for (const ExceptionReport& e : store.exceptions) copy.exceptions.push_back(e.what);
  copy.logLines.assign(store.logLines.begin(), store.logLines.end());
  return copy;
}

void ClearCaptured() {
  CaptureStore& store = Store();
  std::lock_guard<std::mutex> lock(store.mutex);
  store.errorReports.clear();
  store.verifications.clear();
  store.exceptions.clear();
  store.logLines.clear();
}

}  // namespace control
}  // namespace rkhost
