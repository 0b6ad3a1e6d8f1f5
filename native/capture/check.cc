#include "capture/check.h"

#include <cstdio>
#include <ctime>
#include <sstream>

namespace capture {

namespace {

// The local time in asctime's form, "Mon Nov 16 10:38:20 2026\n", without asctime's shared buffer.
std::string asctimeNow() {
  static const char days[7][4] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
  static const char months[12][4] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                     "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  std::time_t now = std::time(nullptr);
  std::tm local{};
#ifdef _WIN32
  localtime_s(&local, &now);
#else
  localtime_r(&now, &local);
#endif
  char text[64];  // 26 bytes in practice; room for any int the compiler can imagine
  std::snprintf(text, sizeof text, "%.3s %.3s%3d %.2d:%.2d:%.2d %d\n", days[local.tm_wday], months[local.tm_mon],
                local.tm_mday, local.tm_hour, local.tm_min, local.tm_sec, 1900 + local.tm_year);
  return text;
}

}  // namespace

std::string systemMessage(HRESULT hr, const char* text, uint32_t length) {
  if (text && length > 0) {
    std::string message(text, length);
    if (message.size() >= 2 && message.back() == '\n') {
      message.pop_back();
      if (message.back() == '\r') message.pop_back();
    }
    return message;
  }
  const uint32_t code = static_cast<uint32_t>(hr);
  char fallback[32];
  if (code >= 0x80040200u && code <= 0x8004FFFFu && (code & 0xFFFFu) - 0x200u != 0)
    std::snprintf(fallback, sizeof fallback, "IDispatch error #%d", static_cast<int>((code & 0xFFFFu) - 0x200u));
  else
    std::snprintf(fallback, sizeof fallback, "Unknown error 0x%0lX", static_cast<unsigned long>(code));
  return fallback;
}

std::string systemMessage(HRESULT hr) {
  char* text = nullptr;
  DWORD length =
      FormatMessageA(FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                     nullptr, static_cast<DWORD>(hr), 0, reinterpret_cast<LPSTR>(&text), 0, nullptr);
  std::string message = systemMessage(hr, length ? text : nullptr, length);
  if (text) LocalFree(text);
  return message;
}

void checkResult(const char* file, int32_t line, HRESULT hr, const char* message) {
  if (hr >= 0) return;
  std::ostringstream text;
  text << asctimeNow() << '\t' << file << '(' << line << "): 0x" << std::hex << static_cast<uint32_t>(hr) << std::dec
       << ": " << message << " (" << systemMessage(hr) << ')';
  // std::runtime_error keeps its own reference-counted copy of the text, so it stays valid
  // wherever the exception travels; no separate heap copy is needed.
  throw std::runtime_error(text.str());
}

}  // namespace capture
