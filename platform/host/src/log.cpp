// The host's logger: every line is captured, then written through one sink
// if its level passes the filter. The default sink writes one readable line
// to stderr: "<local time> L<level> <module> <tag>: <text>".
#include <atomic>
#include <boost/date_time/posix_time/posix_time.hpp>
#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <string>

#include "host/hk.h"
#include "internal.h"

namespace rkhost {
namespace {

using Sink = boost::function<void(const std::string&)>;

std::atomic<int> g_logLevel{10};

struct SinkState {
  std::mutex mutex;                  // guards sink
  std::shared_ptr<const Sink> sink;  // null: stderr
  std::recursive_mutex writeMutex;   // one line at a time; a sink may log again
};

SinkState& State() {
  static SinkState* state = new SinkState;  // never destroyed: logging works during exit
  return *state;
}

std::string FormatLine(int level, const std::string& module, const std::string& tag,
                       const std::string& text) {
  namespace pt = boost::posix_time;
  std::string line = pt::to_iso_extended_string(pt::microsec_clock::local_time());
  line += " L" + std::to_string(level) + ' ' + module + ' ' + tag + ": " + text;
  return line;
}

// vsnprintf into a string of the right length.
std::string FormatV(const char* format, va_list args) {
  if (format == nullptr) return std::string();
  va_list copy;
  va_copy(copy, args);
  const int length = std::vsnprintf(nullptr, 0, format, copy);
  va_end(copy);
  if (length <= 0) return std::string();
  std::string text(static_cast<std::size_t>(length), '\0');
  std::vsnprintf(text.data(), text.size() + 1, format, args);
  return text;
}

std::string OrEmpty(const char* text) {
  return text != nullptr ? std::string(text) : std::string();
}

}  // namespace

namespace detail {

void WriteLogLine(int level, const std::string& module, const std::string& tag, const std::string& text) {
  CaptureLogLine(control::LogLine{level, module, tag, text});
  if (level > g_logLevel.load(std::memory_order_relaxed)) return;

  SinkState& state = State();
  std::shared_ptr<const Sink> sink;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    sink = state.sink;
  }
  const std::string line = FormatLine(level, module, tag, text);
  std::lock_guard<std::recursive_mutex> write(state.writeMutex);
  if (sink) {
    // A failing sink must not turn a log call into an error of the caller
    // (the module logs from destructors); the line goes to stderr instead.
    try {
      (*sink)(line);
    } catch (...) {
      std::fprintf(stderr, "%s\n(log sink failed)\n", line.c_str());
    }
  } else {
    std::fprintf(stderr, "%s\n", line.c_str());
  }
}

}  // namespace detail

namespace control {

void SetLogLevel(int level) {
  g_logLevel.store(level);
}

void SetLogSink(const boost::function<void(const std::string&)>& sink) {
  SinkState& state = State();
  std::shared_ptr<const Sink> next = sink ? std::make_shared<const Sink>(sink) : nullptr;
  std::lock_guard<std::mutex> lock(state.mutex);
  state.sink = std::move(next);
}

}  // namespace control
}  // namespace rkhost

void JOT_Log(int level, const char* module, const char* tag, const char* message) {
  rkhost::detail::WriteLogLine(level, rkhost::OrEmpty(module), rkhost::OrEmpty(tag),
                               rkhost::OrEmpty(message));
}

void JOT_sprintf(int level, const char* module, const char* tag, const char* format, ...) {
  va_list args;
  va_start(args, format);
  std::string text = rkhost::FormatV(format, args);
  va_end(args);
  rkhost::detail::WriteLogLine(level, rkhost::OrEmpty(module), rkhost::OrEmpty(tag), text);
}

std::string JOT_convertMesg(const char* operation, const char* format, ...) {
  va_list args;
  va_start(args, format);
  std::string text = rkhost::FormatV(format, args);
  va_end(args);
  return rkhost::OrEmpty(operation) + ": " + text;
}
