// The plain logic of the two preview sample callbacks: a camera picture into the frame queue,
// a microphone buffer into two level peaks.
#pragma once

#include <cstdint>

#include "capture/video/frame.h"

namespace capture::video::camera::mfce {

// Copies width x height x 4 bytes of pixels into a frame of the queue's pool (the memory of the
// frame it replaces, so a picture every 33 ms costs no fresh block) that becomes its only one.
void replaceFrame(capture::video::FrameQueue& queue, const uint8_t* pixels, int64_t timestamp);

struct Peaks {
  double left = 0.0;
  double right = 0.0;
};

// Peaks of one buffer of interleaved signed samples (16 or 32 bits; other widths give zeros).
// Only the first 1/channels of the frames are looked at, and only the first two channels.
Peaks scanPeaks(const uint8_t* data, uint32_t length, uint32_t channels, uint32_t bitsPerSample);

}  // namespace capture::video::camera::mfce
