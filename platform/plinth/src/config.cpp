#include "plinth/config.h"

#include <mutex>

namespace plinth {
namespace config {

namespace {

struct VersionState {
  std::mutex mutex;
  ustring version = u"1.0";  // guarded by mutex
};

VersionState& State() {
  // Never destroyed: callers on other threads may ask during process exit.
  static VersionState* state = new VersionState;
  return *state;
}

}  // namespace

ustring GetClientInternalVersion() {
  VersionState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  return s.version;
}

void SetClientInternalVersion(const ustring& version) {
  VersionState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.version = version;
}

}  // namespace config
}  // namespace plinth
