// Plays silence into a PulseAudio sink with a small buffer, then short tones between silences, and
// says when each tone starts, so a capture's latency can be measured from a known moment.
//   tonestart SINK [TONES=5] [SILENCE_MS=400] [TONE_MS=200]
// Prints "ready" once the stream plays, then per tone one line
//   tone <written> <played>
// in CLOCK_MONOTONIC nanoseconds: when the first tone bytes went to the server, and when the sink
// plays them (that moment plus the stream's latency, read from fresh timing information just
// before the write). Ends after the last silence. Build: g++ -O2 tonestart.cc -lpulse
#include <pulse/pulseaudio.h>

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <vector>

namespace {

constexpr uint32_t kRate = 48000;
constexpr uint32_t kChannels = 2;
constexpr size_t kFrameBytes = kChannels * sizeof(int16_t);

int64_t monotonicNs() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<int64_t>(now.tv_sec) * 1000000000 + now.tv_nsec;
}

void signalLoop(pa_context*, void* loop) { pa_threaded_mainloop_signal(static_cast<pa_threaded_mainloop*>(loop), 0); }
void signalStream(pa_stream*, void* loop) { pa_threaded_mainloop_signal(static_cast<pa_threaded_mainloop*>(loop), 0); }
void signalRequest(pa_stream*, size_t, void* loop) {
  pa_threaded_mainloop_signal(static_cast<pa_threaded_mainloop*>(loop), 0);
}
void signalDone(pa_stream*, int, void* loop) {
  pa_threaded_mainloop_signal(static_cast<pa_threaded_mainloop*>(loop), 0);
}

[[noreturn]] void fail(const char* what) {
  std::fprintf(stderr, "tonestart: %s\n", what);
  std::exit(1);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) fail("usage: tonestart SINK [TONES] [SILENCE_MS] [TONE_MS]");
  const char* sink = argv[1];
  const int tones = argc > 2 ? std::atoi(argv[2]) : 5;
  const uint64_t silenceFrames = (argc > 3 ? std::atoi(argv[3]) : 400) * kRate / 1000;
  const uint64_t toneFrames = (argc > 4 ? std::atoi(argv[4]) : 200) * kRate / 1000;

  pa_threaded_mainloop* loop = pa_threaded_mainloop_new();
  pa_context* context = pa_context_new(pa_threaded_mainloop_get_api(loop), "tonestart");
  pa_context_set_state_callback(context, signalLoop, loop);
  if (pa_context_connect(context, nullptr, PA_CONTEXT_NOAUTOSPAWN, nullptr) < 0) fail("no server");
  pa_threaded_mainloop_lock(loop);
  if (pa_threaded_mainloop_start(loop) < 0) fail("no main loop");
  while (pa_context_get_state(context) != PA_CONTEXT_READY) {
    if (!PA_CONTEXT_IS_GOOD(pa_context_get_state(context))) fail("connection failed");
    pa_threaded_mainloop_wait(loop);
  }

  const pa_sample_spec sampleSpec{PA_SAMPLE_S16LE, kRate, kChannels};
  pa_stream* stream = pa_stream_new(context, "tonestart", &sampleSpec, nullptr);
  pa_stream_set_state_callback(stream, signalStream, loop);
  pa_stream_set_write_callback(stream, signalRequest, loop);
  // 5 ms queued ahead of the sink: the tone follows little silence that is already on its way.
  pa_buffer_attr attr;
  attr.maxlength = static_cast<uint32_t>(-1);
  attr.tlength = static_cast<uint32_t>(pa_usec_to_bytes(5000, &sampleSpec));
  attr.prebuf = static_cast<uint32_t>(-1);
  attr.minreq = static_cast<uint32_t>(-1);
  attr.fragsize = static_cast<uint32_t>(-1);
  const auto flags = static_cast<pa_stream_flags_t>(PA_STREAM_ADJUST_LATENCY | PA_STREAM_INTERPOLATE_TIMING |
                                                    PA_STREAM_AUTO_TIMING_UPDATE);
  if (pa_stream_connect_playback(stream, sink, &attr, flags, nullptr, nullptr) < 0) fail("cannot connect");
  while (pa_stream_get_state(stream) != PA_STREAM_READY) {
    if (!PA_STREAM_IS_GOOD(pa_stream_get_state(stream))) fail("stream failed");
    pa_threaded_mainloop_wait(loop);
  }

  // The tone starts at its crest so that its very first sample is loud.
  std::vector<int16_t> tone(toneFrames * kChannels);
  for (uint64_t i = 0; i < toneFrames; ++i)
    tone[2 * i] = tone[2 * i + 1] = static_cast<int16_t>(16383 * std::cos(2 * M_PI * 440.0 * i / kRate));
  const std::vector<int16_t> quiet(silenceFrames * kChannels, 0);

  bool announced = false;
  for (int t = 0; t <= tones; ++t) {
    // Each round: silence, then (except after the last silence) a tone.
    for (int part = 0; part < (t < tones ? 2 : 1); ++part) {
      const bool loud = part == 1;
      const auto* bytes = reinterpret_cast<const uint8_t*>(loud ? tone.data() : quiet.data());
      const size_t total = (loud ? toneFrames : silenceFrames) * kFrameBytes;
      size_t done = 0;
      while (done < total) {
        size_t writable = pa_stream_writable_size(stream);
        if (writable == static_cast<size_t>(-1)) fail("stream lost");
        if (writable == 0) {
          pa_threaded_mainloop_wait(loop);
          continue;
        }
        writable -= writable % kFrameBytes;
        const size_t chunk = std::min(writable, total - done);
        if (loud && done == 0) {
          // Fresh timing first, so the latency is what the server says now and not an old guess.
          pa_operation* update = pa_stream_update_timing_info(stream, signalDone, loop);
          while (update && pa_operation_get_state(update) == PA_OPERATION_RUNNING) pa_threaded_mainloop_wait(loop);
          if (update) pa_operation_unref(update);
          pa_usec_t latency = 0;
          int negative = 0;
          if (pa_stream_get_latency(stream, &latency, &negative) < 0) fail("no latency");
          const int64_t written = monotonicNs();
          if (pa_stream_write(stream, bytes, chunk, nullptr, 0, PA_SEEK_RELATIVE) < 0) fail("write failed");
          const int64_t played = written + (negative ? -1 : 1) * static_cast<int64_t>(latency) * 1000;
          std::printf("tone %lld %lld\n", static_cast<long long>(written), static_cast<long long>(played));
          std::fflush(stdout);
        } else if (pa_stream_write(stream, bytes + done, chunk, nullptr, 0, PA_SEEK_RELATIVE) < 0) {
          fail("write failed");
        }
        done += chunk;
        if (!announced) {
          std::printf("ready\n");
          std::fflush(stdout);
          announced = true;
        }
      }
    }
  }
  pa_operation* drained = pa_stream_drain(stream, signalDone, loop);
  while (drained && pa_operation_get_state(drained) == PA_OPERATION_RUNNING) pa_threaded_mainloop_wait(loop);
  if (drained) pa_operation_unref(drained);
  pa_stream_disconnect(stream);
  pa_stream_unref(stream);
  pa_context_disconnect(context);
  pa_threaded_mainloop_unlock(loop);
  pa_threaded_mainloop_stop(loop);
  pa_context_unref(context);
  pa_threaded_mainloop_free(loop);
  return 0;
}
