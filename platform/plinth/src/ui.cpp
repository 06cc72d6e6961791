#include "plinthview/ui.h"

#include <mutex>

namespace plinthview {
namespace ui {

namespace {
std::atomic<UI_NodeManager*> g_manager{nullptr};
std::mutex g_createMutex;
}  // namespace

UI_NodeManager* UI_NodeManager::Get(bool onlyIfExists) {
  UI_NodeManager* m = g_manager.load(std::memory_order_acquire);
  if (m != nullptr || onlyIfExists) return m;
  std::lock_guard<std::mutex> lock(g_createMutex);
  m = g_manager.load(std::memory_order_relaxed);
  if (m == nullptr) {
    // Lives for the rest of the process: callers keep the raw pointer.
    m = new UI_NodeManager;
    g_manager.store(m, std::memory_order_release);
  }
  return m;
}

}  // namespace ui
}  // namespace plinthview
