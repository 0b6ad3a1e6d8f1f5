#include "platform/linux/pulse/audioclient.h"

#include <algorithm>
#include <atomic>
#include <cstring>
#include <ctime>
#include <vector>

#include "platform/linux/pulse/pulseformat.h"

namespace platform::wasapi {

namespace {

using pulse::Connection;
using pulse::Lock;

constexpr int64_t kUnitsPerSecond = 10000000;
// Small record fragments keep loopback packets within milliseconds of what the sink plays; an idle
// null sink otherwise holds its monitor data back for up to two seconds. Each fragment costs the
// main loop two wake-ups (the data, and the release of its shared memory): 20 ms fragments need a
// third fewer than 10 ms ones and still show a tone within about 10 ms. The playback target only
// sets how much silence waits in the server: 100 ms needs far fewer refills (each one a server
// request and a write the main loop must send) than 20 ms.
constexpr int64_t kPlaybackTarget = 1000000;  // 100 ms queued ahead of the sink
constexpr int64_t kRecordFragment = 200000;   // 20 ms fragments from the monitor
constexpr int64_t kShortestBuffer = 100000;
// Packet times follow the sample count; when they drift this far from the clock, samples were lost
// (or the sink stalled) and the next packet starts a new time line with a discontinuity.
constexpr int64_t kDriftLimit = 2000000;
// A sink that nothing asked for low latency renders in blocks of up to two seconds, ahead of the
// clock; a monitor stream that connects then gets nothing until the sink's clock has caught up
// with what it rendered before. Loopback on Windows delivers packets all along while the
// silence stream plays, so time that passes this long without data is handed out as silence.
constexpr int64_t kStallLimit = 2000000;
// A capture thread that was held up itself (a stopped or starved process) finds the sound the sink
// played meanwhile still queued, in the server and here, and it comes over in pieces, so the queue
// here does not tell its age: for a second after such a pause packets follow the sample count, and
// a stall counts from the first empty poll after it.
constexpr int64_t kHeldUp = 2500000;    // a pause between two polls, which normally come every 5 ms
constexpr int64_t kCatchUp = 10000000;  // a second of following the sample count

// Everything the audio client and its services share; it outlives whichever of them goes last.
struct Stream {
  std::shared_ptr<Connection> connection;
  pa_stream* stream = nullptr;
  // Kept by the state callback, so the checks on every poll cost no libpulse call.
  std::atomic<pa_stream_state_t> state{PA_STREAM_UNCONNECTED};
  bool loopback = false;
  pa_sample_spec sampleSpec{};
  uint32_t frameBytes = 0;
  uint32_t bufferFrames = 0;
  bool started = false;
  // The packet GetBuffer handed out, in `bytes`: capture packets are copies, so that no block of
  // the server's memory is held past the loop lock (libpulse, freeing a dead server's memory,
  // waits for such a block with the lock held, and its release would wait for the lock). A
  // packet released unread (`kept`) comes again with the next GetBuffer.
  bool holding = false;
  bool kept = false;
  uint32_t heldFrames = 0;
  DWORD heldFlags = 0;
  UINT64 heldTime = 0;
  std::vector<uint8_t> bytes;
  // What libpulse would report, kept under the loop lock: the record queue's length, set by the
  // read callback and read again after each of our drops; the bytes the server asked for, set by
  // the write callback and lowered by our writes.
  size_t readable = 0;
  size_t writable = 0;
  // Capture timing: frames released so far, and the time line they lie on.
  UINT64 position = 0;
  bool anchored = false;
  UINT64 anchorTime = 0;
  UINT64 anchorPosition = 0;
  bool synthesized = false;   // the held packet is silence made here, not the server's
  bool filled = false;        // the last packet released was such silence
  UINT64 emptySince = 0;      // the first of the polls in a row that found no data; 0 after data
  UINT64 lastPoll = 0;        // when GetBuffer last ran
  UINT64 countOnlyUntil = 0;  // the end of a catch-up after the capture thread was held up

  // The capture time of the frame at `frames` on the current time line.
  UINT64 timeOf(UINT64 frames) const {
    return anchorTime + (frames - anchorPosition) * kUnitsPerSecond / sampleSpec.rate;
  }

  ~Stream() {
    if (!stream) return;
    Lock lock(*connection);
    clearCallbacks(stream);
    pa_stream_disconnect(stream);
    pa_stream_unref(stream);
  }

  static void clearCallbacks(pa_stream* stream) {
    pa_stream_set_state_callback(stream, nullptr, nullptr);
    pa_stream_set_read_callback(stream, nullptr, nullptr);
    pa_stream_set_write_callback(stream, nullptr, nullptr);
  }

  // The sink or the server went away.
  bool invalid() const { return !connection->ready() || !PA_STREAM_IS_GOOD(state.load(std::memory_order_acquire)); }

  uint32_t bytesOf(int64_t units) const {
    return static_cast<uint32_t>(units * sampleSpec.rate / kUnitsPerSecond) * frameBytes;
  }
};

// These run on the main loop's thread, which holds the loop lock.
void streamStateChanged(pa_stream* stream, void* data) {
  auto* s = static_cast<Stream*>(data);
  s->state.store(pa_stream_get_state(stream), std::memory_order_release);
  pa_threaded_mainloop_signal(s->connection->loop(), 0);
}
void streamReadable(pa_stream*, size_t bytes, void* data) { static_cast<Stream*>(data)->readable = bytes; }
void streamWritable(pa_stream*, size_t bytes, void* data) { static_cast<Stream*>(data)->writable = bytes; }

class CaptureClient : public ComObject<IAudioCaptureClient, IID_IAudioCaptureClient> {
 public:
  explicit CaptureClient(std::shared_ptr<Stream> stream) : s_(std::move(stream)) {}

  HRESULT GetBuffer(BYTE** data, UINT32* frames, DWORD* flags, UINT64* devicePosition, UINT64* qpcPosition) override {
    if (!data || !frames || !flags) return E_POINTER;
    *data = nullptr;
    *frames = 0;
    *flags = 0;
    Lock lock(*s_->connection);
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    if (s_->holding) return AUDCLNT_E_OUT_OF_ORDER;
    if (devicePosition) *devicePosition = s_->position;
    if (!s_->kept) {
      const HRESULT taken = takePacket(qpcPosition);
      if (taken != S_OK) return taken;
    }
    s_->kept = false;
    s_->holding = true;
    *data = s_->bytes.data();
    *frames = s_->heldFrames;
    *flags = s_->heldFlags;
    if (qpcPosition) *qpcPosition = s_->heldTime;
    return S_OK;
  }

  HRESULT ReleaseBuffer(UINT32 framesRead) override {
    Lock lock(*s_->connection);
    // Releasing nothing keeps the packet for the next GetBuffer.
    if (framesRead == 0) {
      s_->kept = s_->kept || s_->holding;
      s_->holding = false;
      return S_OK;
    }
    if (!s_->holding) return AUDCLNT_E_OUT_OF_ORDER;
    if (framesRead != s_->heldFrames) return AUDCLNT_E_INVALID_SIZE;
    s_->holding = false;
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    s_->filled = s_->synthesized;
    s_->position += framesRead;
    return S_OK;
  }

 private:
  // Takes the next packet into `bytes` and times it. When there is none yet (AUDCLNT_S_BUFFER_EMPTY)
  // `qpcPosition` gets the time of the poll.
  HRESULT takePacket(UINT64* qpcPosition) {
    const void* bytes = nullptr;
    size_t size = 0;
    // Most polls find the queue empty; those need not ask libpulse.
    if (s_->readable > 0 && pa_stream_peek(s_->stream, &bytes, &size) < 0) return AUDCLNT_E_DEVICE_INVALIDATED;
    const UINT64 now = performanceCounterPosition();
    if (s_->lastPoll && now - s_->lastPoll > kHeldUp) {
      s_->countOnlyUntil = now + kCatchUp;
      s_->emptySince = 0;  // the polls before the pause saw nothing of it
    }
    s_->lastPoll = now;
    if (size == 0) return fillStall(now, qpcPosition);
    s_->emptySince = 0;
    s_->synthesized = false;
    s_->heldFrames = static_cast<uint32_t>(size / s_->frameBytes);
    s_->heldFlags = 0;
    if (bytes) {
      s_->bytes.assign(static_cast<const uint8_t*>(bytes), static_cast<const uint8_t*>(bytes) + size);
    } else {
      // A hole in the stream: the sink played nothing there.
      s_->heldFlags |= AUDCLNT_BUFFERFLAGS_SILENT;
      s_->bytes.assign(size, 0);
    }
    // The first frame of this packet arrived as long ago as everything queued, itself included,
    // lasts.
    const size_t queued = pa_stream_readable_size(s_->stream);
    pa_stream_drop(s_->stream);
    s_->readable = pa_stream_readable_size(s_->stream);
    const int64_t queuedUnits = static_cast<int64_t>(queued / s_->frameBytes) * kUnitsPerSecond / s_->sampleSpec.rate;
    const UINT64 measured = now - static_cast<UINT64>(std::max<int64_t>(queuedUnits, 0));
    UINT64 time = s_->timeOf(s_->position);
    if (s_->filled) {
      // The sink delivers again after a stretch handed out as silence: its data goes on from its
      // own time, never before the end of that silence.
      s_->filled = false;
      s_->anchorTime = time = std::max(measured, time);
      s_->anchorPosition = s_->position;
    }
    const int64_t drift = static_cast<int64_t>(measured - time);
    if (!s_->anchored || (now >= s_->countOnlyUntil && (drift > kDriftLimit || drift < -kDriftLimit))) {
      if (s_->anchored) s_->heldFlags |= AUDCLNT_BUFFERFLAGS_DATA_DISCONTINUITY;
      s_->anchored = true;
      s_->anchorTime = time = measured;
      s_->anchorPosition = s_->position;
    }
    s_->heldTime = time;
    return S_OK;
  }

  // A sink that has delivered nothing for kStallLimit: silence up to a fragment before now, so
  // that data arriving late still follows on. AUDCLNT_S_BUFFER_EMPTY while the wait goes on.
  HRESULT fillStall(UINT64 now, UINT64* qpcPosition) {
    if (!s_->emptySince) s_->emptySince = now;
    const UINT64 covered = s_->timeOf(s_->position);
    if (!s_->started || !s_->anchored || now < std::max(covered, s_->emptySince) + kStallLimit) {
      if (qpcPosition) *qpcPosition = now;
      return AUDCLNT_S_BUFFER_EMPTY;
    }
    const UINT64 missing = (now - covered - kRecordFragment) * s_->sampleSpec.rate / kUnitsPerSecond;
    s_->heldFrames = static_cast<uint32_t>(std::min<UINT64>(missing, s_->bufferFrames));
    s_->heldFlags = AUDCLNT_BUFFERFLAGS_SILENT;
    s_->heldTime = covered;
    s_->bytes.assign(static_cast<size_t>(s_->heldFrames) * s_->frameBytes, 0);
    s_->synthesized = true;
    return S_OK;
  }

  std::shared_ptr<Stream> s_;
};

class RenderClient : public ComObject<IAudioRenderClient, IID_IAudioRenderClient> {
 public:
  explicit RenderClient(std::shared_ptr<Stream> stream) : s_(std::move(stream)) {}

  HRESULT GetBuffer(UINT32 framesRequested, BYTE** data) override {
    if (!data) return E_POINTER;
    *data = nullptr;
    Lock lock(*s_->connection);
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    if (s_->holding) return AUDCLNT_E_OUT_OF_ORDER;
    const size_t writable = s_->writable / s_->frameBytes;
    if (framesRequested > std::min<size_t>(writable, s_->bufferFrames)) return AUDCLNT_E_BUFFER_TOO_LARGE;
    if (s_->bytes.size() < static_cast<size_t>(framesRequested) * s_->frameBytes)
      s_->bytes.resize(static_cast<size_t>(framesRequested) * s_->frameBytes);
    *data = s_->bytes.data();
    s_->holding = true;
    s_->heldFrames = framesRequested;
    return S_OK;
  }

  HRESULT ReleaseBuffer(UINT32 framesWritten, DWORD flags) override {
    Lock lock(*s_->connection);
    if (!s_->holding) return framesWritten == 0 ? S_OK : AUDCLNT_E_OUT_OF_ORDER;
    if (framesWritten > s_->heldFrames) return AUDCLNT_E_INVALID_SIZE;
    s_->holding = false;
    if (framesWritten == 0) return S_OK;
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    const size_t size = static_cast<size_t>(framesWritten) * s_->frameBytes;
    if (flags & AUDCLNT_BUFFERFLAGS_SILENT) std::memset(s_->bytes.data(), 0, size);
    if (pa_stream_write(s_->stream, s_->bytes.data(), size, nullptr, 0, PA_SEEK_RELATIVE) < 0)
      return AUDCLNT_E_DEVICE_INVALIDATED;
    s_->writable -= std::min(s_->writable, size);
    return S_OK;
  }

 private:
  std::shared_ptr<Stream> s_;
};

class AudioClient : public ComObject<IAudioClient, IID_IAudioClient> {
 public:
  AudioClient(std::shared_ptr<Connection> connection, const pulse::Sink& sink) : sink_(sink) {
    s_ = std::make_shared<Stream>();
    s_->connection = std::move(connection);
  }

  HRESULT Initialize(AUDCLNT_SHAREMODE shareMode, DWORD streamFlags, REFERENCE_TIME bufferDuration, REFERENCE_TIME,
                     const WAVEFORMATEX* format, LPCGUID) override {
    if (!format) return E_POINTER;
    if (s_->stream) return AUDCLNT_E_ALREADY_INITIALIZED;
    if (shareMode != AUDCLNT_SHAREMODE_SHARED) return AUDCLNT_E_EXCLUSIVE_MODE_NOT_ALLOWED;
    // Event-driven clients are not offered: nothing here waits on events.
    if (streamFlags & AUDCLNT_STREAMFLAGS_EVENTCALLBACK) return E_NOTIMPL;
    if (streamFlags &
        ~(AUDCLNT_STREAMFLAGS_LOOPBACK | AUDCLNT_STREAMFLAGS_CROSSPROCESS | AUDCLNT_STREAMFLAGS_NOPERSIST))
      return E_INVALIDARG;
    pa_sample_spec sampleSpec;
    pa_channel_map map;
    if (!pulse::specOf(format, sampleSpec, map, &sink_.map) || sampleSpec.rate != sink_.sampleSpec.rate ||
        sampleSpec.channels != sink_.sampleSpec.channels)
      return AUDCLNT_E_UNSUPPORTED_FORMAT;

    Stream& s = *s_;
    s.loopback = (streamFlags & AUDCLNT_STREAMFLAGS_LOOPBACK) != 0;
    s.sampleSpec = sampleSpec;
    s.frameBytes = static_cast<uint32_t>(pa_frame_size(&sampleSpec));
    s.bufferFrames =
        static_cast<uint32_t>(std::max<int64_t>(bufferDuration, kShortestBuffer) * sampleSpec.rate / kUnitsPerSecond);

    Lock lock(*s.connection);
    if (pa_context_get_state(s.connection->context()) != PA_CONTEXT_READY) return AUDCLNT_E_DEVICE_INVALIDATED;
    pa_stream* stream = pa_stream_new(s.connection->context(), s.loopback ? "Loopback" : "Playback", &sampleSpec, &map);
    if (!stream) return AUDCLNT_E_UNSUPPORTED_FORMAT;
    pa_stream_set_state_callback(stream, streamStateChanged, &s);
    if (s.loopback)
      pa_stream_set_read_callback(stream, streamReadable, &s);
    else
      pa_stream_set_write_callback(stream, streamWritable, &s);
    pa_buffer_attr attr;
    attr.maxlength = static_cast<uint32_t>(-1);
    attr.prebuf = static_cast<uint32_t>(-1);
    attr.minreq = static_cast<uint32_t>(-1);
    attr.tlength = s.bytesOf(kPlaybackTarget);
    attr.fragsize = s.bytesOf(kRecordFragment);
    // A vanished sink ends the stream instead of moving it elsewhere, so capture sees it.
    const auto flags =
        static_cast<pa_stream_flags_t>(PA_STREAM_START_CORKED | PA_STREAM_ADJUST_LATENCY | PA_STREAM_DONT_MOVE);
    const int connected = s.loopback
                              ? pa_stream_connect_record(stream, sink_.monitor.c_str(), &attr, flags)
                              : pa_stream_connect_playback(stream, sink_.name.c_str(), &attr, flags, nullptr, nullptr);
    pa_stream_state_t state = connected < 0 ? PA_STREAM_FAILED : pa_stream_get_state(stream);
    while (state == PA_STREAM_CREATING || state == PA_STREAM_UNCONNECTED) {
      pa_threaded_mainloop_wait(s.connection->loop());
      state = pa_stream_get_state(stream);
    }
    if (state != PA_STREAM_READY) {
      Stream::clearCallbacks(stream);
      pa_stream_disconnect(stream);
      pa_stream_unref(stream);
      return AUDCLNT_E_DEVICE_INVALIDATED;
    }
    s.state.store(state, std::memory_order_release);
    s.stream = stream;
    return S_OK;
  }

  HRESULT GetBufferSize(UINT32* frames) override {
    if (!frames) return E_POINTER;
    if (!s_->stream) return AUDCLNT_E_NOT_INITIALIZED;
    *frames = s_->bufferFrames;
    return S_OK;
  }

  // Playback: what is queued beyond what the server asks for now. Capture: the next packet.
  HRESULT GetCurrentPadding(UINT32* frames) override {
    if (!frames) return E_POINTER;
    *frames = 0;
    if (!s_->stream) return AUDCLNT_E_NOT_INITIALIZED;
    Lock lock(*s_->connection);
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    if (s_->loopback) {
      *frames = s_->kept ? s_->heldFrames : static_cast<UINT32>(pa_stream_readable_size(s_->stream) / s_->frameBytes);
    } else {
      const size_t writable = s_->writable / s_->frameBytes;
      *frames = s_->bufferFrames - static_cast<UINT32>(std::min<size_t>(writable, s_->bufferFrames));
    }
    return S_OK;
  }

  HRESULT IsFormatSupported(AUDCLNT_SHAREMODE shareMode, const WAVEFORMATEX* format,
                            WAVEFORMATEX** closestMatch) override {
    if (closestMatch) *closestMatch = nullptr;
    if (!format || (shareMode == AUDCLNT_SHAREMODE_SHARED && !closestMatch)) return E_POINTER;
    if (shareMode != AUDCLNT_SHAREMODE_SHARED) return AUDCLNT_E_UNSUPPORTED_FORMAT;
    pa_sample_spec sampleSpec;
    pa_channel_map map;
    if (!pulse::specOf(format, sampleSpec, map, &sink_.map)) return AUDCLNT_E_UNSUPPORTED_FORMAT;
    if (sampleSpec.rate == sink_.sampleSpec.rate && sampleSpec.channels == sink_.sampleSpec.channels) return S_OK;
    *closestMatch = pulse::mixFormat(sink_.sampleSpec, sink_.map);
    return S_FALSE;
  }

  HRESULT GetMixFormat(WAVEFORMATEX** format) override {
    if (!format) return E_POINTER;
    *format = pulse::mixFormat(sink_.sampleSpec, sink_.map);
    return S_OK;
  }

  HRESULT Start() override { return cork(false); }

  HRESULT Reset() override {
    if (!s_->stream) return AUDCLNT_E_NOT_INITIALIZED;
    Lock lock(*s_->connection);
    if (s_->started) return AUDCLNT_E_NOT_STOPPED;
    if (s_->holding) return AUDCLNT_E_BUFFER_OPERATION_PENDING;
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    s_->connection->wait(pa_stream_flush(s_->stream, nullptr, nullptr));
    s_->kept = false;
    if (s_->loopback)
      s_->readable = pa_stream_readable_size(s_->stream);
    else
      s_->writable = pa_stream_writable_size(s_->stream);
    s_->position = 0;
    s_->anchored = false;
    return S_OK;
  }

  HRESULT GetService(REFIID riid, void** object) override {
    if (!object) return E_POINTER;
    *object = nullptr;
    if (!s_->stream) return AUDCLNT_E_NOT_INITIALIZED;
    if (riid == IID_IAudioCaptureClient) {
      if (!s_->loopback) return AUDCLNT_E_WRONG_ENDPOINT_TYPE;
      *object = static_cast<IAudioCaptureClient*>(new CaptureClient(s_));
      return S_OK;
    }
    if (riid == IID_IAudioRenderClient) {
      if (s_->loopback) return AUDCLNT_E_WRONG_ENDPOINT_TYPE;
      *object = static_cast<IAudioRenderClient*>(new RenderClient(s_));
      return S_OK;
    }
    return E_NOINTERFACE;
  }

 private:
  HRESULT cork(bool stop) {
    if (!s_->stream) return AUDCLNT_E_NOT_INITIALIZED;
    Lock lock(*s_->connection);
    if (s_->invalid()) return AUDCLNT_E_DEVICE_INVALIDATED;
    if (s_->started != stop) return stop ? S_FALSE : AUDCLNT_E_NOT_STOPPED;
    if (!s_->connection->wait(pa_stream_cork(s_->stream, stop ? 1 : 0, nullptr, nullptr)))
      return AUDCLNT_E_DEVICE_INVALIDATED;
    s_->started = !stop;
    // Capture time runs from the start, whether or not the sink delivers at once.
    if (!stop && s_->loopback && !s_->anchored) {
      s_->anchored = true;
      s_->anchorTime = performanceCounterPosition();
      s_->anchorPosition = s_->position;
    }
    return S_OK;
  }

  pulse::Sink sink_;
  std::shared_ptr<Stream> s_;
};

}  // namespace

UINT64 performanceCounterPosition() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<UINT64>(now.tv_sec) * kUnitsPerSecond + static_cast<UINT64>(now.tv_nsec) / 100;
}

HRESULT createAudioClient(std::shared_ptr<Connection> connection, const std::string& sink, REFIID riid, void** object) {
  pulse::Sink info;
  if (!connection->findSink(sink, info)) return AUDCLNT_E_DEVICE_INVALIDATED;
  return createInstance<AudioClient>(riid, object, std::move(connection), info);
}

}  // namespace platform::wasapi
