#pragma once

#include "capture/video/frame.h"

namespace capture::video::encoder {

// Writes a frame queue to a file until the queue's stopped flag is seen.
class Encoder {
 public:
  virtual void encode(capture::video::FrameQueue* queue) = 0;
};

}  // namespace capture::video::encoder
