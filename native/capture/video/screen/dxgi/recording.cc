#include "capture/video/screen/dxgi/recording.h"

#include <exception>
#include <thread>

#include "capture/log.h"
#include "capture/threadname.h"
#include "capture/video/encoder/mftencoder.h"

namespace capture::video::screen::dxgi {

void startRecording(const std::shared_ptr<capture::video::FrameQueue>& queue,
                    const std::shared_ptr<capture::video::Clip>& clip, std::shared_ptr<void> unfinished) {
  std::thread([queue, clip, unfinished = std::move(unfinished)] {
    capture::nameThread("tavio-record");
    capture::video::encoder::MFTEncoder encoder(clip);
    // A failed clip is reported as a warning and ends only this thread, not the host process.
    try {
      encoder.encode(queue.get());
    } catch (const std::exception& e) {
      capture::logWarning(e.what());
    }
  }).detach();
}

}  // namespace capture::video::screen::dxgi
