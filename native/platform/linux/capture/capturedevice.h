// A capture device as the Linux capture engine reads it, through libavdevice: a V4L2 camera, a
// lavfi test camera (which may encode its pictures to H.264 itself, as an H.264 webcam does) or
// a PulseAudio microphone; what it delivers, and the decoder for that.
#pragma once

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
}

#include <functional>
#include <memory>
#include <string>

#include "platform/linux/mf.h"
#include "platform/linux/pulse/sourcewatch.h"

namespace platform::capturedevice {

class DeviceEncoder;

// What a device delivers, as read when the engine initialises.
struct DeviceFormat {
  GUID subtype = GUID_NULL;
  int width = 0;
  int height = 0;
  AVRational rate{30, 1};
  AVRational aspect{1, 1};
  int sampleRate = 0;
  int channels = 0;
};

// One opened device: demuxer, what the device delivers and its decoder.
struct Input {
  Input();
  ~Input();
  // The packets the device delivers for one read from it: the packet itself, or what a test
  // camera's encoder makes of it.
  void deliver(AVPacket* packet, const std::function<void(AVPacket*)>& to);
  AVFormatContext* format = nullptr;
  int stream = -1;
  std::unique_ptr<DeviceEncoder> encoder;  // H.264 test cameras
  AVCodecParameters* delivered = nullptr;  // the stream's, or the device encoder's
  AVRational timeBase{1, 1};               // of the delivered packets
  AVCodecContext* decoder = nullptr;
  bool keyFrameSeen = false;  // H.264 joined between key frames cannot be decoded before the next
  // Microphones: whether their source is still there.
  std::unique_ptr<pulse::SourceWatch> watch;
};

struct Device {
  bool video = false;
  std::string formatName;  // "v4l2", "lavfi" or "pulse"
  std::string url;
  bool encodesH264 = false;  // a lavfi test camera that looks like an H.264 webcam
  int rate = 48000;          // microphones: what to ask the server for
  int channels = 2;
  DeviceFormat current;
  std::shared_ptr<Input> input;  // shared with the device's reader while it reads
};

// The device behind a device object (an IMFActivate or an IMFAttributes with its link), or null.
std::unique_ptr<Device> deviceFrom(IUnknown* object, bool video);

// Opens the device, learns its current format into device.current and readies its decoder.
HRESULT openInput(Device& device, std::shared_ptr<Input>& result);

// Asks a device that encodes H.264 for a key frame at its next picture.
void requestKeyFrame(Device& device);

// The device's current format as a media type.
HRESULT makeDeviceType(const Device& device, IMFMediaType** type);

}  // namespace platform::capturedevice
