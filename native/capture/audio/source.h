#pragma once

#include <cstdint>

#include "capture/source.h"

namespace capture::audio {

class Source : public virtual capture::Source {
 public:
  virtual uint16_t channels() = 0;
  virtual double peak(int32_t channel) = 0;
};

}  // namespace capture::audio
