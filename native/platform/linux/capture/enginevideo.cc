// The engine thread's pictures: each one the device sends is converted once, shown to the
// preview and placed in the clips that encode; a camera's own H.264 is passed into its clips.
#include "platform/linux/capture/enginethread.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libswscale/swscale.h>
}

#include <algorithm>
#include <cstring>
#include <mutex>
#include <vector>

namespace platform::engine {

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

}  // namespace platform::engine
