// The thread of a Linux capture engine: it opens the device (capturedevice.h)
// while a preview or a recording runs, decodes what the device's reader (devicereader.h) hands
// over, gives ARGB32 pictures and PCM buffers to the preview sink's callbacks, feeds the record
// sink's sink writer (I420 pictures, converted once from what the device sends and shared with the
// preview's conversion), and delivers the engine's events to its event callback. Callers only queue
// commands, and since the thread never reads a device itself, it takes them between two packets.
// A camera that sends H.264 is recorded as it sends it when the record stream asks for H.264
// without a bit rate of its own; its pictures are still decoded for the preview.
// Engine time is av_gettime_relative(): a step of the system clock moves no clip's start or stop.
#include "platform/linux/capture/enginethread.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavutil/time.h>
}

#include <algorithm>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/linux/mf/mfattributes.h"

namespace platform::engine {

namespace {

using capturedevice::Input;
using capturedevice::openInput;
using capturedevice::requestKeyFrame;

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

constexpr int64_t videoGrace = 250000;     // µs after the stop to wait for the stop's picture
constexpr int64_t soundGrace = 500000;     // and for its sound, which may come in large lumps
constexpr int64_t soundHistory = 5000000;  // how far back the microphone's deliveries are kept

}  // namespace

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

// One of the record sink's streams in the clip's writer: the device's H.264 passed through, its
// pictures encoded, or its sound.
HRESULT EngineThread::addStream(Recording& recording, const SinkStream& stream) {
  Device* device = stream.video ? state_->video.get() : state_->audio.get();
  const DeviceFormat& f = device->current;
  DWORD index = 0;
  ComPtr<IMFMediaType> output(stream.type);
  ComPtr<IMFMediaType> input;
  HRESULT hr = MFCreateMediaType(input.GetAddressOf());
  if (FAILED(hr)) return hr;
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
    recording.videoPassthrough = true;
  } else if (stream.video) {
    // The encoder is given the engine's I420 pictures, or top-down BGRA rows made even (see
    // evenpicture.h) for an odd-sized device.
    const int width = evenpicture::evenSize(f.width);
    const int height = evenpicture::evenSize(f.height);
    recording.padded = width != f.width || height != f.height;
    // libx264 counts its rate in whole kbit/s: a tiny picture's estimate would be none at all.
    constexpr UINT32 lowestBitRate = 1000;
    const bool slow = SUCCEEDED(stream.type->GetUINT32(MF_MT_AVG_BITRATE, &bitRate)) && bitRate < lowestBitRate;
    if (recording.padded || slow) {
      hr = MFCreateMediaType(output.ReleaseAndGetAddressOf());
      if (SUCCEEDED(hr)) hr = stream.type->CopyAllItems(output.Get());
      if (SUCCEEDED(hr)) hr = MFSetAttributeSize(output.Get(), MF_MT_FRAME_SIZE, width, height);
      if (SUCCEEDED(hr) && slow) hr = output->SetUINT32(MF_MT_AVG_BITRATE, lowestBitRate);
    }
    if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
    if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_SUBTYPE, recording.padded ? MFVideoFormat_RGB32 : MFVideoFormat_I420);
    if (SUCCEEDED(hr)) hr = MFSetAttributeSize(input.Get(), MF_MT_FRAME_SIZE, width, height);
    if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(input.Get(), MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
    if (SUCCEEDED(hr))
      hr = input->SetUINT32(MF_MT_DEFAULT_STRIDE, static_cast<UINT32>(recording.padded ? width * 4 : width));
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
  } else {
    UINT32 rate = 0, channels = 0;
    stream.type->GetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, &rate);
    stream.type->GetUINT32(MF_MT_AUDIO_NUM_CHANNELS, &channels);
    if (!rate) rate = f.sampleRate;
    if (!channels) channels = f.channels;
    recording.audioRate = static_cast<int>(rate);
    recording.audioChannels = static_cast<int>(channels);
    hr = input->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
    if (SUCCEEDED(hr)) hr = input->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_PCM);
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, channels);
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, rate);
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, 2 * channels);
    if (SUCCEEDED(hr)) hr = input->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 2 * channels * rate);
  }
  if (SUCCEEDED(hr)) hr = recording.writer->AddStream(output.Get(), &index);
  if (SUCCEEDED(hr)) hr = recording.writer->SetInputMediaType(index, input.Get(), nullptr);
  if (FAILED(hr)) return hr;
  if (stream.video) {
    recording.videoStream = index;
    recording.hasVideo = true;
    recording.width = f.width;
    recording.height = f.height;
    recording.frameDuration = av_rescale(ticksPerSecond, f.rate.den, f.rate.num);
  } else {
    recording.audioStream = index;
    recording.hasAudio = true;
  }
  return S_OK;
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
  for (const SinkStream& stream : order.streams)
    if (SUCCEEDED(hr)) hr = addStream(*recording, stream);
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

void runEngineThread(std::shared_ptr<EngineState> state) { EngineThread(std::move(state)).run(); }

}  // namespace platform::engine
