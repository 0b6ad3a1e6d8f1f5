// Maps a borderless window filled with a known pattern and keeps it until killed.
//   xpattern X Y WIDTH HEIGHT [FPS]
// Without FPS the window shows four colour blocks side by side, left to right: red, green,
// blue, white (each a quarter of the width). With FPS the blocks move one step to the right
// that many times a second, so the screen changes at that rate. Prints "ready" once drawn.
#include <poll.h>
#include <xcb/xcb.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <thread>

namespace {

const uint32_t colours[4] = {0xFF0000, 0x00FF00, 0x0000FF, 0xFFFFFF};
uint32_t pixels[4];

// The pixel value of a full-intensity 0xRRGGBB colour on a true-colour visual of any depth.
uint32_t pixelOf(uint32_t rgb, const xcb_visualtype_t& visual) {
  uint32_t pixel = 0;
  if (rgb & 0xFF0000) pixel |= visual.red_mask;
  if (rgb & 0x00FF00) pixel |= visual.green_mask;
  if (rgb & 0x0000FF) pixel |= visual.blue_mask;
  return pixel;
}

// Paints into a pixmap and copies it in one request, so a screen grab never sees half a step.
void draw(xcb_connection_t* c, xcb_window_t window, xcb_pixmap_t pixmap, xcb_gcontext_t gc, uint16_t width,
          uint16_t height, int shift) {
  uint16_t block = width / 4;
  for (int i = 0; i < 4; ++i) {
    uint32_t colour = pixels[(i + 4 - shift % 4) % 4];
    xcb_change_gc(c, gc, XCB_GC_FOREGROUND, &colour);
    xcb_rectangle_t r{static_cast<int16_t>(i * block), 0, static_cast<uint16_t>(i == 3 ? width - 3 * block : block),
                      height};
    xcb_poly_fill_rectangle(c, pixmap, gc, 1, &r);
  }
  xcb_copy_area(c, pixmap, window, gc, 0, 0, 0, 0, width, height);
  xcb_flush(c);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 5) {
    std::fprintf(stderr, "usage: xpattern X Y WIDTH HEIGHT [FPS]\n");
    return 2;
  }
  auto x = static_cast<int16_t>(std::atoi(argv[1]));
  auto y = static_cast<int16_t>(std::atoi(argv[2]));
  auto width = static_cast<uint16_t>(std::atoi(argv[3]));
  auto height = static_cast<uint16_t>(std::atoi(argv[4]));
  double fps = argc > 5 ? std::atof(argv[5]) : 0;

  xcb_connection_t* c = xcb_connect(nullptr, nullptr);
  if (xcb_connection_has_error(c)) {
    std::fprintf(stderr, "xpattern: no display\n");
    return 1;
  }
  xcb_screen_t* screen = xcb_setup_roots_iterator(xcb_get_setup(c)).data;
  for (auto d = xcb_screen_allowed_depths_iterator(screen); d.rem; xcb_depth_next(&d))
    for (auto v = xcb_depth_visuals_iterator(d.data); v.rem; xcb_visualtype_next(&v))
      if (v.data->visual_id == screen->root_visual)
        for (int i = 0; i < 4; ++i) pixels[i] = pixelOf(colours[i], *v.data);
  xcb_window_t window = xcb_generate_id(c);
  // Override-redirect: no window manager may move or decorate it.
  uint32_t values[] = {screen->black_pixel, 1, XCB_EVENT_MASK_EXPOSURE};
  xcb_create_window(c, XCB_COPY_FROM_PARENT, window, screen->root, x, y, width, height, 0,
                    XCB_WINDOW_CLASS_INPUT_OUTPUT, screen->root_visual,
                    XCB_CW_BACK_PIXEL | XCB_CW_OVERRIDE_REDIRECT | XCB_CW_EVENT_MASK, values);
  xcb_pixmap_t pixmap = xcb_generate_id(c);
  xcb_create_pixmap(c, screen->root_depth, pixmap, window, width, height);
  xcb_gcontext_t gc = xcb_generate_id(c);
  uint32_t noExposures = 0;
  xcb_create_gc(c, gc, window, XCB_GC_GRAPHICS_EXPOSURES, &noExposures);
  xcb_map_window(c, window);
  xcb_flush(c);

  int shift = 0;
  draw(c, window, pixmap, gc, width, height, shift);
  free(xcb_get_input_focus_reply(c, xcb_get_input_focus(c), nullptr));  // drawn once this returns
  std::printf("ready\n");
  std::fflush(stdout);

  auto period = std::chrono::duration<double>(fps > 0 ? 1.0 / fps : 0.1);
  auto next = std::chrono::steady_clock::now();
  for (;;) {
    while (xcb_generic_event_t* event = xcb_poll_for_event(c)) {
      if ((event->response_type & 0x7F) == XCB_EXPOSE) draw(c, window, pixmap, gc, width, height, shift);
      free(event);
    }
    if (xcb_connection_has_error(c)) return 0;
    if (fps > 0) {
      next += std::chrono::duration_cast<std::chrono::steady_clock::duration>(period);
      std::this_thread::sleep_until(next);
      draw(c, window, pixmap, gc, width, height, ++shift);
    } else {
      pollfd fd{xcb_get_file_descriptor(c), POLLIN, 0};
      poll(&fd, 1, -1);
    }
  }
}
