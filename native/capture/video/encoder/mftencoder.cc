#include "capture/video/encoder/mftencoder.h"

#include <algorithm>
#include <chrono>
#include <climits>
#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "capture/check.h"
#include "capture/clock.h"

namespace capture::video::encoder {

namespace {

const char* const file = "native/capture/video/encoder/mftencoder";

constexpr UINT32 bitRate = 10485760;
constexpr LONGLONG sampleDuration = 166666;  // 1/60 s, while the stream declares 30 fps: both kept on purpose
// A still picture repeats ten times a second: no gap in the file is longer, and a screen that
// stays still (or a display server that went away) costs little to keep recording.
constexpr LONGLONG frameInterval = 1000000;
constexpr LONGLONG ticksPerMillisecond = 10000;
constexpr LONGLONG slotsPerSecond = 30;  // the declared rate
// A lone new picture is written once it has stayed for a frame interval; while pictures keep
// coming, each one is taken out of the queue when the next arrives, without a copy.
constexpr int64_t stillMilliseconds = 34;

// Sample times lie on a grid of the declared rate: players and converters that take the stream
// for constant-rate then never see two pictures in one frame's time.
LONGLONG slotOf(LONGLONG time) { return (time * slotsPerSecond + 5000000) / 10000000; }
LONGLONG timeOfSlot(LONGLONG slot) { return slot * 10000000 / slotsPerSecond; }

std::chrono::steady_clock::time_point atMillis(int64_t ms) {
  return std::chrono::steady_clock::time_point(std::chrono::milliseconds(ms));
}

}  // namespace

MFTEncoder::MFTEncoder(std::shared_ptr<capture::video::Clip> clip) : clip(std::move(clip)) {}

// The writer goes with the encoder although the recording never needs it again after Finalize:
// holding on to it would keep its encoder's memory for the life of the process.
MFTEncoder::~MFTEncoder() = default;

void MFTEncoder::encode(capture::video::FrameQueue* queue) {
  this->queue = queue;
  checkResult(file, 20, MFStartup(MF_VERSION, MFSTARTUP_FULL), "Could not start MFT.");
  // A failure after start-up shuts Media Foundation down before the exception leaves, so the
  // recording thread that reports it ends with start-up and shut-down paired.
  struct ShutdownOnFailure {
    bool armed = true;
    ~ShutdownOnFailure() {
      if (armed) MFShutdown();
    }
  } guard;
  configure();
  record();
  finish();
  checkResult(file, 34, writer->Finalize(), "Could not finalize writer.");
  guard.armed = false;
  checkResult(file, 35, MFShutdown(), "Could not shut down MFT.");
}

void MFTEncoder::record() {
  if (clip->first) write(std::move(clip->first), 0);
  for (;;) {
    bool repeat = false;
    std::unique_ptr<Frame> picture = nextPicture(repeat);
    if (picture) {
      const int64_t stop = clip->stop.load();
      if (stop != 0 && picture->timestamp > stop) return;  // captured after the stop request
      const LONGLONG time = (picture->timestamp - clip->start) * ticksPerMillisecond;
      write(std::move(picture), time);
    } else if (repeat) {
      // Behind the clock (a busy machine), the repeats skip ahead instead of piling up.
      const LONGLONG now = (steadyMillis() - clip->start) * ticksPerMillisecond;
      const LONGLONG time = timeOfSlot(slotOf(std::max(lastTime + frameInterval, now - 2 * frameInterval)));
      writeFrame(*last, time);
      lastTime = time;
    } else {
      return;  // stopped
    }
  }
}

std::unique_ptr<Frame> MFTEncoder::nextPicture(bool& repeat) {
  std::unique_lock<std::mutex> lock(queue->mutex);
  for (;;) {
    if (clip->stop.load() != 0) return nullptr;
    // The newest frame stays for the preview; older ones are the encoder's to take.
    while (queue->frames.size() > 1) {
      std::unique_ptr<Frame> older = std::move(queue->frames.front());
      queue->frames.pop_front();
      if (!last || older->timestamp > lastTimestamp) return older;
    }
    const Frame* newest = queue->frames.empty() ? nullptr : queue->frames.back().get();
    const bool unwritten = newest && (!last || newest->timestamp > lastTimestamp);
    int64_t due = INT64_MAX;
    if (unwritten) due = newest->timestamp + stillMilliseconds;
    // A repeat is written one interval late, so that none is ever placed past a stop that
    // comes in the meantime: the picture held to the stop fills that last stretch.
    if (last) due = std::min(due, clip->start + (lastTime + 2 * frameInterval) / ticksPerMillisecond + 1);
    if (due != INT64_MAX && steadyMillis() >= due) {
      if (unwritten) return newest->clone();
      repeat = true;
      return nullptr;
    }
    if (due == INT64_MAX)
      queue->changed.wait(lock);
    else
      queue->changed.wait_until(lock, atMillis(due));
  }
}

void MFTEncoder::finish() {
  const int64_t stop = clip->stop.load();
  // What was captured up to the stop and not written yet; the newest is the picture current at
  // the stop moment.
  std::vector<std::unique_ptr<Frame>> pending;
  {
    std::lock_guard<std::mutex> lock(queue->mutex);
    auto unwritten = [&](const Frame& frame) {
      return frame.timestamp <= stop && (!last || frame.timestamp > lastTimestamp);
    };
    while (queue->frames.size() > 1) {
      std::unique_ptr<Frame> older = std::move(queue->frames.front());
      queue->frames.pop_front();
      if (unwritten(*older)) pending.push_back(std::move(older));
    }
    if (!queue->frames.empty() && unwritten(*queue->frames.back())) pending.push_back(queue->frames.back()->clone());
  }
  for (auto& picture : pending) {
    const LONGLONG time = (picture->timestamp - clip->start) * ticksPerMillisecond;
    write(std::move(picture), time);
  }
  // It lasts until the stop: the last sample is placed so that it ends there.
  const LONGLONG held = timeOfSlot(slotOf((stop - clip->start) * ticksPerMillisecond) - 1);
  if (last && held > lastTime) {
    writeFrame(*last, held);
    lastTime = held;
  }
}

// A picture that falls into the slot of the one before replaces it in what is repeated, not in
// the file.
void MFTEncoder::write(std::unique_ptr<Frame> picture, LONGLONG time) {
  // The clip opens with its first picture, wherever it came from.
  const LONGLONG slot = lastTime < 0 ? 0 : slotOf(time);
  if (lastTime < 0 || slot > slotOf(lastTime)) {
    writeFrame(*picture, timeOfSlot(slot));
    lastTime = timeOfSlot(slot);
  }
  lastTimestamp = picture->timestamp;
  last = std::move(picture);
}

void MFTEncoder::configure() {
  ComPtr<IMFAttributes> attrs;
  checkResult(file, 48, MFCreateAttributes(attrs.GetAddressOf(), 0), "Unable to create sink writer config.");
  checkResult(file, 49, attrs->SetUINT32(MF_LOW_LATENCY, TRUE), "Unable to set low latency mode.");
  checkResult(file, 50, attrs->SetUINT32(MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, TRUE),
              "Unable to enable hardware transforms.");
  checkResult(file, 51, attrs->SetUINT32(MF_SINK_WRITER_DISABLE_THROTTLING, TRUE), "Unable to disable throttling.");
  checkResult(file, 52, attrs->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4),
              "Unable to set container type.");
  checkResult(file, 54, MFCreateSinkWriterFromURL(clip->path.c_str(), nullptr, attrs.Get(), writer.GetAddressOf()),
              "Could not create sink.");
  attrs.Reset();

  const UINT64 frameSize = (static_cast<UINT64>(queue->width) << 32) | static_cast<UINT32>(queue->height);
  const UINT64 frameRate = (static_cast<UINT64>(30) << 32) | 1;
  const UINT64 aspectRatio = (static_cast<UINT64>(1) << 32) | 1;

  ComPtr<IMFMediaType> out;
  checkResult(file, 58, MFCreateMediaType(out.GetAddressOf()), "Could not create output media type.");
  checkResult(file, 59, out->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video), "Unable to set major type of output.");
  checkResult(file, 60, out->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264), "Unable to set subtype of output.");
  checkResult(file, 61, out->SetUINT32(MF_MT_AVG_BITRATE, bitRate), "Unable to set output bitrate.");
  checkResult(file, 62, out->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive),
              "Unable to set output interlace mode.");
  checkResult(file, 63, out->SetUINT64(MF_MT_FRAME_SIZE, frameSize), "Unable to set output resolution.");
  checkResult(file, 64, out->SetUINT64(MF_MT_FRAME_RATE, frameRate), "Unable to set output framerate.");
  checkResult(file, 65, out->SetUINT64(MF_MT_PIXEL_ASPECT_RATIO, aspectRatio),
              "Unable to set output pixel aspect ratio.");
  checkResult(file, 66, out->SetUINT32(MF_MT_MPEG2_PROFILE, eAVEncH264VProfile_Main), "Unable to set output profile.");
  checkResult(file, 67, writer->AddStream(out.Get(), &streamIndex), "Could not add stream to writer.");
  out.Reset();

  // No default stride: the input is bottom-up RGB32, which writeFrame() provides.
  ComPtr<IMFMediaType> in;
  checkResult(file, 71, MFCreateMediaType(in.GetAddressOf()), "Could not create input media type.");
  checkResult(file, 72, in->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video), "Unable to set major type of input.");
  checkResult(file, 73, in->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_RGB32), "Unable to set subtype of input.");
  checkResult(file, 74, in->SetUINT32(MF_MT_AVG_BITRATE, bitRate), "Unable to set input bitrate.");
  checkResult(file, 75, in->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive),
              "Unable to set input interlace mode.");
  checkResult(file, 76, in->SetUINT64(MF_MT_FRAME_SIZE, frameSize), "Unable to set input resolution.");
  checkResult(file, 77, in->SetUINT64(MF_MT_FRAME_RATE, frameRate), "Unable to set input framerate.");
  checkResult(file, 78, in->SetUINT64(MF_MT_PIXEL_ASPECT_RATIO, aspectRatio),
              "Unable to set input pixel aspect ratio.");
  checkResult(file, 80, writer->SetInputMediaType(streamIndex, in.Get(), nullptr), "Could not set input media type.");
  in.Reset();

  checkResult(file, 83, writer->BeginWriting(), "Could not being writing.");
}

void MFTEncoder::writeFrame(const Frame& frame, LONGLONG time) {
  ++frameCount;
  const DWORD length = static_cast<DWORD>(queue->width) * static_cast<DWORD>(queue->height) * 4;
  // A new 8 MB buffer for every picture would cost the system a fresh zeroed page per 4 KB.
  ComPtr<IMFMediaBuffer> buffer;
  if (spareBuffer && heldOnlyBy(spareBuffer)) buffer = spareBuffer;
  if (!buffer) {
    checkResult(file, 88, MFCreateMemoryBuffer(length, buffer.GetAddressOf()), "Could not create memory buffer");
    spareBuffer = buffer;
  }

  BYTE* dst = nullptr;
  checkResult(file, 105, buffer->Lock(&dst, nullptr, nullptr), "Could not get a lock on input buffer.");
  // Rows go in upside down: the input type is bottom-up RGB32.
  const uint32_t rowBytes = static_cast<uint32_t>(frame.width) * 4;
  const uint8_t* src = frame.data.get();
  for (uint64_t i = 0; i < frame.height; ++i)
    std::memcpy(dst + (frame.height - 1 - i) * rowBytes, src + i * rowBytes, rowBytes);
  checkResult(file, 124, buffer->Unlock(), "Could not unlock input buffer.");
  checkResult(file, 126, buffer->SetCurrentLength(length), "Could not set current length.");

  ComPtr<IMFSample> sample;
  checkResult(file, 129, MFCreateSample(sample.GetAddressOf()), "Could not create sample.");
  checkResult(file, 130, sample->AddBuffer(buffer.Get()), "Coudl not add input buffer to sample.");
  checkResult(file, 134, sample->SetSampleTime(time), "Could not set sample time.");
  checkResult(file, 135, sample->SetSampleDuration(sampleDuration), "Could not set sample duration.");
  checkResult(file, 137, writer->WriteSample(streamIndex, sample.Get()), "Could not write sample.");
}

}  // namespace capture::video::encoder
