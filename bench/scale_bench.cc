// Preview scaling against the per-pixel definition, in one run, with two floors: reading the
// source rows a call samples (every cache line of them holds a sampled pixel at these sizes), and
// for the 1:1 case a memcpy of the same bytes. Prints milliseconds per call and the ratios.
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <vector>

#include "capture/video/scale.h"

namespace {

void perPixel(const uint8_t* src, uint64_t sw, uint64_t sh, uint8_t* dst, uint64_t dw, uint64_t dh) {
  for (uint64_t y = 0; y < dh; ++y)
    for (uint64_t x = 0; x < dw; ++x) {
      const auto r = static_cast<uint32_t>(float(y) * float(sh) / float(dh));
      const auto c = static_cast<uint32_t>(float(x) * float(sw) / float(dw));
      const int32_t s = static_cast<int32_t>(4u * (c + r * uint32_t(sw)));
      const int32_t d = static_cast<int32_t>(4u * (uint32_t(dw) * uint32_t(y) + uint32_t(x)));
      dst[d] = src[s + 2];
      dst[d + 1] = src[s + 1];
      dst[d + 2] = src[s];
      dst[d + 3] = src[s + 3];
    }
}

// Touches every cache line of the sampled source rows once, summing so the reads stay: what any
// scaler must at least read.
uint64_t readRows(const uint8_t* src, uint64_t sw, uint64_t sh, uint64_t dh) {
  uint64_t sum = 0;
  for (uint64_t y = 0; y < dh; ++y) {
    const uint8_t* row = src + 4 * sw * capture::video::sourceIndex(y, sh, dh);
    for (uint64_t i = 0; i < 4 * sw; i += 64) sum += row[i];
  }
  return sum;
}

template <class F>
double millisecondsPerCall(F call, int calls) {
  const auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < calls; ++i) call();
  return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count() / calls;
}

}  // namespace

int main() {
  const uint64_t sw = 1920, sh = 1080;
  std::vector<uint8_t> src(sw * sh * 4);
  for (size_t i = 0; i < src.size(); ++i) src[i] = static_cast<uint8_t>(i * 7);
  struct Size {
    uint64_t w, h;
  } sizes[] = {{320, 180}, {960, 540}, {1920, 1080}};
  for (const Size& s : sizes) {
    std::vector<uint8_t> dst(s.w * s.h * 4);
    const int calls = static_cast<int>(4e7 / (s.w * s.h)) + 1;
    const double reference = millisecondsPerCall([&] { perPixel(src.data(), sw, sh, dst.data(), s.w, s.h); }, calls);
    const double ours =
        millisecondsPerCall([&] { capture::video::scaleFrame(src.data(), sw, sh, dst.data(), s.w, s.h, 1); }, calls);
    volatile uint64_t kept = 0;
    const double rows = millisecondsPerCall([&] { kept = kept + readRows(src.data(), sw, sh, s.h); }, calls);
    std::printf(
        "1920x1080 -> %4llux%-4llu  per-pixel %.3f ms  ours %.3f ms  ratio %.2f  "
        "(touching the sampled rows: %.3f ms, ratio %.2f of per-pixel)\n",
        static_cast<unsigned long long>(s.w), static_cast<unsigned long long>(s.h), reference, ours, ours / reference,
        rows, rows / reference);
    if (s.w == sw && s.h == sh) {
      // The floor of the 1:1 case: moving the same bytes once.
      const double copy = millisecondsPerCall([&] { std::memcpy(dst.data(), src.data(), src.size()); }, calls);
      std::printf("1920x1080 1:1 against a memcpy of the same %zu bytes: %.3f ms, ratio %.2f\n", src.size(), copy,
                  ours / copy);
    }
  }
}
