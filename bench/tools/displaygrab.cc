// Measures one display grab (capture() of a changed output) against one memcpy of the same
// number of bytes, both in this process, and prints the medians and their ratio, and the page
// faults a grab costs.
//   displaygrab [ROUNDS] [full]   (grabs the first display of $DISPLAY)
// Each round draws a 64x64 square at the top left, or with "full" fills the whole output, so
// the grab has that much changed picture to fetch.
#include <sys/resource.h>
#include <unistd.h>
#include <xcb/xcb.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "capture/video/screen/dxgi/capturemethod.h"
#include "capture/video/screen/dxgi/source.h"

namespace {

using Clock = std::chrono::steady_clock;

double median(std::vector<double> values) {
  std::sort(values.begin(), values.end());
  return values[values.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
  int rounds = argc > 1 ? std::atoi(argv[1]) : 200;
  const bool full = argc > 2 && std::strcmp(argv[2], "full") == 0;
  auto sources = capture::video::screen::dxgi::CaptureMethod().sources();
  if (sources.empty()) {
    std::fprintf(stderr, "displaygrab: no display\n");
    return 1;
  }
  auto* source = dynamic_cast<capture::video::screen::dxgi::Source*>(sources[0].get());
  source->capture();  // the first acquisition always has a frame

  // Draws on the root window, so every round has a changed output.
  xcb_connection_t* c = xcb_connect(nullptr, nullptr);
  xcb_screen_t* screen = xcb_setup_roots_iterator(xcb_get_setup(c)).data;
  xcb_gcontext_t gc = xcb_generate_id(c);
  xcb_create_gc(c, gc, screen->root, 0, nullptr);
  uint32_t subwindows = XCB_SUBWINDOW_MODE_INCLUDE_INFERIORS;
  xcb_change_gc(c, gc, XCB_GC_SUBWINDOW_MODE, &subwindows);

  size_t bytes = static_cast<size_t>(source->size());
  std::vector<double> grabs, copies;
  int missed = 0;
  long faults = 0;
  for (int i = 0; i < rounds; ++i) {
    uint32_t colour = (i & 1) ? 0x336699 : 0x996633;
    xcb_change_gc(c, gc, XCB_GC_FOREGROUND, &colour);
    xcb_rectangle_t r{0, 0, static_cast<uint16_t>(full ? source->width() : 64),
                      static_cast<uint16_t>(full ? source->height() : 64)};
    xcb_poly_fill_rectangle(c, screen->root, gc, 1, &r);
    free(xcb_get_input_focus_reply(c, xcb_get_input_focus(c), nullptr));

    int64_t before = 0;
    {
      std::lock_guard<std::mutex> lock(source->queue->mutex);
      before = source->queue->frames.empty() ? 0 : reinterpret_cast<intptr_t>(source->queue->frames.back().get());
    }
    rusage usageBefore{}, usageAfter{};
    getrusage(RUSAGE_THREAD, &usageBefore);
    auto start = Clock::now();
    source->capture();
    auto end = Clock::now();
    getrusage(RUSAGE_THREAD, &usageAfter);
    faults += usageAfter.ru_minflt - usageBefore.ru_minflt;
    {
      std::lock_guard<std::mutex> lock(source->queue->mutex);
      if (reinterpret_cast<intptr_t>(source->queue->frames.back().get()) == before) ++missed;
    }
    grabs.push_back(std::chrono::duration<double, std::milli>(end - start).count());
  }

  // The reference copies the same two buffers each round, so they stay in the cache; a grab's
  // pictures cannot. For comparison, the same copy between buffers that rotate through four
  // times the last-level cache size, so each one comes from and goes to memory.
  std::vector<uint8_t> from(bytes, 1), to(bytes, 2);
  for (int i = 0; i < rounds; ++i) {
    from[i % bytes] = static_cast<uint8_t>(i);
    auto start = Clock::now();
    std::memcpy(to.data(), from.data(), bytes);
    auto end = Clock::now();
    copies.push_back(std::chrono::duration<double, std::milli>(end - start).count());
  }
  const long cache = std::max(sysconf(_SC_LEVEL3_CACHE_SIZE), 32L << 20);
  std::vector<std::vector<uint8_t>> pool(static_cast<size_t>(4 * cache / static_cast<long>(bytes)) + 2,
                                         std::vector<uint8_t>(bytes, 3));
  std::vector<double> coldCopies;
  for (int i = 0; i < rounds; ++i) {
    auto& a = pool[(2 * i) % pool.size()];
    auto& b = pool[(2 * i + 1) % pool.size()];
    auto start = Clock::now();
    std::memcpy(b.data(), a.data(), bytes);
    auto end = Clock::now();
    coldCopies.push_back(std::chrono::duration<double, std::milli>(end - start).count());
  }
  std::printf("output %ux%u, %d rounds changing %s, %d without a new frame\n", source->width(), source->height(),
              rounds, full ? "the whole output" : "64x64 pixels", missed);
  std::printf("grab median %.3f ms, memcpy of %zu bytes median %.3f ms, ratio %.2f\n", median(grabs), bytes,
              median(copies), median(grabs) / median(copies));
  std::printf("memcpy from and to memory not in the cache median %.3f ms, ratio %.2f\n", median(coldCopies),
              median(grabs) / median(coldCopies));
  std::printf("page faults per grab %.1f\n", static_cast<double>(faults) / rounds);
  xcb_disconnect(c);
  return missed == 0 ? 0 : 1;
}
