#include "capture/video/scale.h"

#include <cstring>
#include <vector>

namespace capture::video {

namespace {

// Moves whole pixels as 32-bit words; with Swap the first and third byte change places.
template <bool Swap>
void scaleRows(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
               uint64_t dstHeight, const std::vector<uint32_t>& columns) {
  for (uint64_t y = 0; y < dstHeight; ++y) {
    const uint32_t rowBase = sourceIndex(y, srcHeight, dstHeight) * static_cast<uint32_t>(srcWidth);
    uint8_t* out = dst + static_cast<int32_t>(4u * static_cast<uint32_t>(dstWidth) * static_cast<uint32_t>(y));
    for (uint64_t x = 0; x < dstWidth; ++x, out += 4) {
      uint32_t pixel;
      std::memcpy(&pixel, src + static_cast<int32_t>(4u * (columns[x] + rowBase)), 4);
      if (Swap) pixel = (pixel & 0xFF00FF00u) | ((pixel >> 16) & 0xFFu) | ((pixel & 0xFFu) << 16);
      std::memcpy(out, &pixel, 4);
    }
  }
}

}  // namespace

// Each column's source index depends only on x, so it is computed once per call, and each
// row's only on y. The per-pixel definition is kept exactly: the same float expression, the
// same 32-bit offsets (computed unsigned, so wrapping is defined, and read as signed).
void scaleFrame(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                uint64_t dstHeight, uint32_t swapRedBlue) {
  if (dstHeight == 0) return;
  std::vector<uint32_t> columns(dstWidth);
  for (uint64_t x = 0; x < dstWidth; ++x) columns[x] = sourceIndex(x, srcWidth, dstWidth);
  if (swapRedBlue == 1)
    scaleRows<true>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns);
  else
    scaleRows<false>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns);
}

}  // namespace capture::video
