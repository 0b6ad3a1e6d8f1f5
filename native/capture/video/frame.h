// One captured picture, and the queue a video source shares with its encoder and preview.
#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <cstring>
#include <deque>
#include <memory>
#include <mutex>
#include <string>

#include "capture/video/pixelpool.h"

namespace capture::video {

struct Frame {
  uint64_t size = 0;  // width * height * 4
  uint64_t bytesPerPixel = 4;
  uint64_t width = 0;
  uint64_t height = 0;
  uint64_t rowPixels = 0;     // equal to width: rows are packed
  uint32_t channelOrder = 0;  // 0 display, 1 camera
  Pixels data;                // top-down rows, bytes B, G, R, A
  int64_t timestamp = 0;      // steadyMillis() when the frame was built

  // A frame of width x height pixels with uninitialised pixel bytes, from pool when it is given
  // and of that size.
  static std::unique_ptr<Frame> make(uint64_t width, uint64_t height, uint32_t channelOrder, int64_t timestamp,
                                     const std::shared_ptr<PixelPool>& pool = nullptr) {
    auto frame = std::make_unique<Frame>();
    frame->size = width * height * 4;
    frame->width = width;
    frame->height = height;
    frame->rowPixels = width;
    frame->channelOrder = channelOrder;
    frame->data = pool && pool->size() == frame->size ? pool->take() : Pixels(new uint8_t[frame->size]);
    frame->timestamp = timestamp;
    return frame;
  }

  std::unique_ptr<Frame> clone() const {
    auto copy = make(width, height, channelOrder, timestamp, data.get_deleter().pool);
    std::memcpy(copy->data.get(), data.get(), size);
    return copy;
  }
};

struct FrameQueue {
  FrameQueue(std::wstring path, uint64_t width, uint64_t height, uint32_t channelOrder)
      : path(std::move(path)),
        width(width),
        height(height),
        channelOrder(channelOrder),
        pixels(std::make_shared<PixelPool>(width * height * 4)) {}

  std::atomic<bool> stopped{true};            // no clip is being recorded
  std::wstring path;                          // the source's name until a display's startEncode stores the file name
  std::mutex mutex;                           // guards frames
  std::deque<std::unique_ptr<Frame>> frames;  // oldest first
  const uint64_t width;
  const uint64_t height;
  const uint32_t channelOrder;
  const std::shared_ptr<PixelPool> pixels;  // the memory of the frames made for this queue
  std::condition_variable changed;          // a frame was appended or a clip was stopped
};

// One recording of a display: what its recording thread needs besides the queue. A clip covers
// the time from its start to its stop, whatever the picture does in between.
struct Clip {
  Clip(std::wstring path, int64_t start, std::unique_ptr<Frame> first)
      : path(std::move(path)), start(start), first(std::move(first)) {}

  const std::wstring path;
  const int64_t start;           // steadyMillis() when the file was accepted
  std::unique_ptr<Frame> first;  // the picture current at the start; null when there was none yet
  std::atomic<int64_t> stop{0};  // steadyMillis() of the stop request, 0 while recording
};

}  // namespace capture::video
