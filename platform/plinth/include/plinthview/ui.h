// The UI library's node manager: whether the host application is frontmost.
#pragma once

#include <atomic>

#include "plinth/export.h"

namespace plinthview {
namespace ui {

class PLINTH_API UI_NodeManager {
 public:
  // With onlyIfExists true, null until the manager has been created; with
  // false, creates it on first use. Thread-safe.
  static UI_NodeManager* Get(bool onlyIfExists);

  bool IsApplicationFrontmost() const { return frontmost_.load(); }
  // Control: the host (or a test) says whether the application is frontmost.
  void SetApplicationFrontmost(bool frontmost) { frontmost_.store(frontmost); }

 private:
  UI_NodeManager() = default;
  std::atomic<bool> frontmost_{true};
};

}  // namespace ui
}  // namespace plinthview
