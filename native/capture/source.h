// The interface of every capture device the add-on offers to JavaScript.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace capture {

enum SourceType : int32_t {
  Screen = 0,
  AudioEndpoint = 1,
  CameraMicrophone = 2,
  CameraVideo = 3,
};

class Source {
 public:
  virtual ~Source() = default;
  virtual int32_t type() = 0;
  virtual bool isAudio() { return type() == AudioEndpoint || type() == CameraMicrophone; }
  virtual bool isVideo() { return !isAudio(); }
  virtual std::string name() = 0;
  virtual void startPreview() = 0;
  virtual void stopPreview() = 0;
  virtual void capture() = 0;
  virtual void stopCapturing() = 0;
  virtual void startEncode(std::string filename) = 0;
  virtual void stopEncode() = 0;
  // For a host that ends while it records: endClip ends the clip that records at this moment,
  // without waiting for its file; finishClips stops it if it still records and returns once every
  // clip of this source is in its file, or at the deadline.
  virtual void endClip() { stopEncode(); }
  virtual void finishClips(std::chrono::steady_clock::time_point /*deadline*/) {}
  virtual bool selected() = 0;
};

}  // namespace capture
