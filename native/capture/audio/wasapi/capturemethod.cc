#include "capture/audio/wasapi/capturemethod.h"

namespace capture::audio::wasapi {

// Placeholder until audio endpoint capture lands.
bool CaptureMethod::available() { return true; }
std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() { return {}; }

}  // namespace capture::audio::wasapi
