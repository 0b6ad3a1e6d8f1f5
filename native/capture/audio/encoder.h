#pragma once

#include <cstdint>

#include "platform/wave.h"

namespace capture::audio {

// Takes the packets of one audio source and writes them to a file.
class Encoder {
 public:
  virtual ~Encoder() = default;
  // time: presentation time in 100 ns units; 0 means none.
  virtual void write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format, int64_t time) = 0;
  virtual void write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format) {
    write(data, frames, format, 0);
  }
  virtual void finalize() = 0;
};

}  // namespace capture::audio
