#pragma once

#include "capture/audio/source.h"
#include "capture/capturemethod.h"

namespace capture::video::camera::mfce {

// Cameras (sources()) and the microphones of capture devices (audioSources()).
class MFCECaptureMethod : public virtual capture::CaptureMethod {
 public:
  bool available() override;
  std::vector<std::shared_ptr<capture::Source>> sources() override;
  std::vector<std::shared_ptr<capture::audio::Source>> audioSources();
};

}  // namespace capture::video::camera::mfce
