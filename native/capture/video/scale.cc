#include "capture/video/scale.h"

#include <cstring>
#include <vector>

#if defined(__SSE2__) || defined(_M_X64)
#include <emmintrin.h>
#define TAVIO_SCALE_SSE2 1
#endif

namespace capture::video {

namespace {

// Destination columns [first, first + length) take consecutive source columns from `source` on.
struct Run {
  uint32_t first;
  uint32_t length;
  uint32_t source;
};

inline uint32_t swapped(uint32_t pixel) {
  return (pixel & 0xFF00FF00u) | ((pixel >> 16) & 0xFFu) | ((pixel & 0xFFu) << 16);
}

// A run of whole pixels, with the first and third byte of each exchanged.
void copySwapped(const uint8_t* from, uint8_t* to, uint32_t pixels) {
  uint32_t i = 0;
#ifdef TAVIO_SCALE_SSE2
  const __m128i keep = _mm_set1_epi32(static_cast<int>(0xFF00FF00u));
  const __m128i low = _mm_set1_epi32(0xFF);
  for (; i + 4 <= pixels; i += 4) {
    const __m128i p = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from + 4 * i));
    const __m128i q = _mm_or_si128(_mm_and_si128(p, keep),
                                   _mm_or_si128(_mm_and_si128(_mm_srli_epi32(p, 16), low),
                                                _mm_slli_epi32(_mm_and_si128(p, low), 16)));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(to + 4 * i), q);
  }
#endif
  for (; i < pixels; ++i) {
    uint32_t pixel;
    std::memcpy(&pixel, from + 4 * i, 4);
    pixel = swapped(pixel);
    std::memcpy(to + 4 * i, &pixel, 4);
  }
}

// Calls writeRow(rowBase, out) for every destination row: rowBase is the index of the source
// row's first pixel, out the row's first byte.
template <class WriteRow>
void forEachRow(uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth, uint64_t dstHeight,
                WriteRow writeRow) {
  for (uint64_t y = 0; y < dstHeight; ++y) {
    const uint32_t rowBase = sourceIndex(y, srcHeight, dstHeight) * static_cast<uint32_t>(srcWidth);
    writeRow(rowBase, dst + static_cast<int32_t>(4u * static_cast<uint32_t>(dstWidth) * static_cast<uint32_t>(y)));
  }
}

// Pixel by pixel through the column table, for pictures made smaller, where runs are short; run
// by run for pictures kept at their size or made larger.
template <bool Swap>
void scale(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
           uint64_t dstHeight, const std::vector<uint32_t>& columns, const std::vector<Run>& runs) {
  if (runs.size() * 4 > dstWidth) {  // fewer than four pixels a run on average
    forEachRow(srcWidth, srcHeight, dst, dstWidth, dstHeight, [&](uint32_t rowBase, uint8_t* out) {
      for (uint64_t x = 0; x < dstWidth; ++x, out += 4) {
        uint32_t pixel;
        std::memcpy(&pixel, src + static_cast<int32_t>(4u * (columns[x] + rowBase)), 4);
        if (Swap) pixel = swapped(pixel);
        std::memcpy(out, &pixel, 4);
      }
    });
    return;
  }
  forEachRow(srcWidth, srcHeight, dst, dstWidth, dstHeight, [&](uint32_t rowBase, uint8_t* out) {
    for (const Run& run : runs) {
      const uint8_t* from = src + static_cast<int32_t>(4u * (run.source + rowBase));
      uint8_t* to = out + 4 * static_cast<size_t>(run.first);
      if (Swap)
        copySwapped(from, to, run.length);
      else
        std::memcpy(to, from, 4 * static_cast<size_t>(run.length));
    }
  });
}

}  // namespace

// Each column's source index depends only on x, so it is computed once per call, and each
// row's only on y; columns that take consecutive source columns (all of them at 1:1) are moved
// as whole runs. The per-pixel definition is kept exactly: the same float expression, the same
// 32-bit offsets (computed unsigned, so wrapping is defined, and read as signed).
void scaleFrame(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                uint64_t dstHeight, uint32_t swapRedBlue) {
  if (dstHeight == 0) return;
  std::vector<uint32_t> columns(dstWidth);
  std::vector<Run> runs;
  for (uint64_t x = 0; x < dstWidth; ++x) {
    columns[x] = sourceIndex(x, srcWidth, dstWidth);
    if (!runs.empty() && runs.back().source + runs.back().length == columns[x])
      ++runs.back().length;
    else
      runs.push_back({static_cast<uint32_t>(x), 1, columns[x]});
  }
  if (swapRedBlue == 1)
    scale<true>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns, runs);
  else
    scale<false>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns, runs);
}

}  // namespace capture::video
