// Turns the X screen's root window white and plays a beep into the default PulseAudio sink at
// the same moment, for checking that clips of a display and of an endpoint line up.
//   flashbeep DELAY_MS
// The root is black until DELAY_MS after start; then the flash and a 200 ms 1 kHz beep at 0.5.
// Prints "ready" once connected and "flash" right after both were handed over.
#include <pulse/simple.h>
#include <xcb/xcb.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <thread>
#include <vector>

namespace {

void paint(xcb_connection_t* c, xcb_window_t root, uint32_t colour) {
  xcb_change_window_attributes(c, root, XCB_CW_BACK_PIXEL, &colour);
  xcb_clear_area(c, 0, root, 0, 0, 0, 0);
  xcb_flush(c);
}

}  // namespace

int main(int argc, char** argv) {
  const int delay = argc > 1 ? std::atoi(argv[1]) : 1000;
  xcb_connection_t* c = xcb_connect(nullptr, nullptr);
  if (xcb_connection_has_error(c)) return 1;
  const xcb_screen_t* screen = xcb_setup_roots_iterator(xcb_get_setup(c)).data;
  paint(c, screen->root, 0x000000);
  free(xcb_get_input_focus_reply(c, xcb_get_input_focus(c), nullptr));

  const pa_sample_spec stereoFloat{PA_SAMPLE_FLOAT32LE, 48000, 2};
  pa_buffer_attr attr{static_cast<uint32_t>(-1), 48000 * 8 / 100, static_cast<uint32_t>(-1), static_cast<uint32_t>(-1),
                      static_cast<uint32_t>(-1)};  // 10 ms queued ahead
  int error = 0;
  pa_simple* sound =
      pa_simple_new(nullptr, "flashbeep", PA_STREAM_PLAYBACK, nullptr, "beep", &stereoFloat, nullptr, &attr, &error);
  if (!sound) return 2;
  std::vector<float> silence(480 * 2, 0.0f), beep(9600 * 2);
  for (size_t i = 0; i < beep.size() / 2; ++i)
    beep[2 * i] = beep[2 * i + 1] = 0.5f * std::sin(2 * M_PI * 1000 * i / 48000.0);
  std::puts("ready");
  std::fflush(stdout);
  const auto go = std::chrono::steady_clock::now() + std::chrono::milliseconds(delay);
  while (std::chrono::steady_clock::now() + std::chrono::milliseconds(10) < go)
    pa_simple_write(sound, silence.data(), silence.size() * sizeof(float), &error);  // keeps the stream running
  std::this_thread::sleep_until(go);
  paint(c, screen->root, 0xFFFFFF);
  pa_simple_write(sound, beep.data(), beep.size() * sizeof(float), &error);
  std::puts("flash");
  std::fflush(stdout);
  pa_simple_drain(sound, &error);
  pa_simple_free(sound);
  std::this_thread::sleep_for(std::chrono::seconds(30));  // the root stays white until killed
  xcb_disconnect(c);
  return 0;
}
