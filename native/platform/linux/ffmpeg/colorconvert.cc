#include "platform/linux/ffmpeg/colorconvert.h"

#if defined(__SSE2__)
#include <emmintrin.h>
#endif
#if defined(__x86_64__) && defined(__GNUC__)
#include <immintrin.h>
#define TAVIO_AVX2 1
#endif

namespace platform::colour {

namespace {

// Columns [from, width) of a row pair, pixel by pixel; `lower` is null when the picture ends
// after the upper row, which then stands in for the missing one.
void pairTail(const uint8_t* upper, const uint8_t* lower, int from, int width, uint8_t* yUpper, uint8_t* yLower,
              uint8_t* u, uint8_t* v) {
  const uint8_t* second = lower ? lower : upper;
  for (int x = from; x < width; x += 2) {
    const int x1 = x + 1 < width ? x + 1 : x;
    const uint8_t* a = upper + x * 4;
    const uint8_t* b = upper + x1 * 4;
    const uint8_t* c = second + x * 4;
    const uint8_t* d = second + x1 * 4;
    yUpper[x] = lumaOf(a[0], a[1], a[2]);
    if (x1 != x) yUpper[x1] = lumaOf(b[0], b[1], b[2]);
    if (lower) {
      yLower[x] = lumaOf(c[0], c[1], c[2]);
      if (x1 != x) yLower[x1] = lumaOf(d[0], d[1], d[2]);
    }
    const int b4 = a[0] + b[0] + c[0] + d[0], g4 = a[1] + b[1] + c[1] + d[1], r4 = a[2] + b[2] + c[2] + d[2];
    u[x / 2] = cbOf(b4, g4, r4);
    v[x / 2] = crOf(b4, g4, r4);
  }
}

#if defined(__SSE2__)

// The two 32-bit halves that pmaddwd leaves for each pixel, added: four whole sums.
inline __m128i pairSums(__m128i first, __m128i second) {
  const __m128 f = _mm_castsi128_ps(first), s = _mm_castsi128_ps(second);
  const __m128i even = _mm_castps_si128(_mm_shuffle_ps(f, s, _MM_SHUFFLE(2, 0, 2, 0)));
  const __m128i odd = _mm_castps_si128(_mm_shuffle_ps(f, s, _MM_SHUFFLE(3, 1, 3, 1)));
  return _mm_add_epi32(even, odd);
}

// Y' of eight pixels (two unpacked halves each of two loads) as eight 16-bit values.
inline __m128i luma8(__m128i lo0, __m128i hi0, __m128i lo1, __m128i hi1, __m128i weights, __m128i bias) {
  const __m128i first =
      _mm_srai_epi32(_mm_add_epi32(pairSums(_mm_madd_epi16(lo0, weights), _mm_madd_epi16(hi0, weights)), bias), 15);
  const __m128i second =
      _mm_srai_epi32(_mm_add_epi32(pairSums(_mm_madd_epi16(lo1, weights), _mm_madd_epi16(hi1, weights)), bias), 15);
  return _mm_packs_epi32(first, second);
}

// Four chroma values from the 2x2 channel sums of four blocks (two per register).
inline __m128i chroma4(__m128i blocks01, __m128i blocks23, __m128i weights, __m128i bias) {
  return _mm_srai_epi32(
      _mm_add_epi32(pairSums(_mm_madd_epi16(blocks01, weights), _mm_madd_epi16(blocks23, weights)), bias), 17);
}

// Sums of the 2x2 blocks of four columns: from the rows' unpacked pixels 0-1 and 2-3.
inline __m128i blockSums(__m128i upperLo, __m128i upperHi, __m128i lowerLo, __m128i lowerHi) {
  const __m128i lo = _mm_add_epi16(upperLo, lowerLo), hi = _mm_add_epi16(upperHi, lowerHi);
  return _mm_add_epi16(_mm_unpacklo_epi64(lo, hi), _mm_unpackhi_epi64(lo, hi));
}

// Sixteen columns at a time from column `x` (even); returns the first column left for pairTail.
int pairWide(const uint8_t* upper, const uint8_t* lower, int x, int width, uint8_t* yUpper, uint8_t* yLower, uint8_t* u,
             uint8_t* v) {
  const __m128i zero = _mm_setzero_si128();
  const __m128i yWeights = _mm_setr_epi16(yB, yG, yR, 0, yB, yG, yR, 0);
  const __m128i uWeights = _mm_setr_epi16(uB, uG, uR, 0, uB, uG, uR, 0);
  const __m128i vWeights = _mm_setr_epi16(vB, vG, vR, 0, vB, vG, vR, 0);
  const __m128i yBias = _mm_set1_epi32((16 << 15) + (1 << 14));
  const __m128i cBias = _mm_set1_epi32((128 << 17) + (1 << 16));
  const uint8_t* second = lower ? lower : upper;
  for (; x + 16 <= width; x += 16) {
    __m128i ul[4], uh[4], ll[4], lh[4];
    for (int i = 0; i < 4; ++i) {
      const __m128i a = _mm_loadu_si128(reinterpret_cast<const __m128i*>(upper + (x + 4 * i) * 4));
      const __m128i c = _mm_loadu_si128(reinterpret_cast<const __m128i*>(second + (x + 4 * i) * 4));
      ul[i] = _mm_unpacklo_epi8(a, zero);
      uh[i] = _mm_unpackhi_epi8(a, zero);
      ll[i] = _mm_unpacklo_epi8(c, zero);
      lh[i] = _mm_unpackhi_epi8(c, zero);
    }
    const __m128i yu = _mm_packus_epi16(luma8(ul[0], uh[0], ul[1], uh[1], yWeights, yBias),
                                        luma8(ul[2], uh[2], ul[3], uh[3], yWeights, yBias));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(yUpper + x), yu);
    if (lower) {
      const __m128i yl = _mm_packus_epi16(luma8(ll[0], lh[0], ll[1], lh[1], yWeights, yBias),
                                          luma8(ll[2], lh[2], ll[3], lh[3], yWeights, yBias));
      _mm_storeu_si128(reinterpret_cast<__m128i*>(yLower + x), yl);
    }
    __m128i blocks[4];
    for (int i = 0; i < 4; ++i) blocks[i] = blockSums(ul[i], uh[i], ll[i], lh[i]);
    const __m128i cb =
        _mm_packs_epi32(chroma4(blocks[0], blocks[1], uWeights, cBias), chroma4(blocks[2], blocks[3], uWeights, cBias));
    const __m128i cr =
        _mm_packs_epi32(chroma4(blocks[0], blocks[1], vWeights, cBias), chroma4(blocks[2], blocks[3], vWeights, cBias));
    _mm_storel_epi64(reinterpret_cast<__m128i*>(u + x / 2), _mm_packus_epi16(cb, cb));
    _mm_storel_epi64(reinterpret_cast<__m128i*>(v + x / 2), _mm_packus_epi16(cr, cr));
  }
  return x;
}

#else

int pairWide(const uint8_t*, const uint8_t*, int x, int, uint8_t*, uint8_t*, uint8_t*, uint8_t*) { return x; }

#endif

#if defined(TAVIO_AVX2)

// The same arithmetic as the 16-column path, 32 columns at a time. Unpacking and packing work
// within 128-bit halves, so results come out in groups that a final permutation puts in order.
#define TAVIO_TARGET_AVX2 __attribute__((target("avx2")))

TAVIO_TARGET_AVX2 inline __m256i pairSums256(__m256i first, __m256i second) {
  const __m256 f = _mm256_castsi256_ps(first), s = _mm256_castsi256_ps(second);
  const __m256i even = _mm256_castps_si256(_mm256_shuffle_ps(f, s, _MM_SHUFFLE(2, 0, 2, 0)));
  const __m256i odd = _mm256_castps_si256(_mm256_shuffle_ps(f, s, _MM_SHUFFLE(3, 1, 3, 1)));
  return _mm256_add_epi32(even, odd);
}

TAVIO_TARGET_AVX2 inline __m256i luma16(__m256i lo0, __m256i hi0, __m256i lo1, __m256i hi1, __m256i weights,
                                        __m256i bias) {
  const __m256i first = _mm256_srai_epi32(
      _mm256_add_epi32(pairSums256(_mm256_madd_epi16(lo0, weights), _mm256_madd_epi16(hi0, weights)), bias), 15);
  const __m256i second = _mm256_srai_epi32(
      _mm256_add_epi32(pairSums256(_mm256_madd_epi16(lo1, weights), _mm256_madd_epi16(hi1, weights)), bias), 15);
  return _mm256_packs_epi32(first, second);
}

// Eight chroma values of four registers of block sums, in column order as 32-bit values.
TAVIO_TARGET_AVX2 inline __m256i chroma8(__m256i blocks01, __m256i blocks23, __m256i weights, __m256i bias) {
  const __m256i values = _mm256_srai_epi32(
      _mm256_add_epi32(pairSums256(_mm256_madd_epi16(blocks01, weights), _mm256_madd_epi16(blocks23, weights)), bias),
      17);
  return _mm256_permute4x64_epi64(values, _MM_SHUFFLE(3, 1, 2, 0));
}

TAVIO_TARGET_AVX2 inline __m256i blockSums256(__m256i upperLo, __m256i upperHi, __m256i lowerLo, __m256i lowerHi) {
  const __m256i lo = _mm256_add_epi16(upperLo, lowerLo), hi = _mm256_add_epi16(upperHi, lowerHi);
  return _mm256_add_epi16(_mm256_unpacklo_epi64(lo, hi), _mm256_unpackhi_epi64(lo, hi));
}

TAVIO_TARGET_AVX2 int pairWide32(const uint8_t* upper, const uint8_t* lower, int width, uint8_t* yUpper,
                                 uint8_t* yLower, uint8_t* u, uint8_t* v) {
  const __m256i zero = _mm256_setzero_si256();
  const __m256i yWeights = _mm256_setr_epi16(yB, yG, yR, 0, yB, yG, yR, 0, yB, yG, yR, 0, yB, yG, yR, 0);
  const __m256i uWeights = _mm256_setr_epi16(uB, uG, uR, 0, uB, uG, uR, 0, uB, uG, uR, 0, uB, uG, uR, 0);
  const __m256i vWeights = _mm256_setr_epi16(vB, vG, vR, 0, vB, vG, vR, 0, vB, vG, vR, 0, vB, vG, vR, 0);
  const __m256i yBias = _mm256_set1_epi32((16 << 15) + (1 << 14));
  const __m256i cBias = _mm256_set1_epi32((128 << 17) + (1 << 16));
  // Four-byte groups: the low half holds groups 0, 2, 4, 6 and the high half 1, 3, 5, 7.
  const __m256i order = _mm256_setr_epi32(0, 4, 1, 5, 2, 6, 3, 7);
  const uint8_t* second = lower ? lower : upper;
  int x = 0;
  for (; x + 32 <= width; x += 32) {
    __m256i ul[4], uh[4], ll[4], lh[4];
    for (int i = 0; i < 4; ++i) {
      const __m256i a = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(upper + (x + 8 * i) * 4));
      const __m256i c = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(second + (x + 8 * i) * 4));
      ul[i] = _mm256_unpacklo_epi8(a, zero);
      uh[i] = _mm256_unpackhi_epi8(a, zero);
      ll[i] = _mm256_unpacklo_epi8(c, zero);
      lh[i] = _mm256_unpackhi_epi8(c, zero);
    }
    const __m256i yu = _mm256_packus_epi16(luma16(ul[0], uh[0], ul[1], uh[1], yWeights, yBias),
                                           luma16(ul[2], uh[2], ul[3], uh[3], yWeights, yBias));
    _mm256_storeu_si256(reinterpret_cast<__m256i*>(yUpper + x), _mm256_permutevar8x32_epi32(yu, order));
    if (lower) {
      const __m256i yl = _mm256_packus_epi16(luma16(ll[0], lh[0], ll[1], lh[1], yWeights, yBias),
                                             luma16(ll[2], lh[2], ll[3], lh[3], yWeights, yBias));
      _mm256_storeu_si256(reinterpret_cast<__m256i*>(yLower + x), _mm256_permutevar8x32_epi32(yl, order));
    }
    __m256i blocks[4];
    for (int i = 0; i < 4; ++i) blocks[i] = blockSums256(ul[i], uh[i], ll[i], lh[i]);
    const __m256i cb = _mm256_packs_epi32(chroma8(blocks[0], blocks[1], uWeights, cBias),
                                          chroma8(blocks[2], blocks[3], uWeights, cBias));
    const __m256i cr = _mm256_packs_epi32(chroma8(blocks[0], blocks[1], vWeights, cBias),
                                          chroma8(blocks[2], blocks[3], vWeights, cBias));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(u + x / 2),
                     _mm256_castsi256_si128(_mm256_permutevar8x32_epi32(_mm256_packus_epi16(cb, cb), order)));
    _mm_storeu_si128(reinterpret_cast<__m128i*>(v + x / 2),
                     _mm256_castsi256_si128(_mm256_permutevar8x32_epi32(_mm256_packus_epi16(cr, cr), order)));
  }
  return x;
}

bool hasAvx2() {
  static const bool present = __builtin_cpu_supports("avx2");
  return present;
}

#else

int pairWide32(const uint8_t*, const uint8_t*, int, uint8_t*, uint8_t*, uint8_t*, uint8_t*) { return 0; }
bool hasAvx2() { return false; }

#endif

}  // namespace

void bgrxToI420(const uint8_t* source, ptrdiff_t sourceStride, int width, int height, uint8_t* y, ptrdiff_t yStride,
                uint8_t* u, ptrdiff_t uStride, uint8_t* v, ptrdiff_t vStride) {
  const bool avx2 = hasAvx2();
  for (int row = 0; row < height; row += 2) {
    const uint8_t* upper = source + row * sourceStride;
    const uint8_t* lower = row + 1 < height ? upper + sourceStride : nullptr;
    uint8_t* yUpper = y + row * yStride;
    uint8_t* yLower = lower ? yUpper + yStride : nullptr;
    uint8_t* uRow = u + (row / 2) * uStride;
    uint8_t* vRow = v + (row / 2) * vStride;
    const int wide = avx2 ? pairWide32(upper, lower, width, yUpper, yLower, uRow, vRow) : 0;
    const int done = pairWide(upper, lower, wide, width, yUpper, yLower, uRow, vRow);
    pairTail(upper, lower, done, width, yUpper, yLower, uRow, vRow);
  }
}

}  // namespace platform::colour
