#include "capture/video/scale.h"

#include <cstring>
#include <vector>

#if defined(__SSE2__) || defined(_M_X64)
#include <emmintrin.h>
#define TAVIO_SCALE_SSE2 1
#endif
#if defined(__GNUC__) && defined(__x86_64__)
#include <immintrin.h>
#define TAVIO_SCALE_AVX2 1
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

#ifdef TAVIO_SCALE_AVX2
bool hasAvx2() {
  static const bool present = __builtin_cpu_supports("avx2");
  return present;
}

// The byte shuffle that exchanges the first and third byte of every pixel.
__attribute__((target("avx2"))) inline __m256i swapOrder() {
  return _mm256_setr_epi8(2, 1, 0, 3, 6, 5, 4, 7, 10, 9, 8, 11, 14, 13, 12, 15, 2, 1, 0, 3, 6, 5, 4, 7, 10, 9, 8, 11,
                          14, 13, 12, 15);
}

// Returns the pixels done, a multiple of eight.
__attribute__((target("avx2"))) uint32_t copySwappedWide(const uint8_t* from, uint8_t* to, uint32_t pixels) {
  const __m256i order = swapOrder();
  uint32_t i = 0;
  for (; i + 8 <= pixels; i += 8) {
    const __m256i p = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(from + 4 * static_cast<size_t>(i)));
    _mm256_storeu_si256(reinterpret_cast<__m256i*>(to + 4 * static_cast<size_t>(i)), _mm256_shuffle_epi8(p, order));
  }
  return i;
}
#else
bool hasAvx2() { return false; }
uint32_t copySwappedWide(const uint8_t*, uint8_t*, uint32_t) { return 0; }
#endif

// A run of whole pixels, with the first and third byte of each exchanged.
void copySwapped(const uint8_t* from, uint8_t* to, uint32_t pixels, bool avx2) {
  uint32_t i = avx2 ? copySwappedWide(from, to, pixels) : 0;
#ifdef TAVIO_SCALE_SSE2
  const __m128i keep = _mm_set1_epi32(static_cast<int>(0xFF00FF00u));
  const __m128i low = _mm_set1_epi32(0xFF);
  for (; i + 4 <= pixels; i += 4) {
    const __m128i p = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from + 4 * i));
    const __m128i q = _mm_or_si128(_mm_and_si128(p, keep), _mm_or_si128(_mm_and_si128(_mm_srli_epi32(p, 16), low),
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

// Picks the pixels of columns [from, width) of a row one by one.
template <bool Swap>
void pickPixels(const uint8_t* row, const uint32_t* columns, uint32_t from, uint32_t width, uint8_t* out) {
  for (uint32_t x = from; x < width; ++x) {
    uint32_t pixel;
    std::memcpy(&pixel, row + 4 * static_cast<size_t>(columns[x]), 4);
    if (Swap) pixel = swapped(pixel);
    std::memcpy(out + 4 * static_cast<size_t>(x), &pixel, 4);
  }
}

#ifdef TAVIO_SCALE_AVX2
// Eight pixels a gather; the exchange is one byte shuffle. Returns the columns done.
template <bool Swap>
__attribute__((target("avx2"))) uint32_t gatherPixels(const uint8_t* row, const uint32_t* columns, uint32_t width,
                                                      uint8_t* out) {
  const __m256i order = swapOrder();
  uint32_t x = 0;
  for (; x + 8 <= width; x += 8) {
    const __m256i index = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(columns + x));
    __m256i pixels = _mm256_i32gather_epi32(reinterpret_cast<const int*>(row), index, 4);
    if (Swap) pixels = _mm256_shuffle_epi8(pixels, order);
    _mm256_storeu_si256(reinterpret_cast<__m256i*>(out + 4 * static_cast<size_t>(x)), pixels);
  }
  return x;
}

// Columns a constant step of 2 to 7 source columns apart: one 8-pixel load holds two of them, so
// four loads and permutations give eight pixels, reading each cache line once. Returns the columns
// done; a load must not reach past the row's last pixel.
// Pixels first and first + step of a row, in the low half.
__attribute__((target("avx2"))) inline __m128i twoPixels(const uint32_t* pixels, uint32_t first, __m256i pair) {
  return _mm256_castsi256_si128(
      _mm256_permutevar8x32_epi32(_mm256_loadu_si256(reinterpret_cast<const __m256i*>(pixels + first)), pair));
}

template <bool Swap>
__attribute__((target("avx2"))) uint32_t stepPixels(const uint8_t* row, uint32_t step, uint32_t width,
                                                    uint32_t rowWidth, uint8_t* out) {
  const __m256i order = swapOrder();
  const __m256i pair = _mm256_setr_epi32(0, static_cast<int>(step), 0, 0, 0, 0, 0, 0);
  const auto pixels = reinterpret_cast<const uint32_t*>(row);
  uint32_t x = 0;
  for (; x + 8 <= width && (x + 6) * step + 8 <= rowWidth; x += 8) {
    const uint32_t first = x * step;
    const __m128i low = _mm_unpacklo_epi64(twoPixels(pixels, first, pair), twoPixels(pixels, first + 2 * step, pair));
    const __m128i high =
        _mm_unpacklo_epi64(twoPixels(pixels, first + 4 * step, pair), twoPixels(pixels, first + 6 * step, pair));
    __m256i eight = _mm256_set_m128i(high, low);
    if (Swap) eight = _mm256_shuffle_epi8(eight, order);
    _mm256_storeu_si256(reinterpret_cast<__m256i*>(out + 4 * static_cast<size_t>(x)), eight);
  }
  return x;
}

#else
template <bool Swap>
uint32_t gatherPixels(const uint8_t*, const uint32_t*, uint32_t, uint8_t*) {
  return 0;
}
template <bool Swap>
uint32_t stepPixels(const uint8_t*, uint32_t, uint32_t, uint32_t, uint8_t*) {
  return 0;
}
#endif

// How a row's columns are picked.
enum class Columns {
  runs,     // runs of consecutive source columns, copied whole (at and above the source size)
  picked,   // one by one through the column table
  stepped,  // a constant step of 2 to 7 source columns, eight at a time
  gathered  // through the column table, eight at a time
};

// One destination row from the source row starting at `row`; the columns the eight-wide paths
// leave are picked one by one.
template <bool Swap>
void writeRow(const uint8_t* row, uint32_t rowWidth, const std::vector<uint32_t>& columns, const std::vector<Run>& runs,
              Columns how, bool avx2, uint8_t* out) {
  const auto width = static_cast<uint32_t>(columns.size());
  if (how == Columns::runs) {
    for (const Run& run : runs) {
      const uint8_t* from = row + 4 * static_cast<size_t>(run.source);
      uint8_t* to = out + 4 * static_cast<size_t>(run.first);
      if (Swap)
        copySwapped(from, to, run.length, avx2);
      else
        std::memcpy(to, from, 4 * static_cast<size_t>(run.length));
    }
    return;
  }
  uint32_t done = 0;
  if (how == Columns::stepped) done = stepPixels<Swap>(row, columns[1], width, rowWidth, out);
  if (how == Columns::gathered) done = gatherPixels<Swap>(row, columns.data(), width, out);
  pickPixels<Swap>(row, columns.data(), done, width, out);
}

template <bool Swap>
void scale(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
           uint64_t dstHeight, const std::vector<uint32_t>& columns, const std::vector<Run>& runs) {
  const bool avx2 = hasAvx2();
  Columns how = Columns::runs;
  if (runs.size() * 4 > dstWidth) {  // fewer than four pixels a run on average
    const uint64_t step = dstWidth > 1 ? columns[1] : 0;
    bool stepped = step >= 2 && step <= 7;
    for (uint64_t x = 0; x < dstWidth && stepped; ++x) stepped = columns[x] == step * x;
    how = !avx2 ? Columns::picked : stepped ? Columns::stepped : Columns::gathered;
  }
  uint32_t previousRow = 0;
  uint8_t* previousOut = nullptr;
  for (uint64_t y = 0; y < dstHeight; ++y) {
    const uint32_t sourceRow = sourceIndex(y, srcHeight, dstHeight);
    const uint32_t rowBase = sourceRow * static_cast<uint32_t>(srcWidth);
    uint8_t* out = dst + static_cast<int32_t>(4u * static_cast<uint32_t>(dstWidth) * static_cast<uint32_t>(y));
    if (previousOut && sourceRow == previousRow)  // an enlarged picture repeats rows
      std::memcpy(out, previousOut, 4 * static_cast<size_t>(dstWidth));
    else
      writeRow<Swap>(src + static_cast<int32_t>(4u * rowBase), static_cast<uint32_t>(srcWidth), columns, runs, how,
                     avx2, out);
    previousRow = sourceRow;
    previousOut = out;
  }
}

// The per-pixel definition, for frames so large (over 2 GB) that its 32-bit offsets wrap.
void scaleWrapping(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                   uint64_t dstHeight, const std::vector<uint32_t>& columns, bool swap) {
  for (uint64_t y = 0; y < dstHeight; ++y) {
    const uint32_t rowBase = sourceIndex(y, srcHeight, dstHeight) * static_cast<uint32_t>(srcWidth);
    uint8_t* out = dst + static_cast<int32_t>(4u * static_cast<uint32_t>(dstWidth) * static_cast<uint32_t>(y));
    for (uint64_t x = 0; x < dstWidth; ++x, out += 4) {
      uint32_t pixel;
      std::memcpy(&pixel, src + static_cast<int32_t>(4u * (columns[x] + rowBase)), 4);
      if (swap) pixel = swapped(pixel);
      std::memcpy(out, &pixel, 4);
    }
  }
}

}  // namespace

// Each column's source index depends only on x, so it is computed once per call, and each
// row's only on y. The per-pixel definition is kept exactly: the same float expression, the same
// 32-bit offsets (computed unsigned, so wrapping is defined, and read as signed).
void scaleFrame(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                uint64_t dstHeight, uint32_t swapRedBlue) {
  if (dstHeight == 0 || dstWidth == 0) return;
  std::vector<uint32_t> columns(dstWidth);
  std::vector<Run> runs;
  for (uint64_t x = 0; x < dstWidth; ++x) {
    columns[x] = sourceIndex(x, srcWidth, dstWidth);
    if (!runs.empty() && runs.back().source + runs.back().length == columns[x])
      ++runs.back().length;
    else
      runs.push_back({static_cast<uint32_t>(x), 1, columns[x]});
  }
  // Below 2^29 pixels no source offset wraps, so a row's pixels can be addressed from its start.
  if (srcWidth * srcHeight > (uint64_t{1} << 29))
    scaleWrapping(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns, swapRedBlue == 1);
  else if (swapRedBlue == 1)
    scale<true>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns, runs);
  else
    scale<false>(src, srcWidth, srcHeight, dst, dstWidth, dstHeight, columns, runs);
}

}  // namespace capture::video
