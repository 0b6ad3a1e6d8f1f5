#include "capture/audio/wasapi/source.h"

#include <algorithm>
#include <chrono>
#include <cstring>
#include <exception>
#include <iostream>
#include <stdexcept>
#include <thread>
#include <vector>

#include "capture/audio/formats.h"
#include "capture/audio/mfencoder.h"
#include "capture/audio/peaks.h"
#include "capture/check.h"
#include "capture/log.h"
#include "capture/text.h"
#include "capture/threadname.h"
#include "platform/kernel32.h"

namespace capture::audio::wasapi {

namespace {

constexpr const char* kFile = "native/capture/audio/wasapi/source";
constexpr REFERENCE_TIME kBufferDuration = 1000000;  // 100 ms

void pause() { std::this_thread::sleep_for(std::chrono::microseconds(5000)); }

// The endpoint's mix format as a 40-byte block of our own, whatever cbSize says.
WAVEFORMATEXTENSIBLE* readMixFormat(IAudioClient* client) {
  WAVEFORMATEX* mix = nullptr;
  capture::checkResult(kFile, 390, client->GetMixFormat(&mix), "Could not get mix format from audio client.");
  auto* copy = new WAVEFORMATEXTENSIBLE;
  std::memcpy(copy, mix, sizeof(WAVEFORMATEXTENSIBLE));
  CoTaskMemFree(mix);
  return copy;
}

// A failure becomes a warning line.
template <class Body>
void guarded(Body body) {
  try {
    body();
  } catch (const std::exception& e) {
    capture::logWarning(*e.what() ? e.what() : nullptr);
  } catch (...) {
    capture::logWarning(nullptr);
  }
}

constexpr auto kRetryPause = std::chrono::milliseconds(500);

// The outermost frame of both threads: runs `body` until it returns, trying again after a
// pause whenever it fails while `wanted()` holds, so an endpoint whose sound server or device
// went away works again once it is back. The first failure of a row is printed; the same one
// again is not. `afterFailure()` runs after every failed try, before the pause.
template <class Body, class Wanted, class AfterFailure>
void keepTrying(Body body, Wanted wanted, AfterFailure afterFailure) {
  std::string lastFailure;
  while (wanted()) {
    std::string failure;
    try {
      body();
    } catch (const std::exception& e) {
      failure = *e.what() ? e.what() : "unknown exception";
    } catch (...) {
      failure = "unknown exception";
    }
    if (failure.empty()) return;
    // Checked failures begin with their time; the rest tells whether it is the same again.
    const size_t tab = failure.find('\t');
    const std::string what = tab == std::string::npos ? failure : failure.substr(tab);
    if (what != lastFailure) capture::logWarning(failure.c_str());
    lastFailure = what;
    afterFailure();
    std::this_thread::sleep_for(kRetryPause);
  }
}

Encoder* makeMFEncoder(const std::string& path, const WAVEFORMATEXTENSIBLE* format) {
  return new MFEncoder(path, format);
}

constexpr uint64_t kUnitsPerSecond = 10000000;
// A stopped clip whose stop no packet reaches within this time (the endpoint stalled or went
// away) is finished with what it has.
constexpr uint64_t kStopWait = 5000000;
// A clip's first packet this long after its start (the endpoint was away) is preceded by silence.
constexpr uint64_t kLateFirstPacket = 400000;

// The performance counter in 100 ns units: the clock of the packets' positions.
uint64_t counterNow() {
  LARGE_INTEGER count{}, frequency{};
  QueryPerformanceCounter(&count);
  QueryPerformanceFrequency(&frequency);
  const uint64_t ticks = static_cast<uint64_t>(count.QuadPart), rate = static_cast<uint64_t>(frequency.QuadPart);
  return rate == kUnitsPerSecond ? ticks : ticks / rate * kUnitsPerSecond + ticks % rate * kUnitsPerSecond / rate;
}

}  // namespace

struct Source::Clip {
  std::shared_ptr<void> unfinished;  // let go last, after the encoder has closed the file
  std::unique_ptr<Encoder> encoder;
  const WAVEFORMATEXTENSIBLE* format = nullptr;  // the capture format the encoder takes
  uint64_t start = 0;                            // capture clock, 100 ns
  std::atomic<uint64_t> stop{0};                 // 0 while recording
  uint64_t reached = 0;  // where the sound written so far ends (its start before any); the capture thread only
  bool written() const { return reached > start; }
};

// The silence thread's share of the source: it never ends, so it must not depend on the source.
struct Source::Silence {
  ComPtr<IMMDevice> endpoint;
  ComPtr<IAudioClient> silenceClient;
  ComPtr<IAudioRenderClient> renderClient;

  void run() {
    // A try after a failure starts with clients of its own.
    renderClient.Reset();
    silenceClient.Reset();
    capture::checkResult(kFile, 173,
                         endpoint->Activate(IID_IAudioClient, CLSCTX_ALL, nullptr,
                                            reinterpret_cast<void**>(silenceClient.GetAddressOf())),
                         "Could not create audio client.");
    WAVEFORMATEXTENSIBLE* mix = readMixFormat(silenceClient.Get());
    HRESULT hr = silenceClient->Initialize(AUDCLNT_SHAREMODE_SHARED, 0, kBufferDuration, 0, &mix->Format, nullptr);
    delete mix;
    capture::checkResult(kFile, 178, hr, "Could not initialize the audio client.");
    UINT32 bufferFrames = 0;
    capture::checkResult(kFile, 183, silenceClient->GetBufferSize(&bufferFrames), "Could not get the buffer size.");
    capture::checkResult(
        kFile, 186,
        silenceClient->GetService(IID_IAudioRenderClient, reinterpret_cast<void**>(renderClient.GetAddressOf())),
        "Could not get the audio capture client service from the audio client.");
    capture::checkResult(kFile, 189, silenceClient->Start(), "Could not start the audio client.");
    for (;;) {
      UINT32 padding = 0;
      capture::checkResult(kFile, 194, silenceClient->GetCurrentPadding(&padding),
                           "Could not get current padding size.");
      if (padding < bufferFrames) {
        const UINT32 frames = bufferFrames - padding;
        BYTE* data = nullptr;
        capture::checkResult(kFile, 205, renderClient->GetBuffer(frames, &data), "Unable to get silence buffer.");
        capture::checkResult(kFile, 206, renderClient->ReleaseBuffer(frames, AUDCLNT_BUFFERFLAGS_SILENT),
                             "Unable to release silence buffer.");
      } else {
        pause();
      }
    }
  }
};

Source::Source(IMMDevice* endpoint, bool isSelected) : Source(endpoint, isSelected, makeMFEncoder) {}

Source::Source(IMMDevice* endpoint, bool isSelected, EncoderFactory makeEncoder)
    : endpoint(endpoint), makeEncoder(std::move(makeEncoder)), isSelected(isSelected) {
  silence = std::make_shared<Silence>();
  silence->endpoint = endpoint;
  std::thread([state = silence] {
    capture::nameThread("tavio-silence");
    keepTrying([&] { state->run(); }, [] { return true; }, [] {});
  }).detach();
}

Source::~Source() {
  if (IAudioClient* client = audioClient.load()) client->Release();
  if (IAudioCaptureClient* client = captureClient.load()) client->Release();
  delete format.load();
}

int32_t Source::type() { return capture::AudioEndpoint; }

std::string Source::name() {
  ComPtr<IPropertyStore> store;
  capture::checkResult(kFile, 404, endpoint->OpenPropertyStore(STGM_READ, store.GetAddressOf()),
                       "Could not open property store");
  PROPVARIANT value;
  PropVariantInit(&value);
  capture::checkResult(kFile, 416, store->GetValue(PKEY_Device_FriendlyName, &value),
                       "Could not get key from property store.");
  std::string text = value.vt == VT_LPWSTR && value.pwszVal ? capture::toUtf8(value.pwszVal) : std::string();
  PropVariantClear(&value);
  return text;
}

void Source::startPreview() { previewing.exchange(true); }
void Source::stopPreview() { previewing.exchange(false); }
bool Source::selected() { return isSelected; }
void Source::stopCapturing() { capturing.exchange(false); }
void Source::stopEncode() {
  if (latest) latest->stop.store(counterNow());
  latest.reset();
}

void Source::finishClips(std::chrono::steady_clock::time_point deadline) {
  stopEncode();
  unfinished.waitUntil(deadline);
}

void Source::capture() {
  if (capturing.exchange(true)) return;
  std::thread([self = shared_from_this()] {
    capture::nameThread("tavio-capture");
    IAudioClient* client = nullptr;
    IAudioCaptureClient* packets = nullptr;
    keepTrying([&] { self->runCapture(client, packets); }, [&] { return self->capturing.load(); },
               [&] { self->endFailedTry(client, packets); });
    // Capture stopped: every clip ends now, also one still waiting for an endpoint that is away.
    self->finishAll(false);
  }).detach();
}

// What was recorded up to a failure is kept: the clips end there. The meter falls silent while
// the endpoint is away. The failed try's clients go before the next (unless a newer capture
// thread has put its own in their place), so a device that stays away costs no memory.
void Source::endFailedTry(IAudioClient*& client, IAudioCaptureClient*& packets) {
  finishAll(true);
  {
    std::lock_guard<std::mutex> hold(peakLock);
    std::fill(peaks.begin(), peaks.end(), 0.0);
  }
  IAudioCaptureClient* ownPackets = packets;
  if (packets && captureClient.compare_exchange_strong(ownPackets, nullptr)) packets->Release();
  IAudioClient* ownClient = client;
  if (client && audioClient.compare_exchange_strong(ownClient, nullptr)) client->Release();
  client = nullptr;
  packets = nullptr;
}

void Source::startEncode(std::string filename) {
  // Right after initialize the capture thread may not have read the format yet; it does within
  // milliseconds unless the endpoint cannot be opened.
  for (int i = 0; i < 400 && !format.load() && capturing.load(); ++i) pause();
  if (!format.load())
    capture::checkResult(kFile, 150, AUDCLNT_E_NOT_INITIALIZED, "Audio capture has not started on this endpoint.");
  auto clip = std::make_shared<Clip>();
  clip->unfinished = unfinished.hold();
  clip->format = format.load();
  clip->encoder.reset(makeEncoder(filename, clip->format));
  clip->start = clip->reached = counterNow();
  // A clip still recording ends where the new one begins.
  if (latest) latest->stop.store(clip->start);
  latest = clip;
  {
    std::lock_guard<std::mutex> hold(clipsLock);
    started.push_back(clip);
  }
}

void Source::record(const BYTE* data, UINT32 frames, uint64_t begin, const WAVEFORMATEXTENSIBLE* captureFormat) {
  takeStarted();
  const uint64_t rate = captureFormat->Format.nSamplesPerSec;
  const uint32_t blockAlign = captureFormat->Format.nBlockAlign;
  const uint64_t end = begin + frames * kUnitsPerSecond / rate;
  auto frameAt = [&](uint64_t time) {
    if (time >= end) return frames;
    return static_cast<UINT32>(
        std::min<uint64_t>(frames, ((time - begin) * rate + kUnitsPerSecond / 2) / kUnitsPerSecond));
  };
  for (auto it = writing.begin(); it != writing.end();) {
    Clip& clip = **it;
    const uint64_t stop = clip.stop.load();
    const uint64_t from = std::max(begin, clip.start);
    const uint64_t to = stop ? std::min(end, stop) : end;
    if (to > from) {
      const UINT32 first = frameAt(from), last = frameAt(to);
      if (last > first) {
        // A clip that began while its endpoint was away starts with silence up to its first packet.
        if (!clip.written() && from > clip.start + kLateFirstPacket) writeSilence(clip, clip.start, from);
        clip.encoder->write(data + static_cast<size_t>(first) * blockAlign, last - first, &captureFormat->Format,
                            static_cast<int64_t>(from - clip.start));
        clip.reached = to;
      }
    }
    if (stop && end >= stop) {
      finish(clip, stop);
      it = writing.erase(it);
    } else {
      ++it;
    }
  }
}

void Source::takeStarted() {
  std::lock_guard<std::mutex> hold(clipsLock);
  while (!started.empty()) {
    writing.push_back(std::move(started.front()));
    started.pop_front();
  }
}

// Also a clip that no packet has reached at all: an endpoint that plays nothing may deliver none.
void Source::finishOverdue(uint64_t now) {
  takeStarted();
  for (auto it = writing.begin(); it != writing.end();) {
    const uint64_t stop = (*it)->stop.load();
    if (stop && now > stop + kStopWait) {
      finish(**it, stop);
      it = writing.erase(it);
    } else {
      ++it;
    }
  }
}

// Finalises the clips this endpoint holds, as far as each got; a failure to finish one is
// printed and does not keep the others from finishing. After a failed try, a clip that nothing
// has reached yet and that is still recording waits for the endpoint to come back.
void Source::finishAll(bool failed) {
  takeStarted();
  const uint64_t now = counterNow();
  for (auto it = writing.begin(); it != writing.end();) {
    Clip& clip = **it;
    const uint64_t stop = clip.stop.load();
    if (failed && !clip.written() && !stop) {
      ++it;
      continue;
    }
    // A clip still recording ends where its sound does, or now if none reached it.
    uint64_t end = stop;
    if (!end) end = clip.written() ? clip.reached : now;
    guarded([&] { finish(clip, end); });
    it = writing.erase(it);
  }
}

// Time the endpoint never delivered (it stalled, or was away all along) is silence up to the end,
// so that the file lasts as long as the clip all the same.
void Source::finish(Clip& clip, uint64_t end) {
  writeSilence(clip, clip.reached, end);
  clip.encoder->finalize();
}

// Silence over [from, until) on the capture clock, a tenth of a second at a time.
void Source::writeSilence(Clip& clip, uint64_t from, uint64_t until) {
  const WAVEFORMATEX& f = clip.format->Format;
  const bool unsigned8 = f.wBitsPerSample == 8 && clip.format->SubFormat == KSDATAFORMAT_SUBTYPE_PCM;
  const uint32_t chunk = std::max<uint32_t>(f.nSamplesPerSec / 10, 1);
  const std::vector<BYTE> zeros(static_cast<size_t>(chunk) * f.nBlockAlign, unsigned8 ? 0x80 : 0);
  const uint64_t frames = until > from ? (until - from) * f.nSamplesPerSec / kUnitsPerSecond : 0;
  for (uint64_t done = 0; done < frames; done += chunk)
    clip.encoder->write(zeros.data(), static_cast<uint32_t>(std::min<uint64_t>(chunk, frames - done)), &f,
                        static_cast<int64_t>(from - clip.start + done * kUnitsPerSecond / f.nSamplesPerSec));
}

uint16_t Source::channels() {
  WAVEFORMATEXTENSIBLE* current = format.load();
  return current ? current->Format.nChannels : 0;
}

double Source::peak(int32_t channel) {
  std::lock_guard<std::mutex> hold(peakLock);
  return capture::at(peaks, static_cast<size_t>(static_cast<uint32_t>(channel)));
}

void Source::runCapture(IAudioClient*& client, IAudioCaptureClient*& packets) {
  capture::checkResult(kFile, 212,
                       endpoint->Activate(IID_IAudioClient, CLSCTX_ALL, nullptr, reinterpret_cast<void**>(&client)),
                       "Could not create audio client.");
  audioClient.exchange(client);

  // The format is completed before it is published: other threads read it without a lock. A block
  // from an earlier capture stays allocated, since an encoder may still hold it.
  WAVEFORMATEXTENSIBLE* captureFormat = readMixFormat(client);
  WAVEFORMATEX* closest = nullptr;
  if (client->IsFormatSupported(AUDCLNT_SHAREMODE_SHARED, &captureFormat->Format, &closest) == S_FALSE) {
    captureFormat->Format.wFormatTag = closest->wFormatTag;
    captureFormat->Format.nChannels = closest->nChannels;
    captureFormat->Format.nSamplesPerSec = closest->nSamplesPerSec;
    captureFormat->Format.nAvgBytesPerSec = closest->nAvgBytesPerSec;
    captureFormat->Format.nBlockAlign = closest->nBlockAlign;
    captureFormat->Format.wBitsPerSample = closest->wBitsPerSample;
    describeWaveFormat(closest);
  }
  if (closest) CoTaskMemFree(closest);
  // A try after a failure usually reads the same format again: the block already out is kept.
  WAVEFORMATEXTENSIBLE* current = format.load();
  if (current && std::memcmp(current, captureFormat, sizeof(WAVEFORMATEXTENSIBLE)) == 0) {
    delete captureFormat;
    captureFormat = current;
  } else {
    format.exchange(captureFormat);
  }
  {
    std::lock_guard<std::mutex> hold(peakLock);
    peaks.resize(captureFormat->Format.nChannels, 0.0);
  }

  capture::checkResult(kFile, 240,
                       client->Initialize(AUDCLNT_SHAREMODE_SHARED, AUDCLNT_STREAMFLAGS_LOOPBACK, kBufferDuration, 0,
                                          &captureFormat->Format, nullptr),
                       "Could not initialize the audio client.");
  capture::checkResult(kFile, 243, client->GetService(IID_IAudioCaptureClient, reinterpret_cast<void**>(&packets)),
                       "Could not get the audio capture client service from the audio client.");
  captureClient.exchange(packets);
  capture::checkResult(kFile, 246, client->Start(), "Could not start the audio client.");

  while (capturing.load()) {
    BYTE* data = nullptr;
    UINT32 frames = 0;
    DWORD flags = 0;
    UINT64 devicePosition = 0;
    UINT64 qpcPosition = 0;
    HRESULT hr = packets->GetBuffer(&data, &frames, &flags, &devicePosition, &qpcPosition);
    if (hr == AUDCLNT_E_OUT_OF_ORDER) {
      capture::checkResult(kFile, 259, packets->ReleaseBuffer(0),
                           "Could not release the audio capture client's buffer.");
      continue;
    }
    if (hr == AUDCLNT_E_DEVICE_INVALIDATED)
      capture::checkResult(kFile, 262, hr, "Audio device is no longer valid for capture.");
    if (hr == AUDCLNT_E_BUFFER_OPERATION_PENDING)
      capture::checkResult(kFile, 264, hr, "Audio buffer operation is pending.");
    if (hr == AUDCLNT_E_SERVICE_NOT_RUNNING)
      capture::checkResult(kFile, 266, hr, "Audio client service is not running.");
    if (frames == 0 && hr == AUDCLNT_S_BUFFER_EMPTY) {
      capture::checkResult(kFile, 271, packets->ReleaseBuffer(0),
                           "Could not release the audio capture client's buffer.");
      finishOverdue(counterNow());
      pause();
      continue;
    }

    // Silence is handed on as a block of zeros of the packet's size: it is recorded as it is.
    std::unique_ptr<BYTE[]> silent;
    if (flags & AUDCLNT_BUFFERFLAGS_SILENT) {
      silent = std::make_unique<BYTE[]>(static_cast<size_t>(captureFormat->Format.nBlockAlign) * frames);
      data = silent.get();
    }
    if (flags & (AUDCLNT_BUFFERFLAGS_DATA_DISCONTINUITY | AUDCLNT_BUFFERFLAGS_TIMESTAMP_ERROR))
      std::cout << "Dev Pos: " << devicePosition << "\tClock Pos: " << qpcPosition << std::endl;

    // Each clip takes the frames from its start to its stop, timed from its start.
    record(data, frames, qpcPosition, captureFormat);
    finishOverdue(counterNow());
    if (previewing.load()) computePeaks(data, frames, captureFormat, peaks, peakLock);
    silent.reset();
    capture::checkResult(kFile, 309, packets->ReleaseBuffer(frames),
                         "Could not release the audio capture client's buffer.");
  }
}

}  // namespace capture::audio::wasapi
