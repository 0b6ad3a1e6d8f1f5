#pragma once

#include "capture/capturemethod.h"

namespace capture::video::screen::dxgi {

// Displays: one source per output of every adapter.
class CaptureMethod : public capture::CaptureMethod {
 public:
  bool available() override;
  std::vector<std::shared_ptr<capture::Source>> sources() override;
};

}  // namespace capture::video::screen::dxgi
