#pragma once

#include "capture/video/frame.h"

namespace capture::video::encoder {

// Writes a clip of a frame queue's pictures to a file until the clip is stopped.
class Encoder {
 public:
  virtual void encode(capture::video::FrameQueue* queue) = 0;
};

}  // namespace capture::video::encoder
