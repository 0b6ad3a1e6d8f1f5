// B, G, R, X to I420 (BT.709, limited range): against the matrix worked out pixel by pixel in
// floating point, against the same integer formula applied one pixel at a time, and against
// swscale set up as the sink writer used to set it up.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <random>
#include <vector>

extern "C" {
#include <libswscale/swscale.h>
}

#include "platform/linux/ffmpeg/colorconvert.h"

namespace {

using platform::colour::bgrxToI420;

struct Planes {
  Planes(int width, int height)
      : width(width),
        height(height),
        cw((width + 1) / 2),
        ch((height + 1) / 2),
        y(static_cast<size_t>(width) * height, 0),
        u(static_cast<size_t>(cw) * ch, 0),
        v(u.size(), 0) {}
  int width, height, cw, ch;
  std::vector<uint8_t> y, u, v;
};

Planes convert(const std::vector<uint8_t>& pixels, int width, int height) {
  Planes out(width, height);
  bgrxToI420(pixels.data(), static_cast<ptrdiff_t>(width) * 4, width, height, out.y.data(), width, out.u.data(), out.cw,
             out.v.data(), out.cw);
  return out;
}

std::vector<uint8_t> noise(int width, int height, unsigned seed) {
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
  std::mt19937 random(seed);
  for (uint8_t& byte : pixels) byte = static_cast<uint8_t>(random());
  return pixels;
}

const uint8_t* at(const std::vector<uint8_t>& pixels, int width, int x, int y) {
  return &pixels[(static_cast<size_t>(y) * width + x) * 4];
}

// The matrix itself: Y' = 0.2126 R + 0.7152 G + 0.0722 B on 219 levels from 16; Cb and Cr of
// the 2x2 block's mean colour on 224 levels around 128; edge pixels stand in for missing ones.
Planes reference(const std::vector<uint8_t>& pixels, int width, int height) {
  Planes out(width, height);
  auto clampRound = [](double value) { return static_cast<uint8_t>(std::clamp(std::floor(value + 0.5), 0.0, 255.0)); };
  for (int y = 0; y < height; ++y)
    for (int x = 0; x < width; ++x) {
      const uint8_t* p = at(pixels, width, x, y);
      out.y[static_cast<size_t>(y) * width + x] =
          clampRound(16.0 + 219.0 / 255.0 * (0.2126 * p[2] + 0.7152 * p[1] + 0.0722 * p[0]));
    }
  for (int cy = 0; cy < out.ch; ++cy)
    for (int cx = 0; cx < out.cw; ++cx) {
      double b = 0, g = 0, r = 0;
      for (int dy = 0; dy < 2; ++dy)
        for (int dx = 0; dx < 2; ++dx) {
          const uint8_t* p = at(pixels, width, std::min(2 * cx + dx, width - 1), std::min(2 * cy + dy, height - 1));
          b += p[0] / 4.0, g += p[1] / 4.0, r += p[2] / 4.0;
        }
      const double luma = 0.2126 * r + 0.7152 * g + 0.0722 * b;
      out.u[static_cast<size_t>(cy) * out.cw + cx] = clampRound(128.0 + 224.0 / 255.0 * (b - luma) / 1.8556);
      out.v[static_cast<size_t>(cy) * out.cw + cx] = clampRound(128.0 + 224.0 / 255.0 * (r - luma) / 1.5748);
    }
  return out;
}

// The integer formula, one pixel or block at a time, with no wide path.
Planes integerReference(const std::vector<uint8_t>& pixels, int width, int height) {
  Planes out(width, height);
  for (int y = 0; y < height; ++y)
    for (int x = 0; x < width; ++x) {
      const uint8_t* p = at(pixels, width, x, y);
      out.y[static_cast<size_t>(y) * width + x] = platform::colour::lumaOf(p[0], p[1], p[2]);
    }
  for (int cy = 0; cy < out.ch; ++cy)
    for (int cx = 0; cx < out.cw; ++cx) {
      int b = 0, g = 0, r = 0;
      for (int dy = 0; dy < 2; ++dy)
        for (int dx = 0; dx < 2; ++dx) {
          const uint8_t* p = at(pixels, width, std::min(2 * cx + dx, width - 1), std::min(2 * cy + dy, height - 1));
          b += p[0], g += p[1], r += p[2];
        }
      out.u[static_cast<size_t>(cy) * out.cw + cx] = platform::colour::cbOf(b, g, r);
      out.v[static_cast<size_t>(cy) * out.cw + cx] = platform::colour::crOf(b, g, r);
    }
  return out;
}

int maxDifference(const std::vector<uint8_t>& a, const std::vector<uint8_t>& b) {
  EXPECT_EQ(a.size(), b.size());
  int worst = 0;
  for (size_t i = 0; i < a.size() && i < b.size(); ++i) worst = std::max(worst, std::abs(a[i] - b[i]));
  return worst;
}

const int sizes[][2] = {{1, 1},  {2, 2},  {3, 3},  {2, 1},  {1, 2},   {15, 7},  {16, 2},  {17, 5},
                        {31, 4}, {32, 3}, {33, 9}, {48, 1}, {64, 31}, {95, 16}, {250, 17}};

TEST(ColourConversion, MatchesTheMatrixWithinOneLevelAtOddAndEvenSizes) {
  for (const auto& size : sizes) {
    SCOPED_TRACE(testing::Message() << size[0] << "x" << size[1]);
    const auto pixels = noise(size[0], size[1], static_cast<unsigned>(size[0] * 1000 + size[1]));
    const Planes got = convert(pixels, size[0], size[1]);
    const Planes want = reference(pixels, size[0], size[1]);
    EXPECT_LE(maxDifference(got.y, want.y), 1);
    EXPECT_LE(maxDifference(got.u, want.u), 1);
    EXPECT_LE(maxDifference(got.v, want.v), 1);
  }
}

// The noise fills the ignored fourth byte too: a path that reads it differs.
TEST(ColourConversion, WidePathGivesExactlyThePerPixelIntegerResult) {
  for (const auto& size : sizes) {
    SCOPED_TRACE(testing::Message() << size[0] << "x" << size[1]);
    const auto pixels = noise(size[0], size[1], static_cast<unsigned>(size[1] * 977 + size[0]));
    const Planes got = convert(pixels, size[0], size[1]);
    const Planes want = integerReference(pixels, size[0], size[1]);
    EXPECT_EQ(got.y, want.y);
    EXPECT_EQ(got.u, want.u);
    EXPECT_EQ(got.v, want.v);
  }
}

TEST(ColourConversion, BlackWhiteGreyAndPrimariesLandOnTheirLevels) {
  struct Case {
    uint8_t b, g, r, y, u, v;
  } cases[] = {
      {0, 0, 0, 16, 128, 128},   {255, 255, 255, 235, 128, 128}, {128, 128, 128, 126, 128, 128},
      {0, 0, 255, 63, 102, 240}, {0, 255, 0, 173, 42, 26},       {255, 0, 0, 32, 240, 118},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(testing::Message() << int(c.b) << "," << int(c.g) << "," << int(c.r));
    std::vector<uint8_t> pixels;
    for (int i = 0; i < 40 * 4; ++i) pixels.insert(pixels.end(), {c.b, c.g, c.r, 0});
    const Planes got = convert(pixels, 40, 4);
    EXPECT_EQ(got.y, std::vector<uint8_t>(got.y.size(), c.y));
    EXPECT_EQ(got.u, std::vector<uint8_t>(got.u.size(), c.u));
    EXPECT_EQ(got.v, std::vector<uint8_t>(got.v.size(), c.v));
  }
}

TEST(ColourConversion, NegativeStrideReadsBottomUpRowsUpright) {
  const int width = 37, height = 11;
  const auto upright = noise(width, height, 7);
  std::vector<uint8_t> flipped(upright.size());
  const size_t row = static_cast<size_t>(width) * 4;
  for (int y = 0; y < height; ++y) std::copy_n(&upright[y * row], row, &flipped[(height - 1 - y) * row]);
  Planes got(width, height);
  bgrxToI420(flipped.data() + (height - 1) * row, -static_cast<ptrdiff_t>(row), width, height, got.y.data(), width,
             got.u.data(), got.cw, got.v.data(), got.cw);
  const Planes want = convert(upright, width, height);
  EXPECT_EQ(got.y, want.y);
  EXPECT_EQ(got.u, want.u);
  EXPECT_EQ(got.v, want.v);
}

TEST(ColourConversion, AgreesWithSwscaleWithinTwoLevelsOnAScreenPattern) {
  const int width = 1920, height = 1080;
  // Smooth gradients with flat panels: colour edges only where blocks line up with 2x2 blocks, so
  // both converters' chroma filters see the same colours.
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
  for (int y = 0; y < height; ++y)
    for (int x = 0; x < width; ++x) {
      uint8_t* p = &pixels[(static_cast<size_t>(y) * width + x) * 4];
      const bool panel = (x / 128 + y / 128) % 3 == 0;
      p[0] = panel ? 230 : static_cast<uint8_t>(x * 255 / (width - 1));
      p[1] = panel ? 40 : static_cast<uint8_t>(y * 255 / (height - 1));
      p[2] = panel ? 120 : static_cast<uint8_t>((x + y) * 255 / (width + height - 2));
      p[3] = 0;
    }
  const Planes ours = convert(pixels, width, height);

  SwsContext* context = sws_getContext(width, height, AV_PIX_FMT_BGR0, width, height, AV_PIX_FMT_YUV420P, SWS_BILINEAR,
                                       nullptr, nullptr, nullptr);
  ASSERT_NE(context, nullptr);
  int* table = const_cast<int*>(sws_getCoefficients(SWS_CS_ITU709));
  sws_setColorspaceDetails(context, table, 1, table, 0, 0, 1 << 16, 1 << 16);
  Planes theirs(width, height);
  const uint8_t* in[4] = {pixels.data()};
  int inStride[4] = {width * 4};
  uint8_t* out[4] = {theirs.y.data(), theirs.u.data(), theirs.v.data()};
  int outStride[4] = {width, theirs.cw, theirs.cw};
  sws_scale(context, in, inStride, 0, height, out, outStride);
  sws_freeContext(context);

  // Panel borders: swscale's chroma filter reaches one pixel further than a 2x2 block.
  auto awayFromEdges = [](const std::vector<uint8_t>& plane, int w, int h, int scale) {
    std::vector<uint8_t> kept;
    for (int y = 0; y < h; ++y)
      for (int x = 0; x < w; ++x) {
        const int px = x * scale, py = y * scale;
        if (px % 128 < 4 || px % 128 > 123 || py % 128 < 4 || py % 128 > 123) continue;
        kept.push_back(plane[static_cast<size_t>(y) * w + x]);
      }
    return kept;
  };
  EXPECT_LE(maxDifference(ours.y, theirs.y), 2);
  EXPECT_LE(maxDifference(awayFromEdges(ours.u, ours.cw, ours.ch, 2), awayFromEdges(theirs.u, ours.cw, ours.ch, 2)), 2);
  EXPECT_LE(maxDifference(awayFromEdges(ours.v, ours.cw, ours.ch, 2), awayFromEdges(theirs.v, ours.cw, ours.ch, 2)), 2);
}

}  // namespace
