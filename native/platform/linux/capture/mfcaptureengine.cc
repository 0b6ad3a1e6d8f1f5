// The capture engine on Linux: the COM objects a caller holds (the engine, its source, its
// preview and record sinks, the class factory). They queue commands for the engine's thread
// (enginethread.cc) and share its state (enginestate.h); nothing here reads a device.
#include <pthread.h>

#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

extern "C" {
#include <libavdevice/avdevice.h>
#include <libavutil/time.h>
}

#include "platform/linux/capture/enginestate.h"
#include "platform/linux/mf/mfattributes.h"
#include "platform/linux/mfcapture.h"

namespace platform::engine {

namespace {

using capturedevice::deviceFrom;
using capturedevice::makeDeviceType;

class CaptureSource : public ComObject<IMFCaptureSource, IID_IMFCaptureSource> {
 public:
  explicit CaptureSource(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  HRESULT GetService(REFIID, REFIID, IUnknown** object) override {
    if (object) *object = nullptr;
    return MF_E_UNSUPPORTED_SERVICE;
  }
  HRESULT GetCurrentDeviceMediaType(DWORD stream, IMFMediaType** type) override {
    if (!type) return E_POINTER;
    *type = nullptr;
    std::unique_lock<std::mutex> lock(state_->mutex);
    state_->waitInitialized(lock);
    if (FAILED(state_->initStatus)) return state_->initStatus;
    Device* device = state_->deviceFor(stream);
    if (!device) return MF_E_INVALIDSTREAMNUMBER;
    return makeDeviceType(*device, type);
  }

 private:
  std::shared_ptr<EngineState> state_;
};

// Adds a stream to one of the two sinks' stream lists.
HRESULT addSinkStream(EngineState& state, std::vector<SinkStream>& streams, DWORD source, IMFMediaType* type,
                      DWORD* index) {
  if (!type) return E_INVALIDARG;
  std::unique_lock<std::mutex> lock(state.mutex);
  state.waitInitialized(lock);
  Device* device = state.deviceFor(source);
  if (!device) return MF_E_INVALIDSTREAMNUMBER;
  GUID major = GUID_NULL;
  type->GetGUID(MF_MT_MAJOR_TYPE, &major);
  if (major != (device->video ? MFMediaType_Video : MFMediaType_Audio)) return MF_E_INVALIDMEDIATYPE;
  SinkStream stream;
  stream.source = source;
  stream.video = device->video;
  stream.type = ComPtr<IMFMediaType>(type);
  streams.push_back(stream);
  if (index) *index = static_cast<DWORD>(streams.size() - 1);
  return S_OK;
}

// What the two sinks share: the engine's state, their own list of streams and the plain answers.
template <class I, const GUID& Iid, std::vector<SinkStream> EngineState::*List>
class Sink : public ComObject<I, IID_IMFCaptureSink, Iid> {
 public:
  explicit Sink(std::shared_ptr<EngineState> state) : state_(std::move(state)) {}
  HRESULT GetService(DWORD, REFGUID, REFIID, IUnknown** object) override {
    if (object) *object = nullptr;
    return MF_E_UNSUPPORTED_SERVICE;
  }

 protected:
  std::vector<SinkStream>& streams() { return (*state_).*List; }
  HRESULT add(DWORD source, IMFMediaType* type, DWORD* index) {
    return addSinkStream(*state_, streams(), source, type, index);
  }

  std::shared_ptr<EngineState> state_;
};

class PreviewSink : public Sink<IMFCapturePreviewSink, IID_IMFCapturePreviewSink, &EngineState::previewStreams> {
 public:
  using Sink::Sink;
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    if (type) {
      GUID subtype = GUID_NULL;
      type->GetGUID(MF_MT_SUBTYPE, &subtype);
      // Pictures come as 32-bit BGRA, sound as 16-bit PCM: those are what the engine converts to.
      if (subtype != MFVideoFormat_ARGB32 && subtype != MFVideoFormat_RGB32 && subtype != MFAudioFormat_PCM)
        return MF_E_INVALIDMEDIATYPE;
    }
    return add(source, type, index);
  }
  HRESULT RemoveAllStreams() override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    streams().clear();
    return S_OK;
  }
  HRESULT SetRenderHandle(HANDLE) override { return E_NOTIMPL; }
  HRESULT SetSampleCallback(DWORD index, IMFCaptureEngineOnSampleCallback* callback) override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (index >= streams().size()) return MF_E_INVALIDSTREAMNUMBER;
    streams()[index].callback = ComPtr<IMFCaptureEngineOnSampleCallback>(callback);
    return S_OK;
  }
};

class RecordSink : public Sink<IMFCaptureRecordSink, IID_IMFCaptureRecordSink, &EngineState::recordStreams> {
 public:
  using Sink::Sink;
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    return add(source, type, index);
  }
  HRESULT RemoveAllStreams() override {
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (state_->recording) return MF_E_INVALIDREQUEST;
    streams().clear();
    return S_OK;
  }
  HRESULT SetOutputFileName(LPCWSTR name) override {
    if (!name) return E_POINTER;
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->recordPath = narrow(name);
    return S_OK;
  }
  HRESULT SetSampleCallback(DWORD, IMFCaptureEngineOnSampleCallback*) override { return E_NOTIMPL; }
};

class CaptureEngine : public ComObject<IMFCaptureEngine, IID_IMFCaptureEngine> {
 public:
  CaptureEngine() : state_(std::make_shared<EngineState>()) {}
  ~CaptureEngine() override {
    if (!thread_.joinable()) return;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      state_->commands.emplace_back(Command::Quit, 0);
    }
    state_->changed.notify_all();
    // Released from inside one of its own callbacks (an error event), the thread finishes alone.
    if (thread_.get_id() == std::this_thread::get_id())
      thread_.detach();
    else
      thread_.join();
  }

  HRESULT Initialize(IMFCaptureEngineOnEventCallback* callback, IMFAttributes* attributes, IUnknown* audio,
                     IUnknown* video) override {
    if (!callback) return E_POINTER;
    if (thread_.joinable()) return MF_E_INVALIDREQUEST;
    UINT32 only = 0;
    const bool videoOnly =
        attributes && SUCCEEDED(attributes->GetUINT32(MF_CAPTURE_ENGINE_USE_VIDEO_DEVICE_ONLY, &only)) && only;
    only = 0;
    const bool audioOnly =
        attributes && SUCCEEDED(attributes->GetUINT32(MF_CAPTURE_ENGINE_USE_AUDIO_DEVICE_ONLY, &only)) && only;
    if (video && !audioOnly) {
      state_->video = deviceFrom(video, true);
      if (!state_->video) return E_INVALIDARG;
    }
    if (audio && !videoOnly) {
      state_->audio = deviceFrom(audio, false);
      if (!state_->audio) return E_INVALIDARG;
    }
    state_->events = ComPtr<IMFCaptureEngineOnEventCallback>(callback);
    avdevice_register_all();
    auto state = state_;
    thread_ = std::thread([state] {
      pthread_setname_np(pthread_self(), "tavio-engine");  // so per-thread figures can tell it apart
      runEngineThread(state);
    });
    return S_OK;
  }
  HRESULT StartPreview() override { return queue(Command::StartPreview); }
  HRESULT StopPreview() override { return queue(Command::StopPreview); }
  HRESULT StartRecord() override { return queue(Command::StartRecord); }
  HRESULT StopRecord(BOOL, BOOL) override { return queue(Command::StopRecord); }
  HRESULT GetSink(MF_CAPTURE_ENGINE_SINK_TYPE type, IMFCaptureSink** sink) override {
    if (!sink) return E_POINTER;
    *sink = nullptr;
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    if (type == MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW) {
      if (!preview_) preview_.Attach(new PreviewSink(state_));
      *sink = preview_.Get();
    } else if (type == MF_CAPTURE_ENGINE_SINK_TYPE_RECORD) {
      if (!record_) record_.Attach(new RecordSink(state_));
      *sink = record_.Get();
    } else {
      return E_NOTIMPL;
    }
    (*sink)->AddRef();
    return S_OK;
  }
  HRESULT GetSource(IMFCaptureSource** source) override {
    if (!source) return E_POINTER;
    *source = nullptr;
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    *source = new CaptureSource(state_);
    return S_OK;
  }

 private:
  // A command takes the moment of the call, and a record start the sink's settings as they are
  // now: the thread may come to it later.
  HRESULT queue(Command command) {
    if (!thread_.joinable()) return MF_E_NOT_INITIALIZED;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      Order order(command, av_gettime_relative());
      if (command == Command::StartRecord) {
        order.path = state_->recordPath;
        order.streams = state_->recordStreams;
      }
      state_->commands.push_back(std::move(order));
    }
    state_->changed.notify_all();
    return S_OK;
  }

  std::shared_ptr<EngineState> state_;
  std::thread thread_;
  ComPtr<IMFCapturePreviewSink> preview_;
  ComPtr<IMFCaptureRecordSink> record_;
};

class CaptureEngineClassFactory : public ComObject<IMFCaptureEngineClassFactory, IID_IMFCaptureEngineClassFactory> {
 public:
  HRESULT CreateInstance(REFCLSID clsid, REFIID riid, LPVOID* object) override {
    if (!object) return E_POINTER;
    *object = nullptr;
    if (clsid != CLSID_MFCaptureEngine) return CLASS_E_CLASSNOTAVAILABLE;
    return createInstance<CaptureEngine>(riid, object);
  }
};

}  // namespace

}  // namespace platform::engine

namespace platform {

HRESULT createCaptureEngineClassFactory(REFIID riid, void** object) {
  if (!object) return E_POINTER;
  return createInstance<engine::CaptureEngineClassFactory>(riid, object);
}

}  // namespace platform
