#pragma once

#include <chrono>
#include <cstdint>

namespace capture {

// Milliseconds since 1970-01-01 UTC: the system clock's 100 ns ticks divided by 10000, truncated.
inline int64_t currentTimeMillis() {
  using Ticks = std::chrono::duration<int64_t, std::ratio<1, 10000000>>;
  return std::chrono::duration_cast<Ticks>(std::chrono::system_clock::now().time_since_epoch()).count() / 10000;
}

// Milliseconds of a clock that only runs forward, from an unspecified moment. Pictures and clips
// are timed by it: a step of the system clock (a time service, a user, a virtual machine's time
// sync) must neither stretch a clip nor stall its recording.
inline int64_t steadyMillis() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

}  // namespace capture
