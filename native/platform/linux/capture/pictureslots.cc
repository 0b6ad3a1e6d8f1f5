#include "platform/linux/capture/pictureslots.h"

#include <algorithm>

namespace platform::pictureslots {

namespace {

// Division rounding down, also for negative times (a first picture read before the start).
int64_t floorDiv(int64_t a, int64_t b) { return a / b - (a % b < 0 ? 1 : 0); }

}  // namespace

void PictureSlots::open(int64_t deviceTime, int64_t readTime, int64_t slot) {
  opened_ = true;
  firstDeviceTime_ = deviceTime;
  origin_ = slot > 0 ? floorDiv(readTime, slot) * slot : readTime;
}

int64_t PictureSlots::place(int64_t deviceTime, int64_t readTime, int64_t slot) {
  const int64_t since = deviceTime - firstDeviceTime_;
  if (slot <= 0) return std::max<int64_t>(0, std::min(origin_ + since, readTime));
  int64_t time = origin_ + floorDiv(since + slot / 2, slot) * slot;
  // The first picture's read may have come later than the others': the count moves back by as
  // many slots as it must, rather than keep the pictures that much after their reads (and past the
  // clip's stop). A device clock that jumps forward is caught here too.
  const int64_t excess = time - readTime - slot / 2;
  if (excess > 0) {
    const int64_t back = (excess + slot - 1) / slot * slot;
    origin_ -= back;
    time -= back;
  }
  return std::max<int64_t>(0, time);
}

}  // namespace platform::pictureslots
