// The capture engine on Linux. One engine thread per engine opens the device (capturedevice.h)
// while a preview or a recording runs, decodes what it reads, hands ARGB32 pictures and PCM
// buffers to the preview sink's callbacks, feeds the record sink's sink writer, and delivers the
// engine's events to its event callback. Callers only queue commands. A camera that sends H.264
// is recorded as it sends it when the record stream asks for H.264 without a bit rate of its
// own; its pictures are still decoded for the preview.
#include <pthread.h>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavdevice/avdevice.h>
#include <libavformat/avformat.h>
#include <libavutil/opt.h>
#include <libavutil/time.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

#include <algorithm>
#include <cstdint>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/capturedevice.h"
#include "platform/linux/mfattributes.h"
#include "platform/linux/mfcapture.h"

namespace platform {

namespace {

using capturedevice::Device;
using capturedevice::DeviceFormat;
using capturedevice::deviceFrom;
using capturedevice::Input;
using capturedevice::makeDeviceType;
using capturedevice::openInput;
using capturedevice::requestKeyFrame;

constexpr LONGLONG ticksPerSecond = 10000000;  // media times are in 100 ns units

class MediaEvent : public Attributes<IMFMediaEvent, IID_IMFMediaEvent> {
 public:
  MediaEvent(const GUID& type, HRESULT status) : type_(type), status_(status) {}
  HRESULT GetType(MediaEventType* type) override {
    if (!type) return E_POINTER;
    *type = MEExtendedType;
    return S_OK;
  }
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

template <class T>
struct ComPtr {
  ComPtr() = default;
  explicit ComPtr(T* p, bool addRef) : p(p) {
    if (p && addRef) p->AddRef();
  }
  ComPtr(const ComPtr& other) : p(other.p) {
    if (p) p->AddRef();
  }
  ComPtr& operator=(ComPtr other) {
    std::swap(p, other.p);
    return *this;
  }
  ~ComPtr() {
    if (p) p->Release();
  }
  T* operator->() const { return p; }
  explicit operator bool() const { return p != nullptr; }
  T* p = nullptr;
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
  IMFSample* made = nullptr;
  if (SUCCEEDED(hr)) hr = MFCreateSample(&made);
  if (SUCCEEDED(hr)) hr = made->AddBuffer(buffer);
  if (SUCCEEDED(hr)) hr = made->SetSampleTime(time);
  if (SUCCEEDED(hr)) hr = made->SetSampleDuration(duration);
  if (FAILED(hr)) {
    if (made) made->Release();
    return hr;
  }
  *sample = made;
  return S_OK;
}

// A sample holding a copy of bytes, or pixels written by fill(data), in a buffer of its own.
template <class Fill>
HRESULT makeSample(DWORD length, LONGLONG time, LONGLONG duration, Fill fill, IMFSample** sample) {
  IMFMediaBuffer* buffer = nullptr;
  HRESULT hr = MFCreateMemoryBuffer(length, &buffer);
  if (FAILED(hr)) return hr;
  hr = fillSample(buffer, length, time, duration, fill, sample);
  buffer->Release();
  return hr;
}

struct SinkStream {
  DWORD source = 0;  // which device stream: video or audio
  bool video = false;
  ComPtr<IMFMediaType> type;
  ComPtr<IMFCaptureEngineOnSampleCallback> callback;
};

// The record sink's writer and its converters, alive from record start to record stop.
struct Recording {
  ~Recording() {
    sws_freeContext(scaler);
    swr_free(&resampler);
  }
  ComPtr<IMFSinkWriter> writer;
  DWORD videoStream = 0;
  DWORD audioStream = 0;
  bool hasVideo = false;
  bool hasAudio = false;
  bool videoPassthrough = false;  // the device's H.264 packets go into the file as they are
  LONGLONG nextVideoTime = 0;     // passthrough: where a packet without a time goes
  SwsContext* scaler = nullptr;
  SwrContext* resampler = nullptr;
  int audioRate = 0;
  int audioChannels = 0;
  int64_t firstVideoPts = AV_NOPTS_VALUE;
  LONGLONG audioSamples = 0;
  int64_t audioReachedAt = INT64_MIN;  // wall clock (µs) just after the last sound read
};

enum class Command { StartPreview, StopPreview, StartRecord, StopRecord, Quit };

bool isVideoStream(DWORD index) {
  return index == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW ||
         index == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD;
}

// Everything the engine, its source, its sinks and its thread share.
struct EngineState {
  std::mutex mutex;
  std::condition_variable changed;
  std::deque<Command> commands;
  bool initialized = false;
  HRESULT initStatus = S_OK;
  ComPtr<IMFCaptureEngineOnEventCallback> events;
  std::unique_ptr<Device> video;
  std::unique_ptr<Device> audio;
  std::vector<SinkStream> previewStreams;
  std::vector<SinkStream> recordStreams;
  std::string recordPath;
  bool previewing = false;
  std::unique_ptr<Recording> recording;
  // When StopRecord was called (av_gettime); 0 while no stop is pending. A microphone's read can
  // return late with sound captured after it, which does not belong in the file.
  int64_t stopRequestedAt = 0;
  int64_t startRequestedAt = 0;  // likewise, sound captured before StartRecord was called
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

class EngineThread {
 public:
  explicit EngineThread(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  void run();

 private:
  void send(const GUID& type, HRESULT status);
  HRESULT openDevices();
  void closeDevices();
  HRESULT startRecording();
  void stopRecording();
  void readSoundUntilStop();
  void fail(HRESULT status);
  void readOnce(Device& device);
  void receive(Device& device, AVPacket* packet);
  void passThrough(const AVPacket* packet, AVRational timeBase);
  const AVFrame* unpacked(const AVFrame* frame);
  IMFMediaBuffer* pictureBuffer(DWORD length);
  void deliverVideo(AVFrame* frame, int64_t pts, AVRational timeBase);
  void deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase);
  void recordSound(AVFrame* frame, int64_t pts, AVRational timeBase);

  std::shared_ptr<EngineState> state_;
  SwsContext* previewScaler_ = nullptr;
  SwsContext* unpacker_ = nullptr;  // packed 4:2:2 pictures into planar_
  AVFrame* planar_ = nullptr;
  SwrContext* previewConverter_ = nullptr;
  AVPacket* packet_ = nullptr;
  AVFrame* frame_ = nullptr;
  // The buffer of the last picture, used again when nothing else holds it any more (the preview
  // copies a picture, the sink writer encodes it at once): a new one for each picture costs the
  // kernel a fresh zeroed page for every 4 KB of it.
  ComPtr<IMFMediaBuffer> picture_;
  AVFrame* lastSound_ = nullptr;  // the microphone's last buffer
};

void EngineThread::send(const GUID& type, HRESULT status) {
  ComPtr<IMFCaptureEngineOnEventCallback> callback;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    callback = state_->events;
  }
  if (!callback) return;
  auto* event = new MediaEvent(type, status);
  callback->OnEvent(event);
  event->Release();
}

HRESULT EngineThread::openDevices() {
  for (Device* device : {state_->video.get(), state_->audio.get()}) {
    if (!device || device->input) continue;
    HRESULT hr = openInput(*device, device->input);
    if (FAILED(hr)) return hr;
  }
  return S_OK;
}

void EngineThread::closeDevices() {
  for (Device* device : {state_->video.get(), state_->audio.get()})
    if (device) device->input.reset();
  picture_ = ComPtr<IMFMediaBuffer>();
  av_frame_unref(lastSound_);
  sws_freeContext(previewScaler_);
  previewScaler_ = nullptr;
  sws_freeContext(unpacker_);
  unpacker_ = nullptr;
  av_frame_free(&planar_);
  swr_free(&previewConverter_);
}

HRESULT EngineThread::startRecording() {
  std::vector<SinkStream> streams;
  std::string path;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    streams = state_->recordStreams;
    path = state_->recordPath;
  }
  if (path.empty() || streams.empty()) return MF_E_INVALIDREQUEST;
  auto recording = std::make_unique<Recording>();
  const std::wstring url = widen(path);
  HRESULT hr = MFCreateSinkWriterFromURL(url.c_str(), nullptr, nullptr, &recording->writer.p);
  for (const SinkStream& stream : streams) {
    if (FAILED(hr)) break;
    Device* device = stream.video ? state_->video.get() : state_->audio.get();
    const DeviceFormat& f = device->current;
    DWORD index = 0;
    hr = recording->writer->AddStream(stream.type.p, &index);
    ComPtr<IMFMediaType> input;
    if (SUCCEEDED(hr)) hr = MFCreateMediaType(&input.p);
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
      if (SUCCEEDED(hr)) hr = MFSetAttributeSize(input.p, MF_MT_FRAME_SIZE, f.width, f.height);
      if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(input.p, MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
      const AVCodecParameters* delivered = device->input->delivered;
      if (SUCCEEDED(hr) && delivered->extradata_size > 0)
        hr = input->SetBlob(MF_MT_MPEG_SEQUENCE_HEADER, delivered->extradata,
                            static_cast<UINT32>(delivered->extradata_size));
      recording->videoStream = index;
      recording->hasVideo = true;
      recording->videoPassthrough = true;
    } else if (stream.video) {
      // The encoder is given top-down BGRA rows, as the preview gets them.
      hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
      if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_RGB32);
      if (SUCCEEDED(hr)) hr = MFSetAttributeSize(input.p, MF_MT_FRAME_SIZE, f.width, f.height);
      if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(input.p, MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_DEFAULT_STRIDE, static_cast<UINT32>(f.width * 4));
      if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
      recording->videoStream = index;
      recording->hasVideo = true;
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
      recording->audioStream = index;
      recording->hasAudio = true;
    }
    if (SUCCEEDED(hr)) hr = recording->writer->SetInputMediaType(index, input.p, nullptr);
  }
  if (SUCCEEDED(hr)) hr = recording->writer->BeginWriting();
  if (FAILED(hr)) return hr;
  // The file starts at a key frame: ask for one now rather than wait for the device's next.
  if (recording->videoPassthrough) requestKeyFrame(*state_->video);
  state_->recording = std::move(recording);
  return S_OK;
}

void EngineThread::stopRecording() {
  if (!state_->recording) return;
  state_->recording->writer->Finalize();
  state_->recording.reset();
}

// Sound reaches the engine some time after it was captured, and a source may hand over seconds
// of it at once: before the file is closed, the microphone is read on until the sound of the
// moment StopRecord was called has arrived, for a few seconds at most.
void EngineThread::readSoundUntilStop() {
  Device* audio = state_->audio.get();
  int64_t stopAt = 0;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    stopAt = state_->stopRequestedAt;
  }
  const int64_t deadline = av_gettime_relative() + 3 * AV_TIME_BASE;
  while (stopAt && audio && audio->input && state_->recording && state_->recording->hasAudio &&
         state_->recording->audioReachedAt < stopAt && av_gettime_relative() < deadline)
    readOnce(*audio);
}

// A device that stops answering ends preview and recording, as a vanished camera does.
void EngineThread::fail(HRESULT status) {
  stopRecording();
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->previewing = false;
  }
  closeDevices();
  send(MF_CAPTURE_ENGINE_ERROR, status);
}

// swscale has no fast way from packed 4:2:2 (YUY2, UYVY) to BGRA; unpacked into planes first,
// the pictures take its SIMD YUV to RGB converter, in about a third of the time. Other pictures
// are returned as they are; null if unpacking failed.
const AVFrame* EngineThread::unpacked(const AVFrame* frame) {
  const auto format = static_cast<AVPixelFormat>(frame->format);
  if (format != AV_PIX_FMT_YUYV422 && format != AV_PIX_FMT_UYVY422) return frame;
  if (planar_ && (planar_->width != frame->width || planar_->height != frame->height)) av_frame_free(&planar_);
  if (!planar_) {
    planar_ = av_frame_alloc();
    if (!planar_) return nullptr;
    planar_->format = AV_PIX_FMT_YUV422P;
    planar_->width = frame->width;
    planar_->height = frame->height;
    if (av_frame_get_buffer(planar_, 0) < 0) {
      av_frame_free(&planar_);
      return nullptr;
    }
  }
  unpacker_ = sws_getCachedContext(unpacker_, frame->width, frame->height, format, frame->width, frame->height,
                                   AV_PIX_FMT_YUV422P, SWS_POINT, nullptr, nullptr, nullptr);
  if (!unpacker_) return nullptr;
  sws_scale(unpacker_, frame->data, frame->linesize, 0, frame->height, planar_->data, planar_->linesize);
  return planar_;
}

// The last picture's buffer when nothing else holds it any more and it is large enough, else a
// new one; null if none could be made.
IMFMediaBuffer* EngineThread::pictureBuffer(DWORD length) {
  if (picture_) {
    picture_->AddRef();
    DWORD room = 0;
    if (picture_->Release() > 1 || FAILED(picture_->GetMaxLength(&room)) || room < length) picture_ = ComPtr<IMFMediaBuffer>();
  }
  if (!picture_ && FAILED(MFCreateMemoryBuffer(length, &picture_.p))) return nullptr;
  return picture_.p;
}

void EngineThread::deliverVideo(AVFrame* frame, int64_t pts, AVRational timeBase) {
  const int width = frame->width;
  const int height = frame->height;
  const DWORD length = static_cast<DWORD>(width * height * 4);
  const AVFrame* picture = unpacked(frame);
  if (!picture) return;
  previewScaler_ = sws_getCachedContext(previewScaler_, width, height, static_cast<AVPixelFormat>(picture->format), width,
                                        height, AV_PIX_FMT_BGRA, SWS_POINT, nullptr, nullptr, nullptr);
  if (!previewScaler_) return;
  Recording* recording = state_->recording.get();
  if (recording && recording->videoPassthrough) recording = nullptr;  // the file has the device's packets
  const AVRational rate = state_->video->current.rate;
  const LONGLONG duration = av_rescale(ticksPerSecond, rate.den, rate.num);
  LONGLONG time = av_rescale_q(pts, timeBase, AVRational{1, static_cast<int>(ticksPerSecond)});
  if (recording && recording->hasVideo) {
    if (recording->firstVideoPts == AV_NOPTS_VALUE) recording->firstVideoPts = time;
    time -= recording->firstVideoPts;
  }

  IMFMediaBuffer* buffer = pictureBuffer(length);
  if (!buffer) return;
  ComPtr<IMFSample> sample;
  HRESULT hr = fillSample(buffer, length, time, duration, [&](BYTE* data) {
    uint8_t* planes[1] = {data};
    int strides[1] = {width * 4};
    sws_scale(previewScaler_, picture->data, picture->linesize, 0, height, planes, strides);
  }, &sample.p);
  if (FAILED(hr)) return;

  std::vector<ComPtr<IMFCaptureEngineOnSampleCallback>> callbacks;
  bool previewing;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    previewing = state_->previewing;
    for (const SinkStream& stream : state_->previewStreams)
      if (stream.video && stream.callback) callbacks.push_back(stream.callback);
  }
  if (previewing)
    for (auto& callback : callbacks) callback->OnSample(sample.p);
  if (recording && recording->hasVideo) recording->writer->WriteSample(recording->videoStream, sample.p);
}

void EngineThread::deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase) {
  const DeviceFormat& f = state_->audio->current;
  const int channels = frame->ch_layout.nb_channels;
  const bool interleaved16 = frame->format == AV_SAMPLE_FMT_S16;
  const DWORD length = static_cast<DWORD>(frame->nb_samples * channels * 2);
  const LONGLONG duration = av_rescale(frame->nb_samples, ticksPerSecond, f.sampleRate);

  // Kept for a recording that is asked for while the device's next read is already waiting.
  av_frame_unref(lastSound_);
  av_frame_ref(lastSound_, frame);
  recordSound(frame, pts, timeBase);

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
      if (SUCCEEDED(makeSample(length, av_rescale_q(pts, timeBase, AVRational{1, static_cast<int>(ticksPerSecond)}), duration,
                               [&](BYTE* data) { std::memcpy(data, frame->data[0], length); }, &sample.p)))
        for (auto& callback : callbacks) callback->OnSample(sample.p);
    }
  }
}

void EngineThread::recordSound(AVFrame* frame, int64_t pts, AVRational timeBase) {
  Recording* recording = state_->recording.get();
  const int channels = frame->ch_layout.nb_channels;
  int64_t stopAt = 0;
  int64_t startAt = 0;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    stopAt = state_->stopRequestedAt;
    startAt = state_->startRequestedAt;
  }
  // The pulse input stamps a packet with the wall clock (µs) of its first sample. Only what was
  // captured between StartRecord and StopRecord goes into the file, cut inside the packet, since
  // a source may deliver seconds in one.
  const int64_t captured = av_rescale_q(pts, timeBase, AVRational{1, 1000000});
  const int rate = frame->sample_rate;
  const int count = frame->nb_samples;
  int first = 0;
  int last = count;
  if (captured < startAt) first = static_cast<int>(std::min<int64_t>(count, av_rescale_rnd(startAt - captured, rate, 1000000, AV_ROUND_UP)));
  if (stopAt) last = static_cast<int>(std::clamp<int64_t>(av_rescale(stopAt - captured, rate, 1000000), 0, count));
  if (recording) recording->audioReachedAt = captured + av_rescale(count, 1000000, rate);
  if (recording && recording->hasAudio && last > first) {
    if (!recording->resampler) {
      AVChannelLayout out;
      av_channel_layout_default(&out, recording->audioChannels);
      swr_alloc_set_opts2(&recording->resampler, &out, AV_SAMPLE_FMT_S16, recording->audioRate, &frame->ch_layout,
                          static_cast<AVSampleFormat>(frame->format), frame->sample_rate, 0, nullptr);
      av_channel_layout_uninit(&out);
      if (!recording->resampler || swr_init(recording->resampler) < 0) return;
    }
    const AVSampleFormat format = static_cast<AVSampleFormat>(frame->format);
    const bool planar = av_sample_fmt_is_planar(format);
    const int skip = first * av_get_bytes_per_sample(format) * (planar ? 1 : channels);
    std::vector<const uint8_t*> in(planar ? channels : 1);
    for (size_t plane = 0; plane < in.size(); ++plane) in[plane] = frame->extended_data[plane] + skip;
    const int room = swr_get_out_samples(recording->resampler, last - first);
    std::vector<uint8_t> converted(static_cast<size_t>(room) * recording->audioChannels * 2);
    uint8_t* out[1] = {converted.data()};
    const int made = swr_convert(recording->resampler, out, room, in.data(), last - first);
    if (made <= 0) return;
    const DWORD bytes = static_cast<DWORD>(made * recording->audioChannels * 2);
    const LONGLONG time = av_rescale(recording->audioSamples, ticksPerSecond, recording->audioRate);
    const LONGLONG span = av_rescale(made, ticksPerSecond, recording->audioRate);
    recording->audioSamples += made;
    ComPtr<IMFSample> sample;
    if (SUCCEEDED(makeSample(bytes, time, span, [&](BYTE* data) { std::memcpy(data, converted.data(), bytes); },
                             &sample.p)))
      recording->writer->WriteSample(recording->audioStream, sample.p);
  }
}

// Writes a packet of an H.264 device into a passthrough recording as it came. The clip starts
// at 0 with the first key frame after the recording started: what comes before it cannot be
// decoded without the pictures it refers to.
void EngineThread::passThrough(const AVPacket* packet, AVRational timeBase) {
  Recording* recording = state_->recording.get();
  if (!recording || !recording->videoPassthrough) return;
  const bool key = (packet->flags & AV_PKT_FLAG_KEY) != 0;
  if (recording->firstVideoPts == AV_NOPTS_VALUE && !key) return;
  const AVRational rate = state_->video->current.rate;
  const AVRational ticks{1, static_cast<int>(ticksPerSecond)};
  const LONGLONG duration =
      packet->duration > 0 ? av_rescale_q(packet->duration, timeBase, ticks) : av_rescale(ticksPerSecond, rate.den, rate.num);
  const int64_t pts = packet->pts != AV_NOPTS_VALUE ? packet->pts : packet->dts;
  LONGLONG time = recording->nextVideoTime;
  if (pts != AV_NOPTS_VALUE) {
    time = av_rescale_q(pts, timeBase, ticks);
    if (recording->firstVideoPts == AV_NOPTS_VALUE) recording->firstVideoPts = time;
    time -= recording->firstVideoPts;
  } else if (recording->firstVideoPts == AV_NOPTS_VALUE) {
    recording->firstVideoPts = 0;  // no time to start from: the packets follow one another
  }
  recording->nextVideoTime = time + duration;

  const DWORD length = static_cast<DWORD>(packet->size);
  ComPtr<IMFSample> sample;
  HRESULT hr = makeSample(length, time, duration, [&](BYTE* data) { std::memcpy(data, packet->data, length); }, &sample.p);
  if (SUCCEEDED(hr) && key) hr = sample->SetUINT32(MFSampleExtension_CleanPoint, TRUE);
  if (SUCCEEDED(hr)) recording->writer->WriteSample(recording->videoStream, sample.p);
}

// One packet as the device delivered it: into a passthrough recording as it is, and decoded for
// the preview and the recordings that encode.
void EngineThread::receive(Device& device, AVPacket* packet) {
  Input& input = *device.input;
  if (device.video) passThrough(packet, input.timeBase);
  if (!input.keyFrameSeen) {
    // Pictures that refer to ones never received only make the decoder complain.
    if (input.delivered->codec_id == AV_CODEC_ID_H264 && !(packet->flags & AV_PKT_FLAG_KEY)) return;
    input.keyFrameSeen = true;
  }
  if (avcodec_send_packet(input.decoder, packet) < 0) return;
  while (avcodec_receive_frame(input.decoder, frame_) >= 0) {
    const int64_t pts = timeOf(frame_);
    if (device.video)
      deliverVideo(frame_, pts, input.timeBase);
    else
      deliverAudio(frame_, pts, input.timeBase);
    av_frame_unref(frame_);
  }
}

void EngineThread::readOnce(Device& device) {
  Input& input = *device.input;
  int error = av_read_frame(input.format, packet_);
  if (error == AVERROR(EAGAIN)) return;
  if (error < 0) {
    fail(device.video ? MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED : MF_E_AUDIO_RECORDING_DEVICE_INVALIDATED);
    return;
  }
  if (packet_->stream_index == input.stream) input.deliver(packet_, [&](AVPacket* delivered) { receive(device, delivered); });
  av_packet_unref(packet_);
}

void EngineThread::run() {
  packet_ = av_packet_alloc();
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

  for (;;) {
    std::vector<Command> commands;
    bool active;
    {
      std::unique_lock<std::mutex> lock(state_->mutex);
      if (!state_->previewing && !state_->recording)
        state_->changed.wait(lock, [this] { return !state_->commands.empty(); });
      commands.assign(state_->commands.begin(), state_->commands.end());
      state_->commands.clear();
    }
    bool quit = false;
    for (Command command : commands) {
      switch (command) {
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
          HRESULT hr = SUCCEEDED(state_->initStatus) ? openDevices() : state_->initStatus;
          {
            std::lock_guard<std::mutex> lock(state_->mutex);
            state_->stopRequestedAt = 0;
          }
          if (SUCCEEDED(hr) && !state_->recording) {
            hr = startRecording();
            // The device's last read may have ended after StartRecord was called, since commands
            // wait for the read in progress: its sound from that moment on is the clip's start.
            if (SUCCEEDED(hr) && lastSound_->nb_samples > 0 && state_->audio && state_->audio->input)
              recordSound(lastSound_, timeOf(lastSound_), state_->audio->input->timeBase);
          }
          send(MF_CAPTURE_ENGINE_RECORD_STARTED, hr);
          break;
        }
        case Command::StopRecord:
          readSoundUntilStop();
          stopRecording();
          send(MF_CAPTURE_ENGINE_RECORD_STOPPED, S_OK);
          break;
        case Command::Quit:
          quit = true;
          break;
      }
    }
    if (quit) break;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      active = state_->previewing || state_->recording;
    }
    if (!active) {
      closeDevices();
      continue;
    }
    for (Device* device : {state_->video.get(), state_->audio.get()})
      if (device && device->input) readOnce(*device);
  }
  stopRecording();
  closeDevices();
  av_packet_free(&packet_);
  av_frame_free(&frame_);
  av_frame_free(&lastSound_);
}

class CaptureSource : public ComObject<IMFCaptureSource, IID_IMFCaptureSource> {
 public:
  explicit CaptureSource(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  HRESULT GetCaptureDeviceSource(MF_CAPTURE_ENGINE_DEVICE_TYPE, IMFMediaSource** source) override {
    if (source) *source = nullptr;
    return E_NOTIMPL;
  }
  HRESULT GetCaptureDeviceActivate(MF_CAPTURE_ENGINE_DEVICE_TYPE, IMFActivate** activate) override {
    if (activate) *activate = nullptr;
    return E_NOTIMPL;
  }
  HRESULT GetService(REFIID, REFIID, IUnknown** object) override {
    if (object) *object = nullptr;
    return MF_E_UNSUPPORTED_SERVICE;
  }
  HRESULT AddEffect(DWORD, IUnknown*) override { return E_NOTIMPL; }
  HRESULT RemoveEffect(DWORD, IUnknown*) override { return E_NOTIMPL; }
  HRESULT RemoveAllEffects(DWORD) override { return S_OK; }
  HRESULT GetAvailableDeviceMediaType(DWORD stream, DWORD index, IMFMediaType** type) override {
    if (index != 0) return MF_E_NO_MORE_TYPES;  // the device is used as it is set up
    return GetCurrentDeviceMediaType(stream, type);
  }
  HRESULT SetCurrentDeviceMediaType(DWORD, IMFMediaType*) override { return E_NOTIMPL; }
  HRESULT GetCurrentDeviceMediaType(DWORD stream, IMFMediaType** type) override {
    if (!type) return E_POINTER;
    *type = nullptr;
    std::unique_lock<std::mutex> lock(state_->mutex);
    state_->waitInitialized(lock);
    if (FAILED(state_->initStatus)) return state_->initStatus;
    Device* device = state_->deviceFor(stream);
    if (!device) return MF_E_INVALIDSTREAMNUMBER;
    return makeDeviceType(*device, type);
  }
  HRESULT GetDeviceStreamCount(DWORD* count) override {
    if (!count) return E_POINTER;
    *count = (state_->video ? 1 : 0) + (state_->audio ? 1 : 0);
    return S_OK;
  }
  HRESULT GetDeviceStreamCategory(DWORD stream, MF_CAPTURE_ENGINE_STREAM_CATEGORY* category) override {
    if (!category) return E_POINTER;
    Device* device = state_->deviceFor(stream);
    if (!device) return MF_E_INVALIDSTREAMNUMBER;
    *category = device->video ? MF_CAPTURE_ENGINE_STREAM_CATEGORY_VIDEO_CAPTURE : MF_CAPTURE_ENGINE_STREAM_CATEGORY_AUDIO;
    return S_OK;
  }
  HRESULT GetMirrorState(DWORD, BOOL* mirrored) override {
    if (!mirrored) return E_POINTER;
    *mirrored = FALSE;
    return S_OK;
  }
  HRESULT SetMirrorState(DWORD, BOOL) override { return E_NOTIMPL; }
  HRESULT GetStreamIndexFromFriendlyName(UINT32 name, DWORD* stream) override {
    if (!stream) return E_POINTER;
    *stream = name;
    return state_->deviceFor(name) ? S_OK : MF_E_INVALIDSTREAMNUMBER;
  }

 private:
  std::shared_ptr<EngineState> state_;
};

// Adds a stream to one of the two sinks' stream lists.
HRESULT addSinkStream(EngineState& state, std::vector<SinkStream>& streams, DWORD source, IMFMediaType* type,
                      DWORD* index) {
  if (!type) return E_INVALIDARG;
  std::unique_lock<std::mutex> lock(state.mutex);
  state.waitInitialized(lock);
  Device* device = state.deviceFor(source);
  if (!device) return MF_E_INVALIDSTREAMNUMBER;
  GUID major = GUID_NULL;
  type->GetGUID(MF_MT_MAJOR_TYPE, &major);
  if (major != (device->video ? MFMediaType_Video : MFMediaType_Audio)) return MF_E_INVALIDMEDIATYPE;
  SinkStream stream;
  stream.source = source;
  stream.video = device->video;
  stream.type = ComPtr<IMFMediaType>(type, true);
  streams.push_back(stream);
  if (index) *index = static_cast<DWORD>(streams.size() - 1);
  return S_OK;
}

// What the two sinks share: the engine's state, their own list of streams and the plain answers.
template <class I, const GUID& Iid, std::vector<SinkStream> EngineState::*List>
class Sink : public ComObject<I, IID_IMFCaptureSink, Iid> {
 public:
  explicit Sink(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  HRESULT GetOutputMediaType(DWORD index, IMFMediaType** type) override {
    if (!type) return E_POINTER;
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (index >= streams().size()) return MF_E_INVALIDSTREAMNUMBER;
    *type = streams()[index].type.p;
    (*type)->AddRef();
    return S_OK;
  }
  HRESULT GetService(DWORD, REFGUID, REFIID, IUnknown** object) override {
    if (object) *object = nullptr;
    return MF_E_UNSUPPORTED_SERVICE;
  }
  HRESULT Prepare() override { return S_OK; }
  HRESULT SetCustomSink(IMFMediaSink*) override { return E_NOTIMPL; }
  HRESULT GetRotation(DWORD, DWORD* rotation) override {
    if (!rotation) return E_POINTER;
    *rotation = 0;
    return S_OK;
  }
  HRESULT SetRotation(DWORD, DWORD) override { return E_NOTIMPL; }

 protected:
  std::vector<SinkStream>& streams() { return (*state_).*List; }
  HRESULT add(DWORD source, IMFMediaType* type, DWORD* index) {
    return addSinkStream(*state_, streams(), source, type, index);
  }

  std::shared_ptr<EngineState> state_;
};

class PreviewSink : public Sink<IMFCapturePreviewSink, IID_IMFCapturePreviewSink, &EngineState::previewStreams> {
 public:
  using Sink::Sink;
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    if (type) {
      GUID subtype = GUID_NULL;
      type->GetGUID(MF_MT_SUBTYPE, &subtype);
      // Pictures come as 32-bit BGRA, sound as 16-bit PCM: those are what the engine converts to.
      if (subtype != MFVideoFormat_ARGB32 && subtype != MFVideoFormat_RGB32 && subtype != MFAudioFormat_PCM)
        return MF_E_INVALIDMEDIATYPE;
    }
    return add(source, type, index);
  }
  HRESULT RemoveAllStreams() override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    streams().clear();
    return S_OK;
  }
  HRESULT SetRenderHandle(HANDLE) override { return E_NOTIMPL; }
  HRESULT SetRenderSurface(IUnknown*) override { return E_NOTIMPL; }
  HRESULT UpdateVideo(const MFVideoNormalizedRect*, const RECT*, const COLORREF*) override { return E_NOTIMPL; }
  HRESULT SetSampleCallback(DWORD index, IMFCaptureEngineOnSampleCallback* callback) override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (index >= streams().size()) return MF_E_INVALIDSTREAMNUMBER;
    streams()[index].callback = ComPtr<IMFCaptureEngineOnSampleCallback>(callback, true);
    return S_OK;
  }
  HRESULT GetMirrorState(BOOL* mirrored) override {
    if (!mirrored) return E_POINTER;
    *mirrored = FALSE;
    return S_OK;
  }
  HRESULT SetMirrorState(BOOL) override { return E_NOTIMPL; }
};

class RecordSink : public Sink<IMFCaptureRecordSink, IID_IMFCaptureRecordSink, &EngineState::recordStreams> {
 public:
  using Sink::Sink;
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    return add(source, type, index);
  }
  HRESULT RemoveAllStreams() override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (state_->recording) return MF_E_INVALIDREQUEST;
    streams().clear();
    return S_OK;
  }
  HRESULT SetOutputByteStream(IMFByteStream*, REFGUID) override { return E_NOTIMPL; }
  HRESULT SetOutputFileName(LPCWSTR name) override {
    if (!name) return E_POINTER;
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->recordPath = narrow(name);
    return S_OK;
  }
  HRESULT SetSampleCallback(DWORD, IMFCaptureEngineOnSampleCallback*) override { return E_NOTIMPL; }
};

class CaptureEngine : public ComObject<IMFCaptureEngine, IID_IMFCaptureEngine> {
 public:
  CaptureEngine() : state_(std::make_shared<EngineState>()) {}
  ~CaptureEngine() override {
    if (!thread_.joinable()) return;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->commands.push_back(Command::Quit);
    }
    state_->changed.notify_all();
    // Released from inside one of its own callbacks (an error event), the thread finishes alone.
    if (thread_.get_id() == std::this_thread::get_id())
      thread_.detach();
    else
      thread_.join();
  }

  HRESULT Initialize(IMFCaptureEngineOnEventCallback* callback, IMFAttributes* attributes, IUnknown* audio,
                     IUnknown* video) override {
    if (!callback) return E_POINTER;
    if (thread_.joinable()) return MF_E_INVALIDREQUEST;
    UINT32 only = 0;
    const bool videoOnly = attributes && SUCCEEDED(attributes->GetUINT32(MF_CAPTURE_ENGINE_USE_VIDEO_DEVICE_ONLY, &only)) && only;
    only = 0;
    const bool audioOnly = attributes && SUCCEEDED(attributes->GetUINT32(MF_CAPTURE_ENGINE_USE_AUDIO_DEVICE_ONLY, &only)) && only;
    if (video && !audioOnly) {
      state_->video = deviceFrom(video, true);
      if (!state_->video) return E_INVALIDARG;
    }
    if (audio && !videoOnly) {
      state_->audio = deviceFrom(audio, false);
      if (!state_->audio) return E_INVALIDARG;
    }
    state_->events = ComPtr<IMFCaptureEngineOnEventCallback>(callback, true);
    avdevice_register_all();
    auto state = state_;
    thread_ = std::thread([state] {
      pthread_setname_np(pthread_self(), "tavio-engine");  // so per-thread figures can tell it apart
      EngineThread(state).run();
    });
    return S_OK;
  }
  HRESULT StartPreview() override { return queue(Command::StartPreview); }
  HRESULT StopPreview() override { return queue(Command::StopPreview); }
  HRESULT StartRecord() override {
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->startRequestedAt = av_gettime();
    }
    return queue(Command::StartRecord);
  }
  HRESULT StopRecord(BOOL, BOOL) override {
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->stopRequestedAt = av_gettime();
    }
    return queue(Command::StopRecord);
  }
  HRESULT TakePhoto() override { return E_NOTIMPL; }
  HRESULT GetSink(MF_CAPTURE_ENGINE_SINK_TYPE type, IMFCaptureSink** sink) override {
    if (!sink) return E_POINTER;
    *sink = nullptr;
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    if (type == MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW) {
      if (!preview_) preview_ = ComPtr<IMFCapturePreviewSink>(new PreviewSink(state_), false);
      *sink = preview_.p;
    } else if (type == MF_CAPTURE_ENGINE_SINK_TYPE_RECORD) {
      if (!record_) record_ = ComPtr<IMFCaptureRecordSink>(new RecordSink(state_), false);
      *sink = record_.p;
    } else {
      return E_NOTIMPL;
    }
    (*sink)->AddRef();
    return S_OK;
  }
  HRESULT GetSource(IMFCaptureSource** source) override {
    if (!source) return E_POINTER;
    *source = nullptr;
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    *source = new CaptureSource(state_);
    return S_OK;
  }

 private:
  HRESULT queue(Command command) {
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->commands.push_back(command);
    }
    state_->changed.notify_all();
    return S_OK;
  }

  std::shared_ptr<EngineState> state_;
  std::thread thread_;
  ComPtr<IMFCapturePreviewSink> preview_;
  ComPtr<IMFCaptureRecordSink> record_;
};

class CaptureEngineClassFactory : public ComObject<IMFCaptureEngineClassFactory, IID_IMFCaptureEngineClassFactory> {
 public:
  HRESULT CreateInstance(REFCLSID clsid, REFIID riid, LPVOID* object) override {
    if (!object) return E_POINTER;
    *object = nullptr;
    if (clsid != CLSID_MFCaptureEngine) return CLASS_E_CLASSNOTAVAILABLE;
    auto* engine = new CaptureEngine;
    HRESULT hr = engine->QueryInterface(riid, object);
    engine->Release();
    return hr;
  }
};

}  // namespace

HRESULT createCaptureEngineClassFactory(REFIID riid, void** object) {
  if (!object) return E_POINTER;
  auto* factory = new CaptureEngineClassFactory;
  HRESULT hr = factory->QueryInterface(riid, object);
  factory->Release();
  return hr;
}

}  // namespace platform
