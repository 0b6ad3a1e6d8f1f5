// B, G, R, X pictures to planar 4:2:0 Y'CbCr (I420), BT.709 limited range: the matrix the H.264
// streams of the sink writer declare. One pass over the source; a negative source stride reads
// bottom-up rows without a copy of its own.
#pragma once

#include <cstddef>
#include <cstdint>

namespace platform::colour {

// Fixed-point weights with 15 fractional bits. Y' = Kr R + Kg G + Kb B with Kr 0.2126 and
// Kb 0.0722, scaled to 219 levels; Cb = (B - Y') / 1.8556 and Cr = (R - Y') / 1.5748, scaled to
// 224 levels. The green weights of Cb and Cr are what makes a grey come out at 128 exactly.
constexpr double kr = 0.2126, kb = 0.0722, kg = 1.0 - kr - kb;
constexpr double lumaScale = 219.0 / 255.0 * 32768.0, chromaScale = 224.0 / 255.0 * 32768.0;
constexpr int roundToInt(double v) { return static_cast<int>(v < 0 ? v - 0.5 : v + 0.5); }
constexpr int yR = roundToInt(kr * lumaScale), yG = roundToInt(kg * lumaScale), yB = roundToInt(kb * lumaScale);
constexpr int uR = roundToInt(-kr / (2.0 * (1.0 - kb)) * chromaScale), uB = roundToInt(0.5 * chromaScale),
              uG = -(uR + uB);
constexpr int vR = roundToInt(0.5 * chromaScale), vB = roundToInt(-kb / (2.0 * (1.0 - kr)) * chromaScale),
              vG = -(vR + vB);

// Y' of one pixel; Cb and Cr of the sums of four pixels' channels (a 2x2 block).
inline uint8_t lumaOf(int b, int g, int r) {
  return static_cast<uint8_t>((yB * b + yG * g + yR * r + (16 << 15) + (1 << 14)) >> 15);
}
inline uint8_t cbOf(int b4, int g4, int r4) {
  return static_cast<uint8_t>((uB * b4 + uG * g4 + uR * r4 + (128 << 17) + (1 << 16)) >> 17);
}
inline uint8_t crOf(int b4, int g4, int r4) {
  return static_cast<uint8_t>((vB * b4 + vG * g4 + vR * r4 + (128 << 17) + (1 << 16)) >> 17);
}

// Converts width x height pixels of 4 bytes (B, G, R, then a byte that is ignored). The chroma
// planes are (width + 1) / 2 by (height + 1) / 2; an odd last column or row counts its own
// pixels twice in the 2x2 average.
void bgrxToI420(const uint8_t* source, ptrdiff_t sourceStride, int width, int height, uint8_t* y, ptrdiff_t yStride,
                uint8_t* u, ptrdiff_t uStride, uint8_t* v, ptrdiff_t vStride);

}  // namespace platform::colour
