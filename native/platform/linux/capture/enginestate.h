// What a Linux capture engine shares with its engine thread and its device readers: the commands
// queued for the thread, what the readers hand over, the devices and the sinks' streams.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

extern "C" {
#include <libavcodec/avcodec.h>
}

#include "platform/linux/capture/capturedevice.h"
#include "platform/linux/mfcapture.h"

namespace platform::engine {

using capturedevice::Device;

struct SinkStream {
  DWORD source = 0;  // which device stream: video or audio
  bool video = false;
  ComPtr<IMFMediaType> type;
  ComPtr<IMFCaptureEngineOnSampleCallback> callback;
};

enum class Command { StartPreview, StopPreview, StartRecord, StopRecord, Quit };

// A command as it was given: when, and for a record start the sink's settings at that moment.
struct Order {
  Order(Command command, int64_t at) : command(command), at(at) {}
  Command command;
  int64_t at;  // av_gettime_relative() of the call
  std::string path;
  std::vector<SinkStream> streams;
};

// What a device's reader handed over: a packet, or the failure that ended its reads.
struct Arrival {
  uint64_t generation = 0;  // of the device's opening; packets of an earlier one are dropped
  bool video = false;
  AVPacket* packet = nullptr;
  int64_t readAt = 0;
  int error = 0;
};

inline bool isVideoStream(DWORD index) {
  return index == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW ||
         index == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD;
}

// Everything the engine, its source, its sinks, its thread and the device readers share.
struct EngineState {
  ~EngineState() {
    for (Arrival& arrival : arrivals) av_packet_free(&arrival.packet);
  }
  std::mutex mutex;
  std::condition_variable changed;
  std::deque<Order> commands;
  std::deque<Arrival> arrivals;
  bool initialized = false;
  HRESULT initStatus = S_OK;
  ComPtr<IMFCaptureEngineOnEventCallback> events;
  std::unique_ptr<Device> video;
  std::unique_ptr<Device> audio;
  std::vector<SinkStream> previewStreams;
  std::vector<SinkStream> recordStreams;
  std::string recordPath;
  bool previewing = false;
  bool recording = false;  // a clip has started and its StopRecord has not been taken yet
  std::thread::id threadId;

  // The device behind a source stream index, or null.
  Device* deviceFor(DWORD index) {
    if (isVideoStream(index)) return video.get();
    if (index == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO) return audio.get();
    std::vector<Device*> all;
    if (video) all.push_back(video.get());
    if (audio) all.push_back(audio.get());
    return index < all.size() ? all[index] : nullptr;
  }
  void waitInitialized(std::unique_lock<std::mutex>& lock) {
    changed.wait(lock, [this] { return initialized; });
  }
};

// The engine thread's loop: runs the queued commands and delivers what the readers hand over
// until a Quit command.
void runEngineThread(std::shared_ptr<EngineState> state);

}  // namespace platform::engine
