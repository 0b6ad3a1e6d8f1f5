#pragma once

#include <cstdint>

#include "capture/source.h"

namespace capture::video {

class Source : public virtual capture::Source {
 public:
  // Scales the newest frame into dst (dstWidth x dstHeight, 4 bytes a pixel); false when no
  // frame is held yet, and dst is then untouched.
  virtual bool preview(uint8_t* dst, uint32_t swapRedBlue, int32_t dstWidth, int32_t dstHeight) = 0;
  virtual uint32_t width() = 0;
  virtual uint32_t height() = 0;
  virtual int32_t size() = 0;
  virtual int32_t pixelWidth() = 0;
  virtual int32_t channelOrder() = 0;
};

}  // namespace capture::video
