#include "capture/video/screen/dxgi/capturemethod.h"

namespace capture::video::screen::dxgi {

// Placeholder until display capture lands.
bool CaptureMethod::available() { return true; }
std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() { return {}; }

}  // namespace capture::video::screen::dxgi
