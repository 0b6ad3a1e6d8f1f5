#include "platform/linux/ffmpeg/avlog.h"

extern "C" {
#include <libavutil/log.h>
}

#include <cstdio>
#include <mutex>
#include <stdexcept>
#include <string>

#include "capture/check.h"
#include "capture/log.h"

namespace platform::ffmpeg {

namespace {

// The file's first path: hosts may match warning lines on it, so it stays as it was.
constexpr const char* kFile = "native/platform/linux/avlog";

// "FFmpeg <component>: " for the context that logs (its address left out).
std::string prefix(void* context) {
  std::string line = "FFmpeg";
  if (context) {
    const AVClass* kind = *static_cast<AVClass**>(context);
    if (kind && kind->item_name) line += std::string(" ") + kind->item_name(context);
  }
  return line + ": ";
}

thread_local int quiet = 0;

void logLine(void* context, int level, const char* format, va_list arguments) {
  if (level > AV_LOG_ERROR || quiet > 0) return;
  // FFmpeg writes some messages in pieces, the last one ending the line; each thread's pieces
  // are gathered into one warning.
  thread_local std::string pending;
  thread_local size_t start = 0;
  char text[1024];
  std::vsnprintf(text, sizeof text, format, arguments);
  if (pending.empty()) {
    pending = prefix(context);
    start = pending.size();
  }
  pending += text;
  if (pending.back() != '\n' && pending.size() < 4096) return;
  while (!pending.empty() && (pending.back() == '\n' || pending.back() == '\r' || pending.back() == ' '))
    pending.pop_back();
  if (pending.size() > start) {
    try {
      capture::checkResult(kFile, 46, E_FAIL, pending.c_str());
    } catch (const std::runtime_error& e) {
      capture::logWarning(e.what());
    }
  }
  pending.clear();
}

}  // namespace

QuietLog::QuietLog() { ++quiet; }
QuietLog::~QuietLog() { --quiet; }

void routeLog() {
  static std::once_flag once;
  std::call_once(once, [] { av_log_set_callback(logLine); });
}

}  // namespace platform::ffmpeg
