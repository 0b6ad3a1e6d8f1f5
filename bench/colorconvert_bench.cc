// BGRX to I420 at 1920x1080, bottom-up input read through a negative stride: our converter
// against swscale set up as the sink writer set it up before (bilinear, BT.709 limited range),
// in one run. Prints both medians and their ratio.
//   colorconvert_bench [rounds]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <vector>

extern "C" {
#include <libswscale/swscale.h>
}

#include "platform/linux/ffmpeg/colorconvert.h"

namespace {

constexpr int width = 1920, height = 1080;

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

double millisecondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
}

}  // namespace

int main(int argc, char** argv) {
  const int rounds = argc > 1 ? std::atoi(argv[1]) : 100;
  const size_t row = static_cast<size_t>(width) * 4;
  std::vector<uint8_t> pixels(row * height);
  std::mt19937 random(1);
  for (auto& byte : pixels) byte = static_cast<uint8_t>(random());
  const uint8_t* lastRow = pixels.data() + row * (height - 1);
  const int cw = width / 2, ch = height / 2;
  std::vector<uint8_t> y(static_cast<size_t>(width) * height), u(static_cast<size_t>(cw) * ch), v(u.size());
  std::vector<uint8_t> y2(y.size()), u2(u.size()), v2(v.size());

  SwsContext* context = sws_getContext(width, height, AV_PIX_FMT_BGR0, width, height, AV_PIX_FMT_YUV420P, SWS_BILINEAR,
                                       nullptr, nullptr, nullptr);
  int* table = const_cast<int*>(sws_getCoefficients(SWS_CS_ITU709));
  sws_setColorspaceDetails(context, table, 1, table, 0, 0, 1 << 16, 1 << 16);

  std::vector<double> ours, theirs;
  for (int i = 0; i < rounds; ++i) {
    pixels[(i * 4099) % pixels.size()] ^= 1;  // a different picture each round
    auto start = std::chrono::steady_clock::now();
    platform::colour::bgrxToI420(lastRow, -static_cast<ptrdiff_t>(row), width, height, y.data(), width, u.data(), cw,
                                 v.data(), cw);
    ours.push_back(millisecondsSince(start));

    const uint8_t* in[4] = {lastRow};
    int inStride[4] = {-static_cast<int>(row)};
    uint8_t* out[4] = {y2.data(), u2.data(), v2.data()};
    int outStride[4] = {width, cw, cw};
    start = std::chrono::steady_clock::now();
    sws_scale(context, in, inStride, 0, height, out, outStride);
    theirs.push_back(millisecondsSince(start));
  }
  sws_freeContext(context);
  int worst = 0;
  for (size_t i = 0; i < y.size(); ++i) worst = std::max(worst, std::abs(y[i] - y2[i]));
  std::printf(
      "%dx%d, %d rounds: ours median %.3f ms, swscale median %.3f ms, ratio %.2f (largest luma difference %d)\n", width,
      height, rounds, median(ours), median(theirs), median(ours) / median(theirs), worst);
  return 0;
}
