// The performance counter on Linux: the monotonic clock in 100 ns units, the same clock the
// audio client stamps loopback packets with.
#include <ctime>

#include "platform/linux/kernel32.h"

namespace {
constexpr LONGLONG kUnitsPerSecond = 10000000;
}

BOOL QueryPerformanceCounter(LARGE_INTEGER* count) {
  if (!count) return FALSE;
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  count->QuadPart = static_cast<LONGLONG>(now.tv_sec) * kUnitsPerSecond + now.tv_nsec / 100;
  return TRUE;
}

BOOL QueryPerformanceFrequency(LARGE_INTEGER* frequency) {
  if (!frequency) return FALSE;
  frequency->QuadPart = kUnitsPerSecond;
  return TRUE;
}
