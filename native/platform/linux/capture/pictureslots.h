// Where a device's pictures go in a clip: on the grid of the device's frame rate, one slot a
// picture. The slot comes from the picture's device time, which is steadier than the moment its
// read returns: on a busy machine reads come late by varying amounts, and a slot taken from them
// would put two neighbours in one slot (the later replacing the earlier) and leave another empty.
#pragma once

#include <cstdint>

namespace platform::pictureslots {

// Times are media times (100 ns), counted from the clip's start.
class PictureSlots {
 public:
  // The clip's first picture, shown from the start: its device time and when it was read.
  void open(int64_t deviceTime, int64_t readTime, int64_t slot);
  bool opened() const { return opened_; }
  // The start of a later picture's slot, on a grid of `slot`-long slots from the clip's start:
  // the device's frames since the first picture, counted on from the first picture's slot. Never
  // before the start, and never more than half a slot after the picture's read.
  int64_t place(int64_t deviceTime, int64_t readTime, int64_t slot);

 private:
  bool opened_ = false;
  int64_t firstDeviceTime_ = 0;
  int64_t origin_ = 0;  // the first picture's slot, moved back when reads show it was read late
};

}  // namespace platform::pictureslots
