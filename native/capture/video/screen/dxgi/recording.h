// The recording thread of a display clip.
#pragma once

#include <memory>

#include "capture/video/frame.h"

namespace capture::video::screen::dxgi {

// Starts a detached thread that encodes the queue until its stopped flag is seen.
void startRecording(std::shared_ptr<capture::video::FrameQueue> queue);

}  // namespace capture::video::screen::dxgi
