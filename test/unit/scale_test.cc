// Nearest-neighbour preview scaling.
#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

#include "capture/video/scale.h"

namespace {

using capture::video::scaleFrame;

// The definition, pixel by pixel: float coordinates, 32-bit signed offsets.
void referenceScale(const uint8_t* src, uint64_t srcWidth, uint64_t srcHeight, uint8_t* dst, uint64_t dstWidth,
                    uint64_t dstHeight, uint32_t swap) {
  if (dstHeight == 0) return;
  for (uint64_t y = 0; y < dstHeight; ++y) {
    const auto r = static_cast<uint32_t>(float(y) * float(srcHeight) / float(dstHeight));
    const int32_t base = static_cast<int32_t>(r * uint32_t(srcWidth));
    for (uint64_t x = 0; x < dstWidth; ++x) {
      const auto c = static_cast<int32_t>(float(x) * float(srcWidth) / float(dstWidth));
      const int32_t s = 4 * (c + base);
      const int32_t d = 4 * (int32_t(dstWidth) * int32_t(y) + int32_t(x));
      dst[d + 0] = swap == 1 ? src[s + 2] : src[s + 0];
      dst[d + 1] = src[s + 1];
      dst[d + 2] = swap == 1 ? src[s + 0] : src[s + 2];
      dst[d + 3] = src[s + 3];
    }
  }
}

// Every pixel names its own position: bytes x, y, x>>8 ^ y>>8, 255 - (x + y).
std::vector<uint8_t> numbered(uint64_t width, uint64_t height) {
  std::vector<uint8_t> frame(width * height * 4);
  for (uint64_t y = 0; y < height; ++y)
    for (uint64_t x = 0; x < width; ++x) {
      uint8_t* p = &frame[(y * width + x) * 4];
      p[0] = uint8_t(x);
      p[1] = uint8_t(y);
      p[2] = uint8_t((x >> 8) ^ (y >> 8) ^ (x >> 16));
      p[3] = uint8_t(255 - (x + y));
    }
  return frame;
}

// The swap itself is checked against the definition below.
TEST(ScaleFrame, SwapsRedAndBlueOnlyWhenAskedWithOne) {
  const uint8_t pixel[4] = {10, 20, 30, 255};
  uint8_t out[4] = {};
  scaleFrame(pixel, 1, 1, out, 1, 1, 2);  // only 1 means swap
  EXPECT_EQ(std::vector<uint8_t>(out, out + 4), (std::vector<uint8_t>{10, 20, 30, 255}));
}

TEST(ScaleFrame, ZeroSizesWriteNothing) {
  const uint8_t pixel[4] = {1, 2, 3, 4};
  uint8_t out[4] = {9, 9, 9, 9};
  scaleFrame(pixel, 1, 1, out, 1, 0, 1);
  scaleFrame(pixel, 1, 1, out, 0, 1, 1);
  EXPECT_EQ(std::vector<uint8_t>(out, out + 4), (std::vector<uint8_t>{9, 9, 9, 9}));
}

// The per-call row and column tables must give exactly the per-pixel definition's picture,
// including sizes where float arithmetic differs from integer division.
TEST(ScaleFrame, MatchesThePerPixelDefinitionOverManySizes) {
  struct Size {
    uint64_t sw, sh, dw, dh;
  };
  std::vector<Size> sizes = {{1, 1, 1, 1},
                             {3, 5, 7, 11},
                             {1920, 1080, 320, 180},
                             {1920, 1080, 333, 187},
                             {1280, 720, 1920, 1080},
                             {7, 3, 1, 1},
                             {640, 480, 641, 479},
                             {5001, 3, 4999, 2},
                             {100003, 1, 99991, 1},
                             {16777217, 1, 4096, 1},
                             {1, 4097, 1, 4093},
                             {30000, 2, 29999, 3},
                             // the halving, gathering and run paths with tails that are not whole blocks
                             {1920, 1080, 960, 540},
                             {1934, 7, 967, 3},
                             {1920, 1080, 1920, 1080},
                             {1927, 3, 1927, 5},
                             // constant steps whose last loads end at the row's end
                             {63, 2, 9, 2},
                             {24, 1, 8, 1},
                             {51, 5, 17, 4},
                             {112, 3, 16, 3}};
  for (uint32_t sw = 1; sw < 40; sw += 7)
    for (uint32_t dw = 1; dw < 50; dw += 9) sizes.push_back({sw, sw + 3, dw, dw / 2 + 1});
  int differsFromIntegerDivision = 0;
  for (const Size& s : sizes) {
    const auto src = numbered(s.sw, s.sh);
    std::vector<uint8_t> fast(s.dw * s.dh * 4, 0), slow(s.dw * s.dh * 4, 0);
    for (uint32_t swap : {0u, 1u}) {
      scaleFrame(src.data(), s.sw, s.sh, fast.data(), s.dw, s.dh, swap);
      referenceScale(src.data(), s.sw, s.sh, slow.data(), s.dw, s.dh, swap);
      ASSERT_EQ(fast, slow) << s.sw << "x" << s.sh << " -> " << s.dw << "x" << s.dh;
    }
    for (uint64_t x = 0; x < s.dw; ++x)
      if (capture::video::sourceIndex(x, s.sw, s.dw) != x * s.sw / s.dw) ++differsFromIntegerDivision;
  }
  // The large sizes above must really exercise float rounding.
  EXPECT_GT(differsFromIntegerDivision, 0);
}

}  // namespace
