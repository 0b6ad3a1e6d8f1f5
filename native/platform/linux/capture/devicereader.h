// Reads one opened capture device on a thread of its own. A read can block for as long as the
// device likes (a microphone may hand over seconds of sound at once), so the engine's thread never
// reads: it takes what the reader delivered and keeps answering its commands.
#pragma once

extern "C" {
#include <libavcodec/packet.h>
}

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/linux/capture/capturedevice.h"

namespace platform::capturedevice {

class DeviceReader {
 public:
  // Called on the reader's thread for each packet read (the callee owns it), with the time
  // (av_gettime_relative, µs) at which the read returned; a failed read comes as a null packet and
  // its error, and ends the thread.
  using Deliver = std::function<void(AVPacket* packet, int64_t readAt, int error)>;

  // waitOnStop: the destructor waits (a second at most) for the read in progress to end and the
  // device to be closed, for devices that cannot be opened twice (V4L2).
  DeviceReader(std::shared_ptr<Input> input, Deliver deliver, bool waitOnStop);
  // Asks the thread to end after its read in progress; it keeps the input open until then.
  ~DeviceReader();
  DeviceReader(const DeviceReader&) = delete;
  DeviceReader& operator=(const DeviceReader&) = delete;

 private:
  struct Shared;
  std::shared_ptr<Shared> shared_;
  bool waitOnStop_;
};

}  // namespace platform::capturedevice
