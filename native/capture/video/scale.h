#pragma once

#include <cstdint>

namespace capture::video {

// Nearest-neighbour scaling of a packed 4-byte-per-pixel frame into dst; with swapRedBlue 1 the
// first and third byte of every pixel change places.
void scaleFrame(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                uint64_t dstHeight, uint32_t swapRedBlue);

// The source row (or column) that destination index i of n samples out of size, in single
// precision: trunc(float(i) * float(size) / float(n)).
inline uint32_t sourceIndex(uint64_t i, uint64_t size, uint64_t n) {
  return static_cast<uint32_t>(static_cast<float>(i) * static_cast<float>(size) / static_cast<float>(n));
}

}  // namespace capture::video
