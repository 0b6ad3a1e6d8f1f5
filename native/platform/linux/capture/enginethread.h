// The engine thread of a Linux capture engine, in three files by what they handle:
// enginethread.cc its commands, the devices, and each clip's start and end; enginevideo.cc the
// pictures (preview, encoded clips, H.264 passed through); engineaudio.cc the microphone's sound.
#pragma once

extern "C" {
#include <libavcodec/avcodec.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

#include <cstdint>
#include <deque>
#include <memory>
#include <vector>

#include "platform/com.h"
#include "platform/linux/capture/devicereader.h"
#include "platform/linux/capture/enginestate.h"
#include "platform/linux/capture/pictureslots.h"
#include "platform/linux/ffmpeg/evenpicture.h"
#include "platform/linux/mfcapture.h"

namespace platform::engine {

using capturedevice::DeviceFormat;

constexpr LONGLONG ticksPerSecond = 10000000;  // media times are in 100 ns units

// A sample over buffer, whose first length bytes fill(data) writes.
template <class Fill>
HRESULT fillSample(IMFMediaBuffer* buffer, DWORD length, LONGLONG time, LONGLONG duration, Fill fill,
                   IMFSample** sample) {
  BYTE* data = nullptr;
  HRESULT hr = buffer->Lock(&data, nullptr, nullptr);
  if (SUCCEEDED(hr)) {
    fill(data);
    buffer->Unlock();
    hr = buffer->SetCurrentLength(length);
  }
  ComPtr<IMFSample> made;
  if (SUCCEEDED(hr)) hr = MFCreateSample(made.GetAddressOf());
  if (SUCCEEDED(hr)) hr = made->AddBuffer(buffer);
  if (SUCCEEDED(hr)) hr = made->SetSampleTime(time);
  if (SUCCEEDED(hr)) hr = made->SetSampleDuration(duration);
  if (FAILED(hr)) return hr;
  *sample = made.Detach();
  return S_OK;
}

// The engine's I420 pictures: rows of the even width (what the encoder's stride is), chroma rows
// rounded up.
struct I420Layout {
  I420Layout(int width, int height)
      : lumaStride(evenpicture::evenSize(width)),
        chromaStride(lumaStride / 2),
        lumaSize(static_cast<size_t>(lumaStride) * height),
        chromaSize(static_cast<size_t>(chromaStride) * ((height + 1) / 2)) {}
  DWORD length() const { return static_cast<DWORD>(lumaSize + 2 * chromaSize); }
  int lumaStride;
  int chromaStride;
  size_t lumaSize;
  size_t chromaSize;
};

// A sample holding a copy of bytes, or pixels written by fill(data), in a buffer of its own.
template <class Fill>
HRESULT makeSample(DWORD length, LONGLONG time, LONGLONG duration, Fill fill, IMFSample** sample) {
  ComPtr<IMFMediaBuffer> buffer;
  HRESULT hr = MFCreateMemoryBuffer(length, buffer.GetAddressOf());
  if (FAILED(hr)) return hr;
  return fillSample(buffer.Get(), length, time, duration, fill, sample);
}

// One clip: the record sink's writer and its converters, from record start until the file is
// finished. A clip covers the interval from the StartRecord call to the StopRecord call: what the
// devices captured in it goes in, a picture lasts until the next one (the last one until the
// stop), and sound missing at the ends is silence.
struct Recording {
  ~Recording() { swr_free(&resampler); }
  LONGLONG sinceStart(int64_t at) const { return (at - startAt) * 10; }  // engine time (µs) to media time
  ComPtr<IMFSinkWriter> writer;
  int64_t startAt = 0;     // engine time (µs) of the StartRecord call
  int64_t stopAt = 0;      // of the StopRecord call; 0 while it records
  HRESULT failure = S_OK;  // the first write that failed; nothing is written after it
  DWORD videoStream = 0;
  DWORD audioStream = 0;
  bool hasVideo = false;
  bool hasAudio = false;
  bool videoPassthrough = false;  // the device's H.264 packets go into the file as they are
  bool padded = false;            // an odd-sized picture is encoded at the next even size
  int width = 0;                  // the device's picture size
  int height = 0;
  LONGLONG frameDuration = 0;  // at the device's frame rate
  // The last picture, written when the next one shows how long it lasted.
  ComPtr<IMFSample> held;
  LONGLONG heldTime = 0;
  pictureslots::PictureSlots slots;  // opened by the clip's first picture that has a device time
  bool videoDone = false;            // a picture from after the stop has come
  SwrContext* resampler = nullptr;
  int audioRate = 0;
  int audioChannels = 0;
  LONGLONG audioSamples = 0;
  int64_t audioReachedAt = INT64_MIN;  // engine time (µs) up to which sound has come
};

// What a clip shows when its camera sent no picture: black, in the form the encoder takes.
ComPtr<IMFSample> blackPicture(const Recording& recording);

class EngineThread {
 public:
  explicit EngineThread(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  void run();

 private:
  // Commands, devices, and each clip's start and end (enginethread.cc).
  void send(const GUID& type, HRESULT status);
  HRESULT openDevices();
  void closeDevices();
  void execute(Order& order);
  HRESULT startRecording(const Order& order);
  HRESULT addStream(Recording& recording, const SinkStream& stream);
  void stopRecording(int64_t at);
  void finishDue(bool all);
  HRESULT finish(Recording& recording);
  int64_t nextDeadline() const;
  void fail(HRESULT status);
  void arrive(Arrival& arrival);
  void receive(Device& device, AVPacket* packet, int64_t readAt);
  void write(Recording& recording, DWORD stream, IMFSample* sample);
  std::vector<Recording*> recordings();
  // Pictures (enginevideo.cc).
  static IMFMediaBuffer* pooledBuffer(std::vector<ComPtr<IMFMediaBuffer>>& pool, DWORD length);
  void deliverVideo(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt);
  void recordPicture(Recording& recording, IMFSample* bgra, IMFSample* i420, LONGLONG deviceTime, int64_t readAt);
  void writeHeld(Recording& recording, LONGLONG duration);
  void passThrough(Recording& recording, const AVPacket* packet, AVRational timeBase, int64_t readAt);
  // Sound (engineaudio.cc).
  bool soundCanComeBy(int64_t due) const;
  void deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt);
  void recordSound(Recording& recording, AVFrame* frame, int64_t capturedAt);
  void writeSound(Recording& recording, const uint8_t* data, int samples);

  std::shared_ptr<EngineState> state_;
  std::unique_ptr<Recording> current_;                       // the clip being recorded
  std::vector<std::unique_ptr<Recording>> finishing_;        // stopped clips waiting for their last data
  std::unique_ptr<capturedevice::DeviceReader> readers_[2];  // video, audio
  uint64_t generations_[2] = {0, 0};
  SwsContext* toI420_ = nullptr;  // the device's pictures into I420 at the device's size
  SwsContext* toBgra_ = nullptr;  // and those into the preview's BGRA
  AVFrame* frame_ = nullptr;
  // Picture buffers (BGRA, I420), used again when nothing else holds them any more (the preview
  // copies a picture, the sink writer encodes it at once): a new one for each picture costs the
  // kernel a fresh zeroed page for every 4 KB of it.
  std::vector<ComPtr<IMFMediaBuffer>> pictures_;
  std::vector<ComPtr<IMFMediaBuffer>> i420Pictures_;
  // The picture current now, which a clip starting now opens with.
  ComPtr<IMFSample> lastPicture_;
  ComPtr<IMFSample> lastI420_;
  LONGLONG lastPictureTime_ = 0;
  int64_t lastPictureReadAt_ = 0;
  AVFrame* lastSound_ = nullptr;       // the microphone's last buffer
  int64_t lastSoundAt_ = 0;            // when its first sample was captured (engine time, µs)
  std::deque<int64_t> soundArrivals_;  // when its buffers were read (engine time, µs), oldest first
  int64_t wallOffset_ = 0;             // system clock minus engine time at its last buffer; 0: none yet
  int64_t stampsFrom_ = 0;             // engine time from which its stamps are believed
};

}  // namespace platform::engine
