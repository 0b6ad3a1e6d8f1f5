#include "capture/video/scale.h"

#include <vector>

namespace capture::video {

// Each column's source offset depends only on x, so it is computed once per call, and each
// row's only on y. The per-pixel definition is kept exactly: the same float expression, the
// same 32-bit offsets (computed unsigned, so wrapping is defined, and read as signed).
void scaleFrame(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                uint64_t dstHeight, uint32_t swapRedBlue) {
  if (dstHeight == 0) return;
  std::vector<uint32_t> columns(dstWidth);
  for (uint64_t x = 0; x < dstWidth; ++x) columns[x] = sourceIndex(x, srcWidth, dstWidth);

  for (uint64_t y = 0; y < dstHeight; ++y) {
    const uint32_t rowBase = sourceIndex(y, srcHeight, dstHeight) * static_cast<uint32_t>(srcWidth);
    const uint32_t rowStart = static_cast<uint32_t>(dstWidth) * static_cast<uint32_t>(y);
    for (uint64_t x = 0; x < dstWidth; ++x) {
      const uint8_t* in = src + static_cast<int32_t>(4u * (columns[x] + rowBase));
      uint8_t* out = dst + static_cast<int32_t>(4u * (rowStart + static_cast<uint32_t>(x)));
      if (swapRedBlue == 1) {
        out[0] = in[2];
        out[1] = in[1];
        out[2] = in[0];
      } else {
        out[0] = in[0];
        out[1] = in[1];
        out[2] = in[2];
      }
      out[3] = in[3];
    }
  }
}

}  // namespace capture::video
