#include "platform/linux/avlog.h"

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

constexpr const char* kFile = "native/platform/linux/avlog";

// "FFmpeg <component>: <text>" without the context's address and without the line end.
std::string describe(void* context, const char* format, va_list arguments) {
  char text[1024];
  std::vsnprintf(text, sizeof text, format, arguments);
  std::string line = "FFmpeg";
  if (context) {
    const AVClass* kind = *static_cast<AVClass**>(context);
    if (kind && kind->item_name) line += std::string(" ") + kind->item_name(context);
  }
  line += ": ";
  line += text;
  while (!line.empty() && (line.back() == '\n' || line.back() == '\r')) line.pop_back();
  return line;
}

void logLine(void* context, int level, const char* format, va_list arguments) {
  if (level > AV_LOG_ERROR) return;
  const std::string text = describe(context, format, arguments);
  try {
    capture::checkResult(kFile, 36, E_FAIL, text.c_str());
  } catch (const std::runtime_error& e) {
    capture::logWarning(e.what());
  }
}

}  // namespace

void routeLog() {
  static std::once_flag once;
  std::call_once(once, [] { av_log_set_callback(logLine); });
}

}  // namespace platform::ffmpeg
