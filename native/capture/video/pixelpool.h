// Pixel memory of one picture size, used again once a frame is gone.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <vector>

namespace capture::video {

class PixelPool;

// Gives a frame's pixels back to the pool they came from, if any.
struct PixelsDeleter {
  std::shared_ptr<PixelPool> pool;
  void operator()(uint8_t* pixels) const;
};
using Pixels = std::unique_ptr<uint8_t[], PixelsDeleter>;

// Pixel blocks of one size, used again once their frame is gone: a new block of 8 MB for every
// picture of a 60 Hz desktop costs the kernel a zeroed page per 4 KB, the more so while a busy
// encoder keeps several pictures alive. Frames may outlive their source: they hold the pool.
class PixelPool : public std::enable_shared_from_this<PixelPool> {
 public:
  explicit PixelPool(uint64_t size) : size_(size) {}
  uint64_t size() const { return size_; }

  Pixels take() {
    std::unique_ptr<uint8_t[]> block;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (!free_.empty()) {
        block = std::move(free_.back());
        free_.pop_back();
      }
    }
    if (!block) block.reset(new uint8_t[size_]);
    return Pixels(block.release(), PixelsDeleter{shared_from_this()});
  }

  void give(uint8_t* pixels) {
    std::unique_ptr<uint8_t[]> block(pixels);
    std::lock_guard<std::mutex> lock(mutex_);
    if (free_.size() < maxFree) free_.push_back(std::move(block));
  }

 private:
  static constexpr size_t maxFree = 4;  // what a burst leaves beyond that is freed
  const uint64_t size_;
  std::mutex mutex_;
  std::vector<std::unique_ptr<uint8_t[]>> free_;
};

inline void PixelsDeleter::operator()(uint8_t* pixels) const {
  if (pool)
    pool->give(pixels);
  else
    delete[] pixels;
}

}  // namespace capture::video
