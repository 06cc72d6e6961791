// Thread identity: which thread is the host's main thread, and which threads
// render.
#include <atomic>
#include <thread>

#include "host/control.h"
#include "host/hk.h"

namespace {

// Written by the static initialiser below and by MakeCurrentThreadMain, read
// by every thread.
std::atomic<std::thread::id> g_mainThread{};

// Runs when the library is loaded. A program linked against rkhost loads it
// before main() on the initial thread, which is what the host calls its main
// thread until it names another one.
struct MainThreadRecorder {
  MainThreadRecorder() { g_mainThread.store(std::this_thread::get_id()); }
};
const MainThreadRecorder g_recordMainThread;

thread_local bool t_isRenderThread = false;

}  // namespace

bool HK_IsOnMainThread() {
  return g_mainThread.load() == std::this_thread::get_id();
}

bool HK_IsOnRenderThread() {
  return t_isRenderThread;
}

namespace rkhost {
namespace control {

void MakeCurrentThreadMain() {
  g_mainThread.store(std::this_thread::get_id());
}

void SetCurrentThreadIsRenderThread(bool isRender) {
  t_isRenderThread = isRender;
}

}  // namespace control
}  // namespace rkhost
