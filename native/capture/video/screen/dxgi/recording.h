// The recording thread of a display clip.
#pragma once

#include <memory>

#include "capture/video/frame.h"

namespace capture::video::screen::dxgi {

// Starts a detached thread that records `clip` from the queue until the clip is stopped; it lets
// go of `unfinished` once the file is closed.
void startRecording(const std::shared_ptr<capture::video::FrameQueue>& queue,
                    const std::shared_ptr<capture::video::Clip>& clip, std::shared_ptr<void> unfinished);

}  // namespace capture::video::screen::dxgi
