#include "capture/video/camera/mfce/capturemanager.h"

#include <new>
#include <stdexcept>

#include "capture/check.h"
#include "capture/log.h"
#include "capture/video/camera/mfce/mediatypes.h"
#include "platform/user32.h"

namespace capture::video::camera::mfce {

namespace {

// An engine event posted to the event window, the event pointer in wParam.
constexpr UINT engineEventMessage = WM_APP + 1;

wchar_t powerReason[] = L"CaptureEngine is recording!";

const char* const file = "native/capture/video/camera/mfce/capturemanager";

// A failure the engine reports on its own thread, where nobody catches: a warning line.
void warn(int32_t line, HRESULT hr, const char* message) {
  try {
    checkResult(file, line, hr, message);
  } catch (const std::runtime_error& error) {
    logWarning(error.what());
  }
}

// Status of an event; a status that cannot be read is the failure of reading it.
HRESULT eventStatus(IMFMediaEvent* event) {
  HRESULT status = S_OK;
  HRESULT hr = event->GetStatus(&status);
  return FAILED(hr) ? hr : status;
}

}  // namespace

CaptureManager::CaptureManager() {
  REASON_CONTEXT context{};
  context.Version = POWER_REQUEST_CONTEXT_VERSION;
  context.Flags = POWER_REQUEST_CONTEXT_SIMPLE_STRING;
  context.Reason.SimpleReasonString = powerReason;
  powerRequest = PowerCreateRequest(&context);
  leftPeak.store(0.0);
  rightPeak.store(0.0);
}

CaptureManager::~CaptureManager() = default;

HRESULT CaptureManager::Initialize(IUnknown* audioDevice, IUnknown* videoDevice) {
  DestroyEngine();

  engineEvent = CreateEventA(nullptr, FALSE, FALSE, nullptr);
  if (!engineEvent) return HRESULT_FROM_WIN32(GetLastError());

  eventCallback = adopt(new (std::nothrow) CaptureEngineCB(eventWindow));
  if (!eventCallback) return E_OUTOFMEMORY;
  eventCallback->manager = this;
  previewWindow = nullptr;

  ComPtr<IMFAttributes> attributes;
  ComPtr<IMFCaptureEngineClassFactory> factory;
  static const D3D_FEATURE_LEVEL levels[] = {D3D_FEATURE_LEVEL_11_1, D3D_FEATURE_LEVEL_11_0, D3D_FEATURE_LEVEL_10_1,
                                             D3D_FEATURE_LEVEL_10_0, D3D_FEATURE_LEVEL_9_3,  D3D_FEATURE_LEVEL_9_2,
                                             D3D_FEATURE_LEVEL_9_1};
  ComPtr<ID3D11DeviceContext> context;
  D3D_FEATURE_LEVEL level{};
  HRESULT hr = D3D11CreateDevice(nullptr, D3D_DRIVER_TYPE_HARDWARE, nullptr, D3D11_CREATE_DEVICE_VIDEO_SUPPORT, levels,
                                 sizeof(levels) / sizeof(levels[0]), D3D11_SDK_VERSION, d3dDevice.GetAddressOf(),
                                 &level, context.GetAddressOf());
  if (SUCCEEDED(hr)) {
    ComPtr<ID3D10Multithread> multithread;
    hr = d3dDevice->QueryInterface(IID_ID3D10Multithread, reinterpret_cast<void**>(multithread.GetAddressOf()));
    if (SUCCEEDED(hr)) multithread->SetMultithreadProtected(TRUE);
  }

  if (SUCCEEDED(hr)) hr = MFCreateDXGIDeviceManager(&resetToken, dxgiManager.GetAddressOf());
  if (SUCCEEDED(hr)) hr = dxgiManager->ResetDevice(d3dDevice.Get(), resetToken);
  if (SUCCEEDED(hr)) hr = MFCreateAttributes(attributes.GetAddressOf(), 1);
  if (SUCCEEDED(hr)) hr = attributes->SetUnknown(MF_CAPTURE_ENGINE_D3D_MANAGER, dxgiManager.Get());
  if (SUCCEEDED(hr))
    hr = CoCreateInstance(CLSID_MFCaptureEngineClassFactory, nullptr, CLSCTX_INPROC_SERVER,
                          IID_IMFCaptureEngineClassFactory, reinterpret_cast<void**>(factory.GetAddressOf()));
  if (SUCCEEDED(hr))
    hr = factory->CreateInstance(CLSID_MFCaptureEngine, IID_IMFCaptureEngine,
                                 reinterpret_cast<void**>(engine.GetAddressOf()));

  if (SUCCEEDED(hr)) {
    if (!audioDevice)
      hr = attributes->SetUINT32(MF_CAPTURE_ENGINE_USE_VIDEO_DEVICE_ONLY, TRUE);
    else
      hasAudio = 1;
    if (SUCCEEDED(hr)) {
      if (!videoDevice)
        hr = attributes->SetUINT32(MF_CAPTURE_ENGINE_USE_AUDIO_DEVICE_ONLY, TRUE);
      else
        hasVideo = 1;
    }
    if (SUCCEEDED(hr))
      hr = engine->Initialize(eventCallback.Get(), attributes.Get(), audioDevice, videoDevice);
    else
      engine.Reset();
  }
  return hr;
}

void CaptureManager::DestroyEngine() {
  // The engine goes first: once it is released no event handler is left signalling the event
  // or filling the frame queue while the rest is torn down.
  engine.Reset();
  if (engineEvent) {
    CloseHandle(engineEvent);
    engineEvent = nullptr;
  }
  videoSampleCallback.Reset();
  previewSink.Reset();
  eventCallback.Reset();
  if (dxgiManager) dxgiManager->ResetDevice(d3dDevice.Get(), resetToken);
  d3dDevice.Reset();
  dxgiManager.Reset();
  previewing = false;
  recording = false;
  photoPending = false;
  errorId = 0;
}

// Whether there is an engine to call; one that reported an error is released first, so later
// operations find none.
bool CaptureManager::HasEngine() {
  if (failed_.exchange(false)) DestroyEngine();
  return static_cast<bool>(engine);
}

HRESULT CaptureManager::ConfigurePreview(UINT32& width, UINT32& height) {
  if (!HasEngine()) return MF_E_NOT_INITIALIZED;
  if (previewing) return S_OK;
  if (previewSink) return S_OK;

  ComPtr<IMFCaptureSink> sink;
  ComPtr<IMFCaptureSource> source;
  ComPtr<IMFMediaType> deviceType;
  ComPtr<IMFMediaType> previewType;
  ComPtr<IMFMediaType> audioType;
  ComPtr<IMFMediaType> pcmType;

  HRESULT hr = engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW, sink.GetAddressOf());
  if (SUCCEEDED(hr))
    hr = sink->QueryInterface(IID_IMFCapturePreviewSink, reinterpret_cast<void**>(previewSink.GetAddressOf()));
  if (SUCCEEDED(hr) && previewWindow) hr = previewSink->SetRenderHandle(previewWindow);
  if (SUCCEEDED(hr)) hr = engine->GetSource(source.GetAddressOf());

  if (SUCCEEDED(hr) && hasVideo) {
    hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW,
                                           deviceType.GetAddressOf());
    if (SUCCEEDED(hr)) {
      UINT64 size = 0;
      hr = deviceType->GetUINT64(MF_MT_FRAME_SIZE, &size);
      if (SUCCEEDED(hr)) {
        width = static_cast<UINT32>(size >> 32);
        height = static_cast<UINT32>(size);
      }
    }
    if (SUCCEEDED(hr)) hr = MakeVideoType(deviceType.Get(), MFVideoFormat_ARGB32, previewType.GetAddressOf());
    if (SUCCEEDED(hr)) hr = previewType->SetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
    DWORD streamIndex = 0;
    if (SUCCEEDED(hr))
      hr = previewSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW, previewType.Get(),
                                  nullptr, &streamIndex);
    if (SUCCEEDED(hr) && !previewWindow) {
      videoSampleCallback = adopt(new (std::nothrow) CaptureEngineVideoPreviewCB);
      if (!videoSampleCallback) {
        hr = E_OUTOFMEMORY;
      } else {
        videoSampleCallback->manager = this;
        hr = previewSink->SetSampleCallback(streamIndex, videoSampleCallback.Get());
      }
    }
  }

  if (SUCCEEDED(hr) && hasAudio) {
    hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO,
                                           audioType.GetAddressOf());
    if (SUCCEEDED(hr)) hr = MakePcmType(audioType.Get(), pcmType.GetAddressOf());
    if (SUCCEEDED(hr)) {
      UINT32 value = 0;
      audioChannels = SUCCEEDED(pcmType->GetUINT32(MF_MT_AUDIO_NUM_CHANNELS, &value)) ? value : 1;
      audioBitsPerSample = SUCCEEDED(pcmType->GetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, &value)) ? value : 16;
    }
    DWORD streamIndex = 0;
    if (SUCCEEDED(hr))
      hr = previewSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO, pcmType.Get(), nullptr,
                                  &streamIndex);
    if (SUCCEEDED(hr)) {
      audioSampleCallback = adopt(new (std::nothrow) CaptureEngineAudioPreviewCB);
      if (!audioSampleCallback) {
        hr = E_OUTOFMEMORY;
      } else {
        audioSampleCallback->manager = this;
        hr = previewSink->SetSampleCallback(streamIndex, audioSampleCallback.Get());
      }
    }
  }
  return hr;
}

CaptureManager::Mark CaptureManager::mark() const {
  Mark before;
  for (int kind = 0; kind < EventKinds; ++kind) before.handled[kind] = handled_[kind].load();
  return before;
}

// Every handled event signals engineEvent after counting itself, so a wait that finds its count
// unchanged is released by a later signal. An engine error ends every wait: nothing else comes.
void CaptureManager::waitFor(const Mark& before, EventKind kind) {
  while (handled_[kind].load() == before.handled[kind] &&
         handled_[EngineFailed].load() == before.handled[EngineFailed]) {
    if (!engineEvent || WaitForSingleObject(engineEvent, INFINITE) != WAIT_OBJECT_0) return;
  }
}

HRESULT CaptureManager::StartPreview(capture::video::FrameQueue* queue) {
  if (!HasEngine()) return MF_E_NOT_INITIALIZED;
  if (previewing) return S_OK;
  if (!frameQueue) frameQueue = queue;
  const Mark before = mark();
  HRESULT hr = engine->StartPreview();
  if (!powerRequestSet && powerRequest != INVALID_HANDLE_VALUE)
    powerRequestSet = PowerSetRequest(powerRequest, PowerRequestExecutionRequired) == TRUE;
  // A call the engine refused has no event to wait for.
  if (SUCCEEDED(hr)) waitFor(before, PreviewStarted);
  return hr;
}

HRESULT CaptureManager::StopPreview() {
  if (!HasEngine()) return MF_E_NOT_INITIALIZED;
  if (!previewing) return S_OK;
  const Mark before = mark();
  HRESULT hr = engine->StopPreview();
  if (FAILED(hr)) return hr;
  waitFor(before, PreviewStopped);
  if (powerRequestSet && powerRequest != INVALID_HANDLE_VALUE) {
    PowerClearRequest(powerRequest, PowerRequestExecutionRequired);
    powerRequestSet = false;
  }
  return hr;
}

HRESULT CaptureManager::AddVideoRecordStream(IMFCaptureSource* source, IMFCaptureRecordSink* sink) {
  ComPtr<IMFMediaType> deviceType;
  ComPtr<IMFMediaType> recordType;
  HRESULT hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD,
                                                 deviceType.GetAddressOf());
  if (SUCCEEDED(hr)) hr = MakeVideoType(deviceType.Get(), MFVideoFormat_H264, recordType.GetAddressOf());
  if (SUCCEEDED(hr)) {
    GUID deviceSubtype = GUID_NULL;
    deviceType->GetGUID(MF_MT_SUBTYPE, &deviceSubtype);
    if (deviceSubtype == MFVideoFormat_H264 || deviceSubtype == MFVideoFormat_H264_ES)
      hr = recordType->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);  // the camera's stream passes through
    else
      hr = recordType->SetUINT32(MF_MT_AVG_BITRATE, EstimateBitrate(recordType.Get()));
  }
  DWORD streamIndex = 0;
  if (SUCCEEDED(hr))
    hr = sink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD, recordType.Get(), nullptr,
                         &streamIndex);
  return hr;
}

HRESULT CaptureManager::AddAudioRecordStream(IMFCaptureRecordSink* sink) {
  ComPtr<IMFAttributes> config;
  ComPtr<IMFCollection> types;
  ComPtr<IUnknown> first;
  ComPtr<IMFMediaType> aacType;
  HRESULT hr = MFCreateAttributes(config.GetAddressOf(), 1);
  if (SUCCEEDED(hr)) hr = config->SetUINT32(MF_LOW_LATENCY, TRUE);
  if (SUCCEEDED(hr))
    hr = MFTranscodeGetAudioOutputAvailableTypes(MFAudioFormat_AAC, MFT_ENUM_FLAG_ALL | MFT_ENUM_FLAG_SORTANDFILTER,
                                                 config.Get(), types.GetAddressOf());
  if (SUCCEEDED(hr)) hr = types->GetElement(0, first.GetAddressOf());
  if (SUCCEEDED(hr)) hr = first->QueryInterface(IID_IMFMediaType, reinterpret_cast<void**>(aacType.GetAddressOf()));
  DWORD streamIndex = 0;
  if (SUCCEEDED(hr)) {
    hr = sink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO, aacType.Get(), nullptr, &streamIndex);
    if (hr == MF_E_INVALIDSTREAMNUMBER) hr = S_OK;  // a device without sound records video only
  }
  return hr;
}

HRESULT CaptureManager::StartRecord(LPCWSTR path) {
  if (!HasEngine()) return MF_E_NOT_INITIALIZED;
  if (recording) return MF_E_INVALIDREQUEST;

  // Only the name chooses the container, so only ".mp4", spelt exactly so, is taken.
  const wchar_t* extension = PathFindExtensionW(path);
  static const wchar_t mp4[] = {L'.', L'm', L'p', L'4', 0};
  for (size_t i = 0; i < sizeof(mp4) / sizeof(mp4[0]); ++i)
    if (!extension || extension[i] != mp4[i]) return MF_E_INVALIDMEDIATYPE;

  const GUID videoEncoding = hasVideo ? MFVideoFormat_H264 : GUID_NULL;
  const GUID audioEncoding = hasAudio ? MFAudioFormat_AAC : GUID_NULL;

  ComPtr<IMFCaptureSink> sink;
  ComPtr<IMFCaptureRecordSink> recordSink;
  ComPtr<IMFCaptureSource> source;
  HRESULT hr = engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_RECORD, sink.GetAddressOf());
  if (SUCCEEDED(hr))
    hr = sink->QueryInterface(IID_IMFCaptureRecordSink, reinterpret_cast<void**>(recordSink.GetAddressOf()));
  if (SUCCEEDED(hr)) hr = engine->GetSource(source.GetAddressOf());
  if (SUCCEEDED(hr)) hr = recordSink->RemoveAllStreams();
  if (SUCCEEDED(hr)) hr = recordSink->SetOutputFileName(path);
  if (SUCCEEDED(hr) && videoEncoding != GUID_NULL) hr = AddVideoRecordStream(source.Get(), recordSink.Get());
  if (SUCCEEDED(hr) && audioEncoding != GUID_NULL) hr = AddAudioRecordStream(recordSink.Get());
  if (SUCCEEDED(hr)) {
    const Mark before = mark();
    hr = engine->StartRecord();
    if (SUCCEEDED(hr)) {
      waitFor(before, RecordStarted);
      // The engine's answer says whether the file could be made: its failure is the start's.
      if (handled_[RecordStarted].load() != before.handled[RecordStarted]) hr = recordStartStatus_.load();
    }
  }
  return hr;
}

HRESULT CaptureManager::StopRecord() {
  const HRESULT hr = BeginStopRecord();
  FinishStopRecord();
  return hr;
}

HRESULT CaptureManager::BeginStopRecord() {
  if (stopPending_ || !HasEngine() || !recording) return S_OK;
  stopMark_ = mark();
  const HRESULT hr = engine->StopRecord(TRUE, FALSE);
  stopPending_ = SUCCEEDED(hr);
  return hr;
}

void CaptureManager::FinishStopRecord() {
  if (!stopPending_) return;
  stopPending_ = false;
  waitFor(stopMark_, RecordStopped);
}

HRESULT CaptureManager::HandleEngineEvent(IMFMediaEvent* event) {
  ComPtr<IMFMediaEvent> taken = adopt(event);  // the caller's reference, let go once handled
  HRESULT status = eventStatus(event);
  bool failed = false;
  GUID type = GUID_NULL;
  if (SUCCEEDED(event->GetExtendedType(&type))) {
    if (type == MF_CAPTURE_ENGINE_INITIALIZED) {
      if (status == MF_E_NO_CAPTURE_DEVICES_AVAILABLE) status = S_OK;
    } else if (type == MF_CAPTURE_ENGINE_PREVIEW_STARTED) {
      previewing = SUCCEEDED(status);
      ++handled_[PreviewStarted];
    } else if (type == MF_CAPTURE_ENGINE_PREVIEW_STOPPED) {
      previewing = false;
      ++handled_[PreviewStopped];
    } else if (type == MF_CAPTURE_ENGINE_RECORD_STARTED) {
      recording = SUCCEEDED(status);
      recordStartStatus_ = status;
      ++handled_[RecordStarted];
    } else if (type == MF_CAPTURE_ENGINE_RECORD_STOPPED) {
      // A failed stop is a write that failed: the file keeps what was written before it.
      if (FAILED(status)) warn(402, status, "CaptureManager: the recording could not be written to the end");
      recording = false;
      ++handled_[RecordStopped];
    } else if (type == MF_CAPTURE_ENGINE_PHOTO_TAKEN) {
      photoPending = false;
    } else if (type == MF_CAPTURE_ENGINE_ERROR) {
      if (recording) warn(411, status, "CaptureManager: the device failed while recording");
      // The engine is torn down by its owner's next call (HasEngine), not here: this runs on the
      // engine's own thread, and the owner may be calling into the engine at this moment.
      previewing = false;
      recording = false;
      // A meter must not go on showing the sound of a device that is gone.
      leftPeak.store(0.0);
      rightPeak.store(0.0);
      ++handled_[EngineFailed];
      failed = true;
    }
  }
  taken.Reset();
  SetEvent(engineEvent);
  // Last: once the owner sees the failure it may close engineEvent and release the engine.
  if (failed) failed_ = true;
  return status;
}

// Event callback.

HRESULT CaptureManager::CaptureEngineCB::QueryInterface(REFIID riid, void** object) {
  if (!object) return E_POINTER;
  if (riid == IID_IUnknown || riid == IID_IMFCaptureEngineOnEventCallback) {
    *object = static_cast<IMFCaptureEngineOnEventCallback*>(this);
    AddRef();
    return S_OK;
  }
  *object = nullptr;
  return E_NOINTERFACE;
}

ULONG CaptureManager::CaptureEngineCB::AddRef() { return ++references; }

ULONG CaptureManager::CaptureEngineCB::Release() {
  const ULONG left = --references;
  if (left == 0) delete this;
  return left;
}

HRESULT CaptureManager::CaptureEngineCB::OnEvent(IMFMediaEvent* event) {
  if (!event) return S_OK;
  if (direct && manager) {
    GUID type = GUID_NULL;
    eventStatus(event);
    if (FAILED(event->GetExtendedType(&type))) return S_OK;
    event->AddRef();
    manager->HandleEngineEvent(event);
    return S_OK;
  }
  // Without a window the message would go to the engine thread's own queue, which nothing reads
  // (an event that comes before the source has set `direct`): the event is dropped here instead
  // of with its reference in that queue.
  if (!eventWindow) return S_OK;
  // The receiver of the message owns the added reference; when nothing can receive it, give it back.
  event->AddRef();
  if (!PostMessageA(eventWindow, engineEventMessage, reinterpret_cast<WPARAM>(event), 0)) event->Release();
  return S_OK;
}

}  // namespace capture::video::camera::mfce
