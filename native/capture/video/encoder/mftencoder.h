// Writes a frame queue to an H.264 MP4 file through a Media Foundation sink writer.
#pragma once

#include <cstdint>

#include "capture/video/encoder/encoder.h"
#include "platform/mf.h"

namespace capture::video::encoder {

class MFTEncoder : public Encoder {
 public:
  MFTEncoder();
  ~MFTEncoder();
  MFTEncoder(const MFTEncoder&) = delete;
  MFTEncoder& operator=(const MFTEncoder&) = delete;

  // Records until queue->stopped is seen after a written frame, then finalises the file.
  // Throws std::runtime_error on any failure, after shutting Media Foundation down again.
  void encode(capture::video::FrameQueue* queue) override;

 private:
  void configure();
  void writeFrame();

  IMFSinkWriter* writer = nullptr;
  DWORD streamIndex = 0;
  capture::video::FrameQueue* queue = nullptr;
  int64_t firstTimestamp;  // ms; 0 = no frame written yet
  uint64_t frameCount;
};

}  // namespace capture::video::encoder
