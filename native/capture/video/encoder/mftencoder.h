// Writes a display clip to an H.264 MP4 file through a Media Foundation sink writer.
#pragma once

#include <cstdint>
#include <memory>

#include "capture/video/encoder/encoder.h"
#include "platform/mf.h"

namespace capture::video::encoder {

class MFTEncoder : public Encoder {
 public:
  explicit MFTEncoder(std::shared_ptr<capture::video::Clip> clip);
  ~MFTEncoder();
  MFTEncoder(const MFTEncoder&) = delete;
  MFTEncoder& operator=(const MFTEncoder&) = delete;

  // Records the clip from its start to its stop, then finalises the file. The picture current
  // at the start is at time 0, later pictures at their capture times, a still picture is
  // repeated at the declared rate, and the picture current at the stop lasts until the stop.
  // Throws std::runtime_error on any failure, after shutting Media Foundation down again.
  void encode(capture::video::FrameQueue* queue) override;

 private:
  void configure();
  void record();
  void finish();
  // The next picture to write, or null when the clip stopped first; `repeat` says the last
  // picture is due again.
  std::unique_ptr<Frame> nextPicture(bool& repeat);
  void write(std::unique_ptr<Frame> picture, LONGLONG time);
  void writeFrame(const Frame& frame, LONGLONG time);

  std::shared_ptr<capture::video::Clip> clip;
  ComPtr<IMFSinkWriter> writer;
  DWORD streamIndex = 0;
  capture::video::FrameQueue* queue = nullptr;
  std::unique_ptr<Frame> last;  // the picture written last, for repeats
  LONGLONG lastTime = -1;       // its sample time, 100 ns since the clip's start
  int64_t lastTimestamp = 0;    // its capture time, ms since 1970
  uint64_t frameCount = 0;
  // The last picture's buffer, used again once the sink writer holds no reference to it.
  ComPtr<IMFMediaBuffer> spareBuffer;
};

}  // namespace capture::video::encoder
