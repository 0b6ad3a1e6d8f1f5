// The thread of a Linux capture engine: it opens the device (capturedevice.h)
// while a preview or a recording runs, decodes what the device's reader (devicereader.h) hands
// over, gives ARGB32 pictures and PCM buffers to the preview sink's callbacks, feeds the record
// sink's sink writer (I420 pictures, converted once from what the device sends and shared with the
// preview's conversion), and delivers the engine's events to its event callback. Callers only queue
// commands, and since the thread never reads a device itself, it takes them between two packets.
// A camera that sends H.264 is recorded as it sends it when the record stream asks for H.264
// without a bit rate of its own; its pictures are still decoded for the preview.
// Engine time is av_gettime_relative(): a step of the system clock moves no clip's start or stop.
extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/opt.h>
#include <libavutil/time.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

#include <algorithm>
#include <cstdint>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/com.h"
#include "platform/linux/capture/devicereader.h"
#include "platform/linux/capture/enginestate.h"
#include "platform/linux/capture/pictureslots.h"
#include "platform/linux/ffmpeg/evenpicture.h"
#include "platform/linux/mf/mfattributes.h"

namespace platform::engine {

namespace {

using capturedevice::DeviceFormat;
using capturedevice::Input;
using capturedevice::openInput;
using capturedevice::requestKeyFrame;

constexpr LONGLONG ticksPerSecond = 10000000;  // media times are in 100 ns units

class MediaEvent : public Attributes<IMFMediaEvent, IID_IMFMediaEvent> {
 public:
  MediaEvent(const GUID& type, HRESULT status) : type_(type), status_(status) {}
  HRESULT GetExtendedType(GUID* type) override {
    if (!type) return E_POINTER;
    *type = type_;
    return S_OK;
  }
  HRESULT GetStatus(HRESULT* status) override {
    if (!status) return E_POINTER;
    *status = status_;
    return S_OK;
  }
  HRESULT GetValue(PROPVARIANT* value) override {
    if (!value) return E_POINTER;
    PropVariantInit(value);
    return S_OK;
  }

 private:
  GUID type_;
  HRESULT status_;
};

// When a decoded frame was captured, in its stream's time base.
int64_t timeOf(const AVFrame* frame) {
  return frame->best_effort_timestamp != AV_NOPTS_VALUE ? frame->best_effort_timestamp : frame->pts;
}

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
ComPtr<IMFSample> blackPicture(const Recording& recording) {
  ComPtr<IMFSample> sample;
  if (recording.padded) {  // top-down BGRA of the device's size
    const auto length = static_cast<DWORD>(recording.width * recording.height * 4);
    makeSample(
        length, 0, 0,
        [&](BYTE* data) {
          for (DWORD i = 0; i < length; i += 4) {
            data[i] = data[i + 1] = data[i + 2] = 0;
            data[i + 3] = 0xFF;
          }
        },
        sample.GetAddressOf());
  } else {  // limited-range I420, as the engine converts to
    const I420Layout layout(recording.width, recording.height);
    makeSample(
        layout.length(), 0, 0,
        [&](BYTE* data) {
          std::fill_n(data, layout.lumaSize, 16);
          std::fill_n(data + layout.lumaSize, 2 * layout.chromaSize, 128);
        },
        sample.GetAddressOf());
  }
  return sample;
}

constexpr int64_t videoGrace = 250000;     // µs after the stop to wait for the stop's picture
constexpr int64_t soundGrace = 500000;     // and for its sound, which may come in large lumps
constexpr int64_t soundHistory = 5000000;  // how far back the microphone's deliveries are kept
// The pulse input stamps sound by the system clock, smoothed over its recent buffers: after a step
// of that clock its stamps stray by up to the step for about a second. Until they have settled,
// sound is timed by when it was read.
constexpr int64_t clockStep = 10000;        // µs the system clock moved against engine time
constexpr int64_t stampSettling = 3000000;  // µs after a step before stamps are believed again

class EngineThread {
 public:
  explicit EngineThread(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  void run();

 private:
  void send(const GUID& type, HRESULT status);
  HRESULT openDevices();
  void closeDevices();
  void execute(Order& order);
  HRESULT startRecording(const Order& order);
  void stopRecording(int64_t at);
  void finishDue(bool all);
  HRESULT finish(Recording& recording);
  int64_t nextDeadline() const;
  bool soundCanComeBy(int64_t due) const;
  void fail(HRESULT status);
  void arrive(Arrival& arrival);
  void receive(Device& device, AVPacket* packet, int64_t readAt);
  void passThrough(Recording& recording, const AVPacket* packet, AVRational timeBase, int64_t readAt);
  static IMFMediaBuffer* pooledBuffer(std::vector<ComPtr<IMFMediaBuffer>>& pool, DWORD length);
  void deliverVideo(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt);
  void deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt);
  void recordPicture(Recording& recording, IMFSample* bgra, IMFSample* i420, LONGLONG deviceTime, int64_t readAt);
  void writeHeld(Recording& recording, LONGLONG duration);
  void recordSound(Recording& recording, AVFrame* frame, int64_t capturedAt);
  void writeSound(Recording& recording, const uint8_t* data, int samples);
  void write(Recording& recording, DWORD stream, IMFSample* sample);
  std::vector<Recording*> recordings();

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

void EngineThread::send(const GUID& type, HRESULT status) {
  ComPtr<IMFCaptureEngineOnEventCallback> callback;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    callback = state_->events;
  }
  if (!callback) return;
  ComPtr<IMFMediaEvent> event;
  event.Attach(new MediaEvent(type, status));
  callback->OnEvent(event.Get());
}

HRESULT EngineThread::openDevices() {
  Device* devices[2] = {state_->video.get(), state_->audio.get()};
  for (int i = 0; i < 2; ++i) {
    Device* device = devices[i];
    if (!device || device->input) continue;
    HRESULT hr = openInput(*device, device->input);
    if (FAILED(hr)) {
      device->input.reset();
      return hr;
    }
    const uint64_t generation = ++generations_[i];
    const bool video = device->video;
    std::weak_ptr<EngineState> weak = state_;
    readers_[i] = std::make_unique<capturedevice::DeviceReader>(
        device->input,
        [weak, generation, video](AVPacket* packet, int64_t readAt, int error) {
          std::shared_ptr<EngineState> state = weak.lock();
          if (!state) {
            av_packet_free(&packet);
            return;
          }
          {
            std::lock_guard<std::mutex> lock(state->mutex);
            state->arrivals.push_back({generation, video, packet, readAt, error});
          }
          state->changed.notify_all();
        },
        device->formatName == "v4l2");
  }
  return S_OK;
}

void EngineThread::closeDevices() {
  Device* devices[2] = {state_->video.get(), state_->audio.get()};
  for (int i = 0; i < 2; ++i) {
    readers_[i].reset();
    ++generations_[i];  // whatever the old reader still hands over is dropped
    if (devices[i]) devices[i]->input.reset();
  }
  pictures_.clear();
  i420Pictures_.clear();
  lastPicture_ = ComPtr<IMFSample>();
  lastI420_ = ComPtr<IMFSample>();
  av_frame_unref(lastSound_);
  soundArrivals_.clear();
  wallOffset_ = 0;
  stampsFrom_ = 0;
  sws_freeContext(toI420_);
  toI420_ = nullptr;
  sws_freeContext(toBgra_);
  toBgra_ = nullptr;
}

std::vector<Recording*> EngineThread::recordings() {
  std::vector<Recording*> all;
  for (auto& recording : finishing_) all.push_back(recording.get());
  if (current_) all.push_back(current_.get());
  return all;
}

HRESULT EngineThread::startRecording(const Order& order) {
  if (order.path.empty() || order.streams.empty()) return MF_E_INVALIDREQUEST;
  auto recording = std::make_unique<Recording>();
  recording->startAt = order.at;
  const std::wstring url = widen(order.path);
  // Fragmented MP4: what was written before a failed write (a full disk) stays a file that plays.
  ComPtr<IMFAttributes> settings;
  HRESULT hr = MFCreateAttributes(settings.GetAddressOf(), 1);
  if (SUCCEEDED(hr)) hr = settings->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_FMPEG4);
  if (SUCCEEDED(hr))
    hr = MFCreateSinkWriterFromURL(url.c_str(), nullptr, settings.Get(), recording->writer.GetAddressOf());
  for (const SinkStream& stream : order.streams) {
    if (FAILED(hr)) break;
    Device* device = stream.video ? state_->video.get() : state_->audio.get();
    const DeviceFormat& f = device->current;
    DWORD index = 0;
    ComPtr<IMFMediaType> output(stream.type);
    ComPtr<IMFMediaType> input;
    hr = MFCreateMediaType(input.GetAddressOf());
    if (FAILED(hr)) break;
    GUID wanted = GUID_NULL;
    UINT32 bitRate = 0;
    stream.type->GetGUID(MF_MT_SUBTYPE, &wanted);
    if (stream.video && f.subtype == MFVideoFormat_H264 && wanted == MFVideoFormat_H264 &&
        FAILED(stream.type->GetUINT32(MF_MT_AVG_BITRATE, &bitRate))) {
      // H.264 asked for with no bit rate to encode at, from a device that sends H.264: its own
      // packets are written, with its parameter sets when it has them apart from the packets.
      hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
      if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);
      if (SUCCEEDED(hr)) hr = MFSetAttributeSize(input.Get(), MF_MT_FRAME_SIZE, f.width, f.height);
      if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(input.Get(), MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
      const AVCodecParameters* delivered = device->input->delivered;
      if (SUCCEEDED(hr) && delivered->extradata_size > 0)
        hr = input->SetBlob(MF_MT_MPEG_SEQUENCE_HEADER, delivered->extradata,
                            static_cast<UINT32>(delivered->extradata_size));
      recording->videoPassthrough = true;
    } else if (stream.video) {
      // The encoder is given the engine's I420 pictures, or top-down BGRA rows made even (see
      // evenpicture.h) for an odd-sized device.
      const int width = evenpicture::evenSize(f.width);
      const int height = evenpicture::evenSize(f.height);
      recording->padded = width != f.width || height != f.height;
      // libx264 counts its rate in whole kbit/s: a tiny picture's estimate would be none at all.
      constexpr UINT32 lowestBitRate = 1000;
      const bool slow = SUCCEEDED(stream.type->GetUINT32(MF_MT_AVG_BITRATE, &bitRate)) && bitRate < lowestBitRate;
      if (recording->padded || slow) {
        hr = MFCreateMediaType(output.ReleaseAndGetAddressOf());
        if (SUCCEEDED(hr)) hr = stream.type->CopyAllItems(output.Get());
        if (SUCCEEDED(hr)) hr = MFSetAttributeSize(output.Get(), MF_MT_FRAME_SIZE, width, height);
        if (SUCCEEDED(hr) && slow) hr = output->SetUINT32(MF_MT_AVG_BITRATE, lowestBitRate);
      }
      if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
      if (SUCCEEDED(hr))
        hr = input->SetGUID(MF_MT_SUBTYPE, recording->padded ? MFVideoFormat_RGB32 : MFVideoFormat_I420);
      if (SUCCEEDED(hr)) hr = MFSetAttributeSize(input.Get(), MF_MT_FRAME_SIZE, width, height);
      if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(input.Get(), MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
      if (SUCCEEDED(hr))
        hr = input->SetUINT32(MF_MT_DEFAULT_STRIDE, static_cast<UINT32>(recording->padded ? width * 4 : width));
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
    } else {
      UINT32 rate = 0, channels = 0;
      stream.type->GetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, &rate);
      stream.type->GetUINT32(MF_MT_AUDIO_NUM_CHANNELS, &channels);
      if (!rate) rate = f.sampleRate;
      if (!channels) channels = f.channels;
      recording->audioRate = static_cast<int>(rate);
      recording->audioChannels = static_cast<int>(channels);
      hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
      if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_PCM);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, channels);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, rate);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, 2 * channels);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 2 * channels * rate);
    }
    if (SUCCEEDED(hr)) hr = recording->writer->AddStream(output.Get(), &index);
    if (SUCCEEDED(hr)) hr = recording->writer->SetInputMediaType(index, input.Get(), nullptr);
    if (FAILED(hr)) break;
    if (stream.video) {
      recording->videoStream = index;
      recording->hasVideo = true;
      recording->width = f.width;
      recording->height = f.height;
      recording->frameDuration = av_rescale(ticksPerSecond, f.rate.den, f.rate.num);
    } else {
      recording->audioStream = index;
      recording->hasAudio = true;
    }
  }
  if (SUCCEEDED(hr)) hr = recording->writer->BeginWriting();
  if (FAILED(hr)) return hr;
  if (recording->videoPassthrough) {
    // The file starts at a key frame: ask for one now rather than wait for the device's next.
    requestKeyFrame(*state_->video);
  } else if (recording->hasVideo && lastPicture_) {
    // The picture current at the start opens the clip.
    recording->held = recording->padded ? lastPicture_ : lastI420_;
    recording->slots.open(lastPictureTime_, recording->sinceStart(lastPictureReadAt_), recording->frameDuration);
  }
  // The microphone's last buffer may hold sound from after the start.
  if (recording->hasAudio && lastSound_->nb_samples > 0 && state_->audio && state_->audio->input)
    recordSound(*recording, lastSound_, lastSoundAt_);
  current_ = std::move(recording);
  return S_OK;
}

void EngineThread::stopRecording(int64_t at) {
  if (!current_) return;
  current_->stopAt = std::max(at, current_->startAt);
  finishing_.push_back(std::move(current_));
  finishDue(false);
}

// When the next stopped clip must be finished whatever has come (engine time, µs); 0: none waits.
int64_t EngineThread::nextDeadline() const {
  int64_t next = 0;
  for (const auto& recording : finishing_) {
    const int64_t due = recording->stopAt + (recording->hasAudio ? soundGrace : videoGrace);
    if (!next || due < next) next = due;
  }
  return next;
}

// Whether the microphone's next delivery may come by `due`: it is expected one of its recent
// longest pauses after its last. One that sends seconds at once is not waited for when its next
// lump is due after the grace, since the clip would get silence there all the same.
bool EngineThread::soundCanComeBy(int64_t due) const {
  int64_t longest = 0;
  for (size_t i = 1; i < soundArrivals_.size(); ++i)
    longest = std::max(longest, soundArrivals_[i] - soundArrivals_[i - 1]);
  return soundArrivals_.empty() || soundArrivals_.back() + longest <= due;
}

// Finishes the stopped clips whose last picture and sound have come (or cannot come in time), or
// whose grace has run out (all: every one, now), and answers each StopRecord once its file is
// complete.
void EngineThread::finishDue(bool all) {
  const int64_t now = av_gettime_relative();
  for (auto it = finishing_.begin(); it != finishing_.end();) {
    Recording& recording = **it;
    const int64_t due = recording.stopAt + (recording.hasAudio ? soundGrace : videoGrace);
    const bool pictures = !recording.hasVideo || recording.videoDone || FAILED(recording.failure);
    const bool sound = !recording.hasAudio || recording.audioReachedAt >= recording.stopAt ||
                       FAILED(recording.failure) || !soundCanComeBy(due);
    if (!all && !(pictures && sound) && now < due) {
      ++it;
      continue;
    }
    const HRESULT hr = finish(recording);
    it = finishing_.erase(it);
    send(MF_CAPTURE_ENGINE_RECORD_STOPPED, hr);
  }
}

// The last picture held until the stop, sound missing at the end as silence, then the file's end.
HRESULT EngineThread::finish(Recording& recording) {
  const LONGLONG length = recording.stopAt ? (recording.stopAt - recording.startAt) * 10 : 0;
  if (recording.hasVideo && !recording.held && !recording.videoPassthrough) {
    // The camera sent no picture during the clip: it is black, and still lasts to the stop.
    recording.held = blackPicture(recording);
  }
  if (recording.held) {
    const LONGLONG rest = length - recording.heldTime;
    writeHeld(recording, rest > 0 ? rest : recording.frameDuration);
  }
  if (recording.hasAudio && recording.stopAt && SUCCEEDED(recording.failure)) {
    // At least one sample, so that even a clip stopped at once is a file that plays.
    const LONGLONG wanted =
        std::max<LONGLONG>(1, av_rescale(recording.stopAt - recording.startAt, recording.audioRate, 1000000));
    std::vector<uint8_t> silence(static_cast<size_t>(recording.audioRate / 10) * recording.audioChannels * 2, 0);
    while (recording.audioSamples < wanted && SUCCEEDED(recording.failure))
      writeSound(recording, silence.data(),
                 static_cast<int>(std::min<LONGLONG>(wanted - recording.audioSamples, recording.audioRate / 10)));
  }
  const HRESULT finalized = recording.writer->Finalize();
  return FAILED(recording.failure) ? recording.failure : finalized;
}

void EngineThread::write(Recording& recording, DWORD stream, IMFSample* sample) {
  if (FAILED(recording.failure)) return;
  const HRESULT hr = recording.writer->WriteSample(stream, sample);
  if (FAILED(hr)) recording.failure = hr;
}

// A device that stops answering ends preview and recording, as a vanished camera does. The clip
// in progress ends at the failure: what the device captured goes in, and sound it had not yet
// delivered (a microphone may send seconds at once) is silence, so the clip still lasts as long
// as the device recorded.
void EngineThread::fail(HRESULT status) {
  if (current_) {
    current_->stopAt = std::max(av_gettime_relative(), current_->startAt);
    finishing_.push_back(std::move(current_));
  }
  for (auto& recording : finishing_) finish(*recording);
  finishing_.clear();
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->previewing = false;
    state_->recording = false;
  }
  closeDevices();
  send(MF_CAPTURE_ENGINE_ERROR, status);
}

// A buffer of the pool that nothing else holds any more and that is large enough, else a new one;
// null if none could be made.
IMFMediaBuffer* EngineThread::pooledBuffer(std::vector<ComPtr<IMFMediaBuffer>>& pool, DWORD length) {
  for (auto& buffer : pool) {
    DWORD room = 0;
    if (heldOnlyBy(buffer) && SUCCEEDED(buffer->GetMaxLength(&room)) && room >= length) return buffer.Get();
  }
  ComPtr<IMFMediaBuffer> made;
  if (FAILED(MFCreateMemoryBuffer(length, made.GetAddressOf()))) return nullptr;
  // A clip holds a picture until the next, the engine the current one, a preview one more.
  if (pool.size() < 4)
    pool.push_back(made);
  else
    pool[pool.size() - 1] = made;
  return made.Get();
}

// Pictures go to the preview and into the clips at the size the device was found with: a device
// that changes its size mid-stream is scaled back to it. Each picture is converted once, into
// I420, which the encoder takes as it is (as it would take the device's own pictures); the
// preview's BGRA is made from that. swscale turns packed 4:2:2 (YUY2) into I420 with a fast
// unscaled path, and I420 into BGRA with its SIMD converter.
void EngineThread::deliverVideo(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt) {
  const DeviceFormat& f = state_->video->current;
  const int width = f.width;
  const int height = f.height;
  if (width <= 0 || height <= 0 || frame->width <= 0 || frame->height <= 0) return;
  const I420Layout layout(width, height);
  const DWORD i420Length = layout.length();
  const auto bgraLength = static_cast<DWORD>(width * height * 4);
  const bool sameSize = frame->width == width && frame->height == height;
  toI420_ =
      sws_getCachedContext(toI420_, frame->width, frame->height, static_cast<AVPixelFormat>(frame->format), width,
                           height, AV_PIX_FMT_YUV420P, sameSize ? SWS_POINT : SWS_BILINEAR, nullptr, nullptr, nullptr);
  toBgra_ = sws_getCachedContext(toBgra_, width, height, AV_PIX_FMT_YUV420P, width, height, AV_PIX_FMT_BGRA, SWS_POINT,
                                 nullptr, nullptr, nullptr);
  if (!toI420_ || !toBgra_) return;
  const AVRational rate = f.rate;
  const LONGLONG duration = av_rescale(ticksPerSecond, rate.den, rate.num);
  const LONGLONG time = pts != AV_NOPTS_VALUE
                            ? av_rescale_q(pts, timeBase, AVRational{1, static_cast<int>(ticksPerSecond)})
                            : (readAt * 10);

  IMFMediaBuffer* i420Buffer = pooledBuffer(i420Pictures_, i420Length);
  IMFMediaBuffer* bgraBuffer = pooledBuffer(pictures_, bgraLength);
  if (!i420Buffer || !bgraBuffer) return;
  const uint8_t* planes[3] = {};
  const int strides[3] = {layout.lumaStride, layout.chromaStride, layout.chromaStride};
  ComPtr<IMFSample> i420;
  HRESULT hr = fillSample(
      i420Buffer, i420Length, time, duration,
      [&](BYTE* data) {
        uint8_t* to[3] = {data, data + layout.lumaSize, data + layout.lumaSize + layout.chromaSize};
        sws_scale(toI420_, frame->data, frame->linesize, 0, frame->height, to, strides);
        std::copy(to, to + 3, planes);
      },
      i420.GetAddressOf());
  if (FAILED(hr)) return;
  // A memory buffer keeps its place while a sample holds it: the planes are still there after the unlock.
  ComPtr<IMFSample> sample;
  hr = fillSample(
      bgraBuffer, bgraLength, time, duration,
      [&](BYTE* data) {
        uint8_t* to[1] = {data};
        const int toStrides[1] = {width * 4};
        sws_scale(toBgra_, planes, strides, 0, height, to, toStrides);
      },
      sample.GetAddressOf());
  if (FAILED(hr)) return;
  lastI420_ = i420;
  lastPicture_ = sample;
  lastPictureTime_ = time;
  lastPictureReadAt_ = readAt;

  std::vector<ComPtr<IMFCaptureEngineOnSampleCallback>> callbacks;
  bool previewing;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    previewing = state_->previewing;
    for (const SinkStream& stream : state_->previewStreams)
      if (stream.video && stream.callback) callbacks.push_back(stream.callback);
  }
  if (previewing)
    for (auto& callback : callbacks) callback->OnSample(sample.Get());
  for (Recording* recording : recordings()) recordPicture(*recording, sample.Get(), i420.Get(), time, readAt);
}

// A picture read before the clip's start (it waited behind a command) replaces the opening one;
// from then on each picture writes the one before it, now that its length is known.
void EngineThread::recordPicture(Recording& recording, IMFSample* bgra, IMFSample* i420, LONGLONG deviceTime,
                                 int64_t readAt) {
  IMFSample* picture = recording.padded ? bgra : i420;
  if (!recording.hasVideo || recording.videoPassthrough || recording.videoDone || FAILED(recording.failure)) return;
  if (recording.stopAt && readAt >= recording.stopAt) {
    // A clip stopped before the device's first picture came shows that picture all along.
    if (!recording.held) recording.held = ComPtr<IMFSample>(picture);
    recording.videoDone = true;
    return;
  }
  if (!recording.held || readAt < recording.startAt) {
    recording.held = ComPtr<IMFSample>(picture);
    recording.heldTime = 0;
    recording.slots.open(deviceTime, recording.sinceStart(readAt), recording.frameDuration);
    return;
  }
  LONGLONG time = recording.slots.place(deviceTime, recording.sinceStart(readAt), recording.frameDuration);
  if (time == recording.heldTime) {  // a later picture in the held one's slot takes its place
    recording.held = ComPtr<IMFSample>(picture);
    return;
  }
  if (time < recording.heldTime) time = recording.heldTime + recording.frameDuration;  // the device's clock jumped back
  writeHeld(recording, time - recording.heldTime);
  recording.held = ComPtr<IMFSample>(picture);
  recording.heldTime = time;
}

void EngineThread::writeHeld(Recording& recording, LONGLONG duration) {
  ComPtr<IMFSample> sample = recording.held;
  recording.held = ComPtr<IMFSample>();
  if (!sample || FAILED(recording.failure)) return;
  if (recording.padded) {
    // The encoder takes the even size: a copy with the last column and row repeated.
    const int width = evenpicture::evenSize(recording.width);
    const int height = evenpicture::evenSize(recording.height);
    ComPtr<IMFMediaBuffer> source;
    BYTE* data = nullptr;
    if (FAILED(sample->GetBufferByIndex(0, source.GetAddressOf())) || FAILED(source->Lock(&data, nullptr, nullptr)))
      return;
    ComPtr<IMFSample> copy;
    const HRESULT hr = makeSample(
        static_cast<DWORD>(width * height * 4), 0, 0,
        [&](BYTE* to) { evenpicture::pad(data, recording.width, recording.height, to); }, copy.GetAddressOf());
    source->Unlock();
    if (FAILED(hr)) return;
    sample = copy;
  }
  sample->SetSampleTime(recording.heldTime);
  sample->SetSampleDuration(duration);
  write(recording, recording.videoStream, sample.Get());
}

void EngineThread::deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt) {
  const DeviceFormat& f = state_->audio->current;
  const int channels = frame->ch_layout.nb_channels;
  const bool interleaved16 = frame->format == AV_SAMPLE_FMT_S16;
  const DWORD length = static_cast<DWORD>(frame->nb_samples * channels * 2);
  const LONGLONG duration = av_rescale(frame->nb_samples, ticksPerSecond, f.sampleRate);

  // The pulse input stamps a packet with the system clock (µs) of its first sample, from the
  // stream's latency. A new stream's first packet has come stamped as if captured from its arrival
  // on (PulseAudio's sine source: a two-second lump ahead of the clock); sound cannot end after it
  // was read.
  const int64_t span = frame->sample_rate > 0 ? av_rescale(frame->nb_samples, 1000000, frame->sample_rate) : 0;
  const int64_t wallOffset = av_gettime() - av_gettime_relative();
  if (wallOffset_ && std::llabs(wallOffset - wallOffset_) > clockStep) stampsFrom_ = readAt + stampSettling;
  wallOffset_ = wallOffset;
  const int64_t stamped = pts == AV_NOPTS_VALUE || readAt < stampsFrom_
                              ? INT64_MAX
                              : av_rescale_q(pts, timeBase, AVRational{1, 1000000}) - wallOffset;
  const int64_t capturedAt = std::min(stamped, readAt - span);
  // Kept for a clip that starts while this buffer's sound is still current.
  av_frame_unref(lastSound_);
  av_frame_ref(lastSound_, frame);
  lastSoundAt_ = capturedAt;
  for (Recording* recording : recordings()) recordSound(*recording, frame, capturedAt);

  if (interleaved16) {
    std::vector<ComPtr<IMFCaptureEngineOnSampleCallback>> callbacks;
    bool previewing;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      previewing = state_->previewing;
      for (const SinkStream& stream : state_->previewStreams)
        if (!stream.video && stream.callback) callbacks.push_back(stream.callback);
    }
    if (previewing && !callbacks.empty()) {
      ComPtr<IMFSample> sample;
      if (SUCCEEDED(makeSample(
              length, capturedAt * 10, duration, [&](BYTE* data) { std::memcpy(data, frame->data[0], length); },
              sample.GetAddressOf())))
        for (auto& callback : callbacks) callback->OnSample(sample.Get());
    }
  }
}

// Only what was captured between the clip's start and stop goes in, cut inside the buffer, since a
// source may deliver seconds in one; a clip whose first sound comes after its start begins with
// silence up to it.
void EngineThread::recordSound(Recording& recording, AVFrame* frame, int64_t capturedAt) {
  if (!recording.hasAudio || FAILED(recording.failure)) return;
  const int channels = frame->ch_layout.nb_channels;
  const int rate = frame->sample_rate;
  const int count = frame->nb_samples;
  if (rate <= 0 || count <= 0) return;
  const int64_t end = capturedAt + av_rescale(count, 1000000, rate);
  const int64_t startAt = recording.startAt;
  const int64_t stopAt = recording.stopAt;
  int first = 0;
  int last = count;
  if (capturedAt < startAt)
    first =
        static_cast<int>(std::min<int64_t>(count, av_rescale_rnd(startAt - capturedAt, rate, 1000000, AV_ROUND_UP)));
  if (stopAt) last = static_cast<int>(std::clamp<int64_t>(av_rescale(stopAt - capturedAt, rate, 1000000), 0, count));
  if (stopAt && recording.audioReachedAt >= stopAt) return;  // the clip has all its sound
  recording.audioReachedAt = std::max(recording.audioReachedAt, end);
  if (recording.resampler && last > first) {
    // A source that stamps lumps of sound as if just captured gives stamps that overlap what the
    // clip already has: that sound is not written twice (a few ms of jitter are let be).
    const int64_t position = av_rescale(capturedAt - startAt, rate, 1000000) + first;
    const int64_t have = av_rescale(recording.audioSamples, rate, recording.audioRate);
    if (have - position > rate / 200) first = static_cast<int>(std::min<int64_t>(last, first + (have - position)));
  }
  if (last <= first) return;
  if (!recording.resampler) {
    AVChannelLayout out;
    av_channel_layout_default(&out, recording.audioChannels);
    swr_alloc_set_opts2(&recording.resampler, &out, AV_SAMPLE_FMT_S16, recording.audioRate, &frame->ch_layout,
                        static_cast<AVSampleFormat>(frame->format), frame->sample_rate, 0, nullptr);
    av_channel_layout_uninit(&out);
    if (!recording.resampler || swr_init(recording.resampler) < 0) {
      recording.failure = MF_E_INVALIDMEDIATYPE;
      return;
    }
    if (capturedAt > startAt) {
      const int64_t gap = av_rescale(capturedAt - startAt, recording.audioRate, 1000000);
      std::vector<uint8_t> silence(static_cast<size_t>(std::max<int64_t>(gap, 0)) * recording.audioChannels * 2, 0);
      if (gap > 0) writeSound(recording, silence.data(), static_cast<int>(gap));
    }
  }
  const AVSampleFormat format = static_cast<AVSampleFormat>(frame->format);
  const bool planar = av_sample_fmt_is_planar(format);
  const int skip = first * av_get_bytes_per_sample(format) * (planar ? 1 : channels);
  std::vector<const uint8_t*> in(planar ? channels : 1);
  for (size_t plane = 0; plane < in.size(); ++plane) in[plane] = frame->extended_data[plane] + skip;
  const int room = swr_get_out_samples(recording.resampler, last - first);
  std::vector<uint8_t> converted(static_cast<size_t>(room) * recording.audioChannels * 2);
  uint8_t* out[1] = {converted.data()};
  const int made = swr_convert(recording.resampler, out, room, in.data(), last - first);
  if (made > 0) writeSound(recording, converted.data(), made);
}

// Interleaved 16-bit samples at the clip's rate, placed after the ones before.
void EngineThread::writeSound(Recording& recording, const uint8_t* data, int samples) {
  const DWORD bytes = static_cast<DWORD>(samples * recording.audioChannels * 2);
  const LONGLONG time = av_rescale(recording.audioSamples, ticksPerSecond, recording.audioRate);
  const LONGLONG span = av_rescale(samples, ticksPerSecond, recording.audioRate);
  recording.audioSamples += samples;
  ComPtr<IMFSample> sample;
  if (SUCCEEDED(makeSample(
          bytes, time, span, [&](BYTE* to) { std::memcpy(to, data, bytes); }, sample.GetAddressOf())))
    write(recording, recording.audioStream, sample.Get());
}

// Writes a packet of an H.264 device into a passthrough clip as it came. The clip starts at 0
// with the first key frame after it started: what comes before cannot be decoded without the
// pictures it refers to.
void EngineThread::passThrough(Recording& recording, const AVPacket* packet, AVRational timeBase, int64_t readAt) {
  if (!recording.videoPassthrough || recording.videoDone || FAILED(recording.failure)) return;
  const bool key = (packet->flags & AV_PKT_FLAG_KEY) != 0;
  const bool started = recording.held || recording.heldTime > 0;
  const bool late = recording.stopAt && readAt >= recording.stopAt;
  if (late && started) {
    recording.videoDone = true;
    return;
  }
  if (!started && !key) return;
  const AVRational ticks{1, static_cast<int>(ticksPerSecond)};
  const LONGLONG duration =
      packet->duration > 0 ? av_rescale_q(packet->duration, timeBase, ticks) : recording.frameDuration;
  const int64_t pts = packet->pts != AV_NOPTS_VALUE ? packet->pts : packet->dts;
  const LONGLONG deviceTime = pts != AV_NOPTS_VALUE ? av_rescale_q(pts, timeBase, ticks) : AV_NOPTS_VALUE;

  const DWORD length = static_cast<DWORD>(packet->size);
  ComPtr<IMFSample> sample;
  HRESULT hr = makeSample(
      length, 0, duration, [&](BYTE* data) { std::memcpy(data, packet->data, length); }, sample.GetAddressOf());
  if (SUCCEEDED(hr) && key) hr = sample->SetUINT32(MFSampleExtension_CleanPoint, TRUE);
  if (FAILED(hr)) return;
  if (!started) {
    // The first key frame opens the clip, even one that came after the stop.
    recording.held = sample;
    recording.heldTime = 0;
    recording.frameDuration = duration;
    if (deviceTime != AV_NOPTS_VALUE) recording.slots.open(deviceTime, recording.sinceStart(readAt), duration);
    recording.videoDone = late;
    return;
  }
  LONGLONG time = recording.heldTime + recording.frameDuration;  // no time of its own: the packets follow one another
  if (deviceTime != AV_NOPTS_VALUE && recording.slots.opened())
    time = std::max(time, recording.slots.place(deviceTime, recording.sinceStart(readAt), recording.frameDuration));
  writeHeld(recording, time - recording.heldTime);
  recording.held = sample;
  recording.heldTime = time;
  recording.frameDuration = duration;
}

// One packet as the device delivered it: into passthrough clips as it is, and decoded for the
// preview and the clips that encode.
void EngineThread::receive(Device& device, AVPacket* packet, int64_t readAt) {
  Input& input = *device.input;
  if (device.video)
    for (Recording* recording : recordings()) passThrough(*recording, packet, input.timeBase, readAt);
  if (!input.keyFrameSeen) {
    // Pictures that refer to ones never received only make the decoder complain.
    if (input.delivered->codec_id == AV_CODEC_ID_H264 && !(packet->flags & AV_PKT_FLAG_KEY)) return;
    input.keyFrameSeen = true;
  }
  if (avcodec_send_packet(input.decoder, packet) < 0) return;
  while (avcodec_receive_frame(input.decoder, frame_) >= 0) {
    const int64_t pts = timeOf(frame_);
    if (device.video)
      deliverVideo(frame_, pts, input.timeBase, readAt);
    else
      deliverAudio(frame_, pts, input.timeBase, readAt);
    av_frame_unref(frame_);
  }
}

void EngineThread::arrive(Arrival& arrival) {
  const int index = arrival.video ? 0 : 1;
  Device* device = arrival.video ? state_->video.get() : state_->audio.get();
  if (arrival.generation != generations_[index] || !device || !device->input) return;  // from a closed reader
  if (arrival.error) {
    fail(arrival.video ? MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED : MF_E_AUDIO_RECORDING_DEVICE_INVALIDATED);
    return;
  }
  Input& input = *device->input;
  if (arrival.packet->stream_index == input.stream) {
    if (!arrival.video) {
      soundArrivals_.push_back(arrival.readAt);
      while (soundArrivals_.size() > 2 && soundArrivals_.front() < arrival.readAt - soundHistory)
        soundArrivals_.pop_front();
    }
    input.deliver(arrival.packet, [&](AVPacket* delivered) { receive(*device, delivered, arrival.readAt); });
  }
  if (current_ && FAILED(current_->failure)) {
    // A write failed (a full disk): the clip ends here with what it has, and says so.
    finishing_.push_back(std::move(current_));
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->recording = false;
    }
    finishDue(true);
  }
}

void EngineThread::execute(Order& order) {
  switch (order.command) {
    case Command::StartPreview: {
      HRESULT hr = SUCCEEDED(state_->initStatus) ? openDevices() : state_->initStatus;
      {
        std::lock_guard<std::mutex> lock(state_->mutex);
        state_->previewing = SUCCEEDED(hr);
      }
      send(MF_CAPTURE_ENGINE_PREVIEW_STARTED, hr);
      break;
    }
    case Command::StopPreview: {
      {
        std::lock_guard<std::mutex> lock(state_->mutex);
        state_->previewing = false;
      }
      send(MF_CAPTURE_ENGINE_PREVIEW_STOPPED, S_OK);
      break;
    }
    case Command::StartRecord: {
      HRESULT hr = current_ ? MF_E_INVALIDREQUEST : SUCCEEDED(state_->initStatus) ? openDevices() : state_->initStatus;
      if (SUCCEEDED(hr)) hr = startRecording(order);
      {
        std::lock_guard<std::mutex> lock(state_->mutex);
        state_->recording = current_ != nullptr;
      }
      send(MF_CAPTURE_ENGINE_RECORD_STARTED, hr);
      break;
    }
    case Command::StopRecord:
      // A clip that already ended on a failed write has had its answer.
      {
        std::lock_guard<std::mutex> lock(state_->mutex);
        state_->recording = false;
      }
      stopRecording(order.at);
      break;
    case Command::Quit: break;
  }
}

void EngineThread::run() {
  frame_ = av_frame_alloc();
  lastSound_ = av_frame_alloc();

  // Initialisation: learn each device's current format, then let the device go until needed.
  HRESULT status = S_OK;
  for (Device* device : {state_->video.get(), state_->audio.get()}) {
    if (!device) continue;
    HRESULT hr = openInput(*device, device->input);
    device->input.reset();
    if (FAILED(hr) && SUCCEEDED(status)) status = hr;
  }
  if (!state_->video && !state_->audio) status = MF_E_NO_CAPTURE_DEVICES_AVAILABLE;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->initialized = true;
    state_->initStatus = status;
  }
  state_->changed.notify_all();
  send(MF_CAPTURE_ENGINE_INITIALIZED, status);

  // Commands first, then one packet at a time, so a command waits for one packet's work at most.
  for (bool quit = false; !quit;) {
    std::deque<Order> orders;
    Arrival arrival;
    bool hasArrival = false;
    {
      std::unique_lock<std::mutex> lock(state_->mutex);
      auto ready = [this] { return !state_->commands.empty() || !state_->arrivals.empty(); };
      const int64_t deadline = nextDeadline();
      if (deadline)
        state_->changed.wait_for(
            lock, std::chrono::microseconds(std::max<int64_t>(0, deadline - av_gettime_relative())), ready);
      else
        state_->changed.wait(lock, ready);
      orders.swap(state_->commands);
      if (orders.empty() && !state_->arrivals.empty()) {
        arrival = state_->arrivals.front();
        state_->arrivals.pop_front();
        hasArrival = true;
      }
    }
    for (Order& order : orders) {
      if (order.command == Command::Quit) quit = true;
      if (!quit) execute(order);
    }
    if (hasArrival) {
      if (!quit) arrive(arrival);
      av_packet_free(&arrival.packet);
    }
    finishDue(quit);
    bool previewing;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      previewing = state_->previewing;
    }
    if (!previewing && !current_ && finishing_.empty()) closeDevices();
  }
  if (current_) {
    current_->stopAt = av_gettime_relative();
    finishing_.push_back(std::move(current_));
  }
  finishDue(true);
  closeDevices();
  av_frame_free(&frame_);
  av_frame_free(&lastSound_);
}

}  // namespace

void runEngineThread(std::shared_ptr<EngineState> state) { EngineThread(std::move(state)).run(); }

}  // namespace platform::engine
