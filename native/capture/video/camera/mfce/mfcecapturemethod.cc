#include "capture/video/camera/mfce/mfcecapturemethod.h"

namespace capture::video::camera::mfce {

// Placeholder until camera capture lands.
bool MFCECaptureMethod::available() { return true; }
std::vector<std::shared_ptr<capture::Source>> MFCECaptureMethod::sources() { return {}; }
std::vector<std::shared_ptr<capture::audio::Source>> MFCECaptureMethod::audioSources() { return {}; }

}  // namespace capture::video::camera::mfce
