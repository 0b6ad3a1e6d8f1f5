// Maps a borderless window over the screen's top-left WIDTH x HEIGHT and fills it with a solid
// colour each time a line names one on standard input: "r", "g", "b" or "w". For each fill it
// prints the monotonic clock in microseconds taken just before the drawing request was sent, so a
// reader on the same clock can time what it sees against the drawing call.
//   xflip WIDTH HEIGHT
#include <xcb/xcb.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>

namespace {

// The pixel value of a full-intensity colour on a true-colour visual of any depth.
uint32_t pixelOf(char colour, const xcb_visualtype_t& visual) {
  switch (colour) {
    case 'r': return visual.red_mask;
    case 'g': return visual.green_mask;
    case 'b': return visual.blue_mask;
    default: return visual.red_mask | visual.green_mask | visual.blue_mask;
  }
}

long long nowMicroseconds() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<long long>(now.tv_sec) * 1000000 + now.tv_nsec / 1000;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) {
    std::fprintf(stderr, "usage: xflip WIDTH HEIGHT\n");
    return 2;
  }
  const auto width = static_cast<uint16_t>(std::atoi(argv[1]));
  const auto height = static_cast<uint16_t>(std::atoi(argv[2]));
  xcb_connection_t* c = xcb_connect(nullptr, nullptr);
  if (xcb_connection_has_error(c)) {
    std::fprintf(stderr, "xflip: no display\n");
    return 1;
  }
  xcb_screen_t* screen = xcb_setup_roots_iterator(xcb_get_setup(c)).data;
  const xcb_visualtype_t* visual = nullptr;
  for (auto d = xcb_screen_allowed_depths_iterator(screen); d.rem; xcb_depth_next(&d))
    for (auto v = xcb_depth_visuals_iterator(d.data); v.rem; xcb_visualtype_next(&v))
      if (v.data->visual_id == screen->root_visual) visual = v.data;
  if (!visual) return 1;
  xcb_window_t window = xcb_generate_id(c);
  uint32_t values[] = {screen->black_pixel, 1};  // override-redirect: no window manager moves it
  xcb_create_window(c, XCB_COPY_FROM_PARENT, window, screen->root, 0, 0, width, height, 0,
                    XCB_WINDOW_CLASS_INPUT_OUTPUT, screen->root_visual, XCB_CW_BACK_PIXEL | XCB_CW_OVERRIDE_REDIRECT,
                    values);
  xcb_gcontext_t gc = xcb_generate_id(c);
  uint32_t noExposures = 0;
  xcb_create_gc(c, gc, window, XCB_GC_GRAPHICS_EXPOSURES, &noExposures);
  xcb_map_window(c, window);
  free(xcb_get_input_focus_reply(c, xcb_get_input_focus(c), nullptr));  // mapped before the first fill
  std::printf("ready\n");
  std::fflush(stdout);

  char line[16];
  while (std::fgets(line, sizeof line, stdin)) {
    const uint32_t pixel = pixelOf(line[0], *visual);
    const long long at = nowMicroseconds();
    xcb_change_gc(c, gc, XCB_GC_FOREGROUND, &pixel);
    xcb_rectangle_t all{0, 0, width, height};
    xcb_poly_fill_rectangle(c, window, gc, 1, &all);
    xcb_flush(c);
    std::printf("%lld\n", at);
    std::fflush(stdout);
  }
  xcb_disconnect(c);
  return 0;
}
