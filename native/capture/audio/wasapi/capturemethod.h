#pragma once

#include "capture/capturemethod.h"

namespace capture::audio::wasapi {

// Audio playback endpoints, the default one first.
class CaptureMethod : public capture::CaptureMethod {
 public:
  bool available() override;
  std::vector<std::shared_ptr<capture::Source>> sources() override;
};

}  // namespace capture::audio::wasapi
