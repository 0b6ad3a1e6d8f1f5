// Fake audio endpoint for the capture source: an IMMDevice whose Activate hands out audio clients
// that deliver scripted loopback packets and accept silence, and an encoder that records its calls.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "capture/audio/encoder.h"
#include "fakes/com.h"
#include "platform/wasapi.h"

namespace fakes {

// One answer of IAudioCaptureClient::GetBuffer.
struct Packet {
  HRESULT result = S_OK;
  std::vector<uint8_t> bytes;
  UINT32 frames = 0;
  DWORD flags = 0;
  UINT64 devicePosition = 0;
  UINT64 qpcPosition = 0;
};

// What the endpoint's clients were asked, and the packets they still have to give.
struct AudioLog {
  std::mutex mutex;
  std::condition_variable changed;
  // Script.
  WAVEFORMATEXTENSIBLE mix{};
  HRESULT formatAnswer = S_OK;
  WAVEFORMATEXTENSIBLE closest{};
  std::deque<Packet> packets;
  UINT32 silenceBufferFrames = 4800;
  std::deque<UINT32> paddings;  // answers of the silence client's GetCurrentPadding; then full
  // Record.
  int activations = 0;
  struct Init {
    AUDCLNT_SHAREMODE mode;
    DWORD flags;
    REFERENCE_TIME duration;
    REFERENCE_TIME periodicity;
    WAVEFORMATEXTENSIBLE format;
    bool sessionGuid;
  };
  std::vector<Init> initializations;
  int starts = 0;
  std::vector<UINT32> captureReleases;
  int answered = 0;  // packets given out and, when S_OK or empty or out of order, released again
  std::vector<UINT32> silenceRequests;
  std::vector<std::pair<UINT32, DWORD>> silenceReleases;
  // The bytes of the packet handed out last, to tell a copy from the original.
  const uint8_t* handedOut = nullptr;

  void push(Packet packet) {
    std::lock_guard<std::mutex> lock(mutex);
    packets.push_back(std::move(packet));
  }
  // Waits until `count` packets have been answered; false after ten seconds (a hung loop).
  bool waitAnswered(int count) {
    std::unique_lock<std::mutex> lock(mutex);
    return changed.wait_for(lock, std::chrono::seconds(10), [&] { return answered >= count; });
  }
  template <class Predicate>
  bool waitFor(Predicate predicate) {
    std::unique_lock<std::mutex> lock(mutex);
    return changed.wait_for(lock, std::chrono::seconds(10), [&] { return predicate(); });
  }
};

class CaptureClient : public ComObject<IAudioCaptureClient, IID_IAudioCaptureClient> {
 public:
  explicit CaptureClient(std::shared_ptr<AudioLog> log) : log_(std::move(log)) {}

  HRESULT GetBuffer(BYTE** data, UINT32* frames, DWORD* flags, UINT64* devicePosition, UINT64* qpcPosition) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    if (log_->packets.empty()) {
      *data = nullptr;
      *frames = 0;
      *flags = 0;
      return AUDCLNT_S_BUFFER_EMPTY;
    }
    current_ = std::move(log_->packets.front());
    log_->packets.pop_front();
    *data = current_.bytes.empty() ? nullptr : current_.bytes.data();
    log_->handedOut = *data;
    log_->changed.notify_all();
    *frames = current_.frames;
    *flags = current_.flags;
    *devicePosition = current_.devicePosition;
    *qpcPosition = current_.qpcPosition;
    // A failure the loop does not answer with a release counts as answered here.
    if (FAILED(current_.result) && current_.result != AUDCLNT_E_OUT_OF_ORDER) {
      ++log_->answered;
      log_->changed.notify_all();
    } else {
      pending_ = true;
    }
    return current_.result;
  }
  HRESULT ReleaseBuffer(UINT32 frames) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    if (!pending_) return S_OK;  // the release after an empty buffer
    pending_ = false;
    log_->captureReleases.push_back(frames);
    ++log_->answered;
    log_->changed.notify_all();
    return S_OK;
  }

 private:
  std::shared_ptr<AudioLog> log_;
  Packet current_;
  bool pending_ = false;
};

class RenderClient : public ComObject<IAudioRenderClient, IID_IAudioRenderClient> {
 public:
  explicit RenderClient(std::shared_ptr<AudioLog> log) : log_(std::move(log)) {}
  HRESULT GetBuffer(UINT32 frames, BYTE** data) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    log_->silenceRequests.push_back(frames);
    bytes_.assign(static_cast<size_t>(frames) * 8, 0xEE);
    *data = bytes_.data();
    return S_OK;
  }
  HRESULT ReleaseBuffer(UINT32 frames, DWORD flags) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    log_->silenceReleases.emplace_back(frames, flags);
    log_->changed.notify_all();
    return S_OK;
  }

 private:
  std::shared_ptr<AudioLog> log_;
  std::vector<uint8_t> bytes_;
};

class AudioClient : public ComObject<IAudioClient, IID_IAudioClient> {
 public:
  explicit AudioClient(std::shared_ptr<AudioLog> log) : log_(std::move(log)) {}

  HRESULT Initialize(AUDCLNT_SHAREMODE mode, DWORD flags, REFERENCE_TIME duration, REFERENCE_TIME periodicity,
                     const WAVEFORMATEX* format, LPCGUID session) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    AudioLog::Init init{mode, flags, duration, periodicity, {}, session != nullptr};
    std::memcpy(&init.format, format, sizeof(WAVEFORMATEXTENSIBLE));
    log_->initializations.push_back(init);
    loopback_ = (flags & AUDCLNT_STREAMFLAGS_LOOPBACK) != 0;
    log_->changed.notify_all();
    return S_OK;
  }
  HRESULT GetBufferSize(UINT32* frames) override {
    *frames = log_->silenceBufferFrames;
    return S_OK;
  }
  HRESULT GetCurrentPadding(UINT32* frames) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    *frames = log_->silenceBufferFrames;
    if (!log_->paddings.empty()) {
      *frames = log_->paddings.front();
      log_->paddings.pop_front();
    }
    return S_OK;
  }
  HRESULT IsFormatSupported(AUDCLNT_SHAREMODE, const WAVEFORMATEX*, WAVEFORMATEX** closest) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    *closest = nullptr;
    if (log_->formatAnswer == S_FALSE) {
      auto* copy = static_cast<WAVEFORMATEXTENSIBLE*>(CoTaskMemAlloc(sizeof(WAVEFORMATEXTENSIBLE)));
      *copy = log_->closest;
      *closest = &copy->Format;
    }
    return log_->formatAnswer;
  }
  HRESULT GetMixFormat(WAVEFORMATEX** format) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    auto* copy = static_cast<WAVEFORMATEXTENSIBLE*>(CoTaskMemAlloc(sizeof(WAVEFORMATEXTENSIBLE)));
    *copy = log_->mix;
    *format = &copy->Format;
    return S_OK;
  }
  HRESULT Start() override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    ++log_->starts;
    log_->changed.notify_all();
    return S_OK;
  }
  HRESULT Reset() override { return S_OK; }
  HRESULT GetService(REFIID riid, void** object) override {
    if (riid == IID_IAudioCaptureClient && loopback_) {
      *object = static_cast<IAudioCaptureClient*>(new CaptureClient(log_));
      return S_OK;
    }
    if (riid == IID_IAudioRenderClient && !loopback_) {
      *object = static_cast<IAudioRenderClient*>(new RenderClient(log_));
      return S_OK;
    }
    *object = nullptr;
    return E_NOINTERFACE;
  }

 private:
  std::shared_ptr<AudioLog> log_;
  bool loopback_ = false;
};

class PropertyStore : public ComObject<IPropertyStore, IID_IPropertyStore> {
 public:
  explicit PropertyStore(std::wstring name) : name_(std::move(name)) {}
  HRESULT GetCount(DWORD*) override { return E_NOTIMPL; }
  HRESULT GetValue(REFPROPERTYKEY key, PROPVARIANT* value) override {
    PropVariantInit(value);
    if (!(key.fmtid == PKEY_Device_FriendlyName.fmtid) || key.pid != PKEY_Device_FriendlyName.pid) return E_FAIL;
    value->vt = VT_LPWSTR;
    value->pwszVal = taskString(name_);
    return S_OK;
  }

 private:
  std::wstring name_;
};

class Endpoint : public ComObject<IMMDevice, IID_IMMDevice> {
 public:
  Endpoint(std::shared_ptr<AudioLog> log, std::wstring name) : log_(std::move(log)), name_(std::move(name)) {}
  HRESULT Activate(REFIID iid, DWORD, PROPVARIANT*, void** object) override {
    *object = static_cast<IAudioClient*>(new AudioClient(log_));
    {
      std::lock_guard<std::mutex> lock(log_->mutex);
      ++log_->activations;
    }
    log_->changed.notify_all();
    return S_OK;
  }
  HRESULT OpenPropertyStore(DWORD, IPropertyStore** store) override {
    *store = new PropertyStore(name_);
    return S_OK;
  }
  HRESULT GetId(LPWSTR* id) override {
    *id = taskString(name_);
    return S_OK;
  }

 private:
  std::shared_ptr<AudioLog> log_;
  std::wstring name_;
};

// What an encoder was given; outlives the encoder, which the source deletes.
struct EncoderLog {
  struct Write {
    const uint8_t* data;
    uint32_t frames;
    int64_t time;
    std::vector<float> samples;  // of float formats
  };
  std::mutex mutex;
  std::string path;
  std::vector<Write> writes;
  int finalized = 0;
  bool deleted = false;
};

class Encoder : public capture::audio::Encoder {
 public:
  explicit Encoder(std::shared_ptr<EncoderLog> log) : log_(std::move(log)) {}
  ~Encoder() override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    log_->deleted = true;
  }
  void write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format, int64_t time) override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    std::vector<float> samples;
    if (format && format->wBitsPerSample == 32) {
      const auto* first = reinterpret_cast<const float*>(data);
      samples.assign(first, first + static_cast<size_t>(frames) * format->nChannels);
    }
    log_->writes.push_back({data, frames, time, std::move(samples)});
  }
  void finalize() override {
    std::lock_guard<std::mutex> lock(log_->mutex);
    ++log_->finalized;
  }

 private:
  std::shared_ptr<EncoderLog> log_;
};

}  // namespace fakes
