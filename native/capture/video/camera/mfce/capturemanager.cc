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

template <class T>
void releaseAndClear(T*& object) {
  if (object) {
    object->Release();
    object = nullptr;
  }
}

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

// DestroyEngine keeps the audio callback for a later engine; it goes with the manager.
CaptureManager::~CaptureManager() {
  if (audioSampleCallback) audioSampleCallback->Release();
}

HRESULT CaptureManager::Initialize(IUnknown* audioDevice, IUnknown* videoDevice) {
  DestroyEngine();

  engineEvent = CreateEventA(nullptr, FALSE, FALSE, nullptr);
  if (!engineEvent) return HRESULT_FROM_WIN32(GetLastError());

  eventCallback = new (std::nothrow) CaptureEngineCB(eventWindow);
  if (!eventCallback) return E_OUTOFMEMORY;
  eventCallback->manager = this;
  previewWindow = nullptr;

  IMFAttributes* attributes = nullptr;
  IMFCaptureEngineClassFactory* factory = nullptr;
  static const D3D_FEATURE_LEVEL levels[] = {D3D_FEATURE_LEVEL_11_1, D3D_FEATURE_LEVEL_11_0, D3D_FEATURE_LEVEL_10_1,
                                             D3D_FEATURE_LEVEL_10_0, D3D_FEATURE_LEVEL_9_3,  D3D_FEATURE_LEVEL_9_2,
                                             D3D_FEATURE_LEVEL_9_1};
  ID3D11DeviceContext* context = nullptr;
  D3D_FEATURE_LEVEL level{};
  HRESULT hr = D3D11CreateDevice(nullptr, D3D_DRIVER_TYPE_HARDWARE, nullptr, D3D11_CREATE_DEVICE_VIDEO_SUPPORT, levels,
                                 sizeof(levels) / sizeof(levels[0]), D3D11_SDK_VERSION, &d3dDevice, &level, &context);
  if (SUCCEEDED(hr)) {
    ID3D10Multithread* multithread = nullptr;
    hr = d3dDevice->QueryInterface(IID_ID3D10Multithread, reinterpret_cast<void**>(&multithread));
    if (SUCCEEDED(hr)) {
      multithread->SetMultithreadProtected(TRUE);
      multithread->Release();
    }
  }
  releaseAndClear(context);

  if (SUCCEEDED(hr)) hr = MFCreateDXGIDeviceManager(&resetToken, &dxgiManager);
  if (SUCCEEDED(hr)) hr = dxgiManager->ResetDevice(d3dDevice, resetToken);
  if (SUCCEEDED(hr)) hr = MFCreateAttributes(&attributes, 1);
  if (SUCCEEDED(hr)) hr = attributes->SetUnknown(MF_CAPTURE_ENGINE_D3D_MANAGER, dxgiManager);
  if (SUCCEEDED(hr))
    hr = CoCreateInstance(CLSID_MFCaptureEngineClassFactory, nullptr, CLSCTX_INPROC_SERVER,
                          IID_IMFCaptureEngineClassFactory, reinterpret_cast<void**>(&factory));
  if (SUCCEEDED(hr))
    hr = factory->CreateInstance(CLSID_MFCaptureEngine, IID_IMFCaptureEngine, reinterpret_cast<void**>(&engine));

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
      hr = engine->Initialize(eventCallback, attributes, audioDevice, videoDevice);
    else
      releaseAndClear(engine);
  }

  releaseAndClear(attributes);
  releaseAndClear(factory);
  return hr;
}

void CaptureManager::DestroyEngine() {
  // The engine goes first: once it is released no event handler is left signalling the event
  // or filling the frame queue while the rest is torn down.
  releaseAndClear(engine);
  if (engineEvent) {
    CloseHandle(engineEvent);
    engineEvent = nullptr;
  }
  releaseAndClear(videoSampleCallback);
  releaseAndClear(previewSink);
  releaseAndClear(eventCallback);
  if (dxgiManager) dxgiManager->ResetDevice(d3dDevice, resetToken);
  releaseAndClear(d3dDevice);
  releaseAndClear(dxgiManager);
  previewing = false;
  recording = false;
  photoPending = false;
  errorId = 0;
}

HRESULT CaptureManager::ConfigurePreview(UINT32& width, UINT32& height) {
  if (!engine) return MF_E_NOT_INITIALIZED;
  if (previewing) return S_OK;
  if (previewSink) return S_OK;

  IMFCaptureSink* sink = nullptr;
  IMFCaptureSource* source = nullptr;
  IMFMediaType* deviceType = nullptr;
  IMFMediaType* previewType = nullptr;
  IMFMediaType* audioType = nullptr;
  IMFMediaType* pcmType = nullptr;

  HRESULT hr = engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW, &sink);
  if (SUCCEEDED(hr)) hr = sink->QueryInterface(IID_IMFCapturePreviewSink, reinterpret_cast<void**>(&previewSink));
  if (SUCCEEDED(hr) && previewWindow) hr = previewSink->SetRenderHandle(previewWindow);
  if (SUCCEEDED(hr)) hr = engine->GetSource(&source);

  if (SUCCEEDED(hr) && hasVideo) {
    hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW, &deviceType);
    if (SUCCEEDED(hr)) {
      UINT64 size = 0;
      hr = deviceType->GetUINT64(MF_MT_FRAME_SIZE, &size);
      if (SUCCEEDED(hr)) {
        width = static_cast<UINT32>(size >> 32);
        height = static_cast<UINT32>(size);
      }
    }
    if (SUCCEEDED(hr)) hr = MakeVideoType(deviceType, MFVideoFormat_ARGB32, &previewType);
    if (SUCCEEDED(hr)) hr = previewType->SetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
    DWORD streamIndex = 0;
    if (SUCCEEDED(hr))
      hr = previewSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW, previewType, nullptr,
                                  &streamIndex);
    if (SUCCEEDED(hr) && !previewWindow) {
      videoSampleCallback = new (std::nothrow) CaptureEngineVideoPreviewCB;
      if (!videoSampleCallback) {
        hr = E_OUTOFMEMORY;
      } else {
        videoSampleCallback->manager = this;
        hr = previewSink->SetSampleCallback(streamIndex, videoSampleCallback);
      }
    }
  }

  if (SUCCEEDED(hr) && hasAudio) {
    hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO, &audioType);
    if (SUCCEEDED(hr)) hr = MakePcmType(audioType, &pcmType);
    if (SUCCEEDED(hr)) {
      UINT32 value = 0;
      audioChannels = SUCCEEDED(pcmType->GetUINT32(MF_MT_AUDIO_NUM_CHANNELS, &value)) ? value : 1;
      audioBitsPerSample = SUCCEEDED(pcmType->GetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, &value)) ? value : 16;
    }
    DWORD streamIndex = 0;
    if (SUCCEEDED(hr))
      hr = previewSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO, pcmType, nullptr, &streamIndex);
    if (SUCCEEDED(hr)) {
      audioSampleCallback = new (std::nothrow) CaptureEngineAudioPreviewCB;
      if (!audioSampleCallback) {
        hr = E_OUTOFMEMORY;
      } else {
        audioSampleCallback->manager = this;
        hr = previewSink->SetSampleCallback(streamIndex, audioSampleCallback);
      }
    }
  }

  releaseAndClear(sink);
  releaseAndClear(source);
  releaseAndClear(deviceType);
  releaseAndClear(previewType);
  releaseAndClear(audioType);
  releaseAndClear(pcmType);
  return hr;
}

CaptureManager::Mark::~Mark() {
  if (event) CloseHandle(event);
}

void CaptureManager::mark(Mark& before) const {
  for (int kind = 0; kind < EventKinds; ++kind) before.handled[kind] = handled_[kind].load();
  if (engineEvent &&
      !DuplicateHandle(GetCurrentProcess(), engineEvent, GetCurrentProcess(), &before.event, 0, FALSE,
                       DUPLICATE_SAME_ACCESS))
    before.event = nullptr;
}

// Every handled event signals engineEvent after counting itself, so a wait that finds its count
// unchanged is released by a later signal. An engine error ends every wait: nothing else comes.
void CaptureManager::waitFor(const Mark& before, EventKind kind) {
  while (handled_[kind].load() == before.handled[kind] &&
         handled_[EngineFailed].load() == before.handled[EngineFailed]) {
    if (!before.event || WaitForSingleObject(before.event, INFINITE) != WAIT_OBJECT_0) return;
  }
}

HRESULT CaptureManager::StartPreview(capture::video::FrameQueue* queue) {
  if (!engine) return MF_E_NOT_INITIALIZED;
  if (previewing) return S_OK;
  if (!frameQueue) frameQueue = queue;
  Mark before;
  mark(before);
  HRESULT hr = engine->StartPreview();
  if (!powerRequestSet && powerRequest != INVALID_HANDLE_VALUE)
    powerRequestSet = PowerSetRequest(powerRequest, PowerRequestExecutionRequired) == TRUE;
  // A call the engine refused has no event to wait for.
  if (SUCCEEDED(hr)) waitFor(before, PreviewStarted);
  return hr;
}

HRESULT CaptureManager::StopPreview() {
  if (!engine) return MF_E_NOT_INITIALIZED;
  if (!previewing) return S_OK;
  Mark before;
  mark(before);
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
  IMFMediaType* deviceType = nullptr;
  IMFMediaType* recordType = nullptr;
  HRESULT hr = source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD, &deviceType);
  if (SUCCEEDED(hr)) hr = MakeVideoType(deviceType, MFVideoFormat_H264, &recordType);
  if (SUCCEEDED(hr)) {
    GUID deviceSubtype = GUID_NULL;
    deviceType->GetGUID(MF_MT_SUBTYPE, &deviceSubtype);
    if (deviceSubtype == MFVideoFormat_H264 || deviceSubtype == MFVideoFormat_H264_ES)
      hr = recordType->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);  // the camera's stream passes through
    else
      hr = recordType->SetUINT32(MF_MT_AVG_BITRATE, EstimateBitrate(recordType));
  }
  DWORD streamIndex = 0;
  if (SUCCEEDED(hr))
    hr = sink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD, recordType, nullptr, &streamIndex);
  releaseAndClear(deviceType);
  releaseAndClear(recordType);
  return hr;
}

HRESULT CaptureManager::AddAudioRecordStream(IMFCaptureRecordSink* sink) {
  IMFAttributes* config = nullptr;
  IMFCollection* types = nullptr;
  IUnknown* first = nullptr;
  IMFMediaType* aacType = nullptr;
  HRESULT hr = MFCreateAttributes(&config, 1);
  if (SUCCEEDED(hr)) hr = config->SetUINT32(MF_LOW_LATENCY, TRUE);
  if (SUCCEEDED(hr))
    hr = MFTranscodeGetAudioOutputAvailableTypes(MFAudioFormat_AAC, MFT_ENUM_FLAG_ALL | MFT_ENUM_FLAG_SORTANDFILTER,
                                                 config, &types);
  if (SUCCEEDED(hr)) hr = types->GetElement(0, &first);
  if (SUCCEEDED(hr)) hr = first->QueryInterface(IID_IMFMediaType, reinterpret_cast<void**>(&aacType));
  DWORD streamIndex = 0;
  if (SUCCEEDED(hr)) {
    hr = sink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO, aacType, nullptr, &streamIndex);
    if (hr == MF_E_INVALIDSTREAMNUMBER) hr = S_OK;  // a device without sound records video only
  }
  releaseAndClear(config);
  releaseAndClear(types);
  releaseAndClear(first);
  releaseAndClear(aacType);
  return hr;
}

HRESULT CaptureManager::StartRecord(LPCWSTR path) {
  if (!engine) return MF_E_NOT_INITIALIZED;
  if (recording) return MF_E_INVALIDREQUEST;

  // Only the name chooses the container, so only ".mp4", spelt exactly so, is taken.
  const wchar_t* extension = PathFindExtensionW(path);
  static const wchar_t mp4[] = {L'.', L'm', L'p', L'4', 0};
  for (size_t i = 0; i < sizeof(mp4) / sizeof(mp4[0]); ++i)
    if (!extension || extension[i] != mp4[i]) return MF_E_INVALIDMEDIATYPE;

  const GUID videoEncoding = hasVideo ? MFVideoFormat_H264 : GUID_NULL;
  const GUID audioEncoding = hasAudio ? MFAudioFormat_AAC : GUID_NULL;

  IMFCaptureSink* sink = nullptr;
  IMFCaptureRecordSink* recordSink = nullptr;
  IMFCaptureSource* source = nullptr;
  HRESULT hr = engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_RECORD, &sink);
  if (SUCCEEDED(hr)) hr = sink->QueryInterface(IID_IMFCaptureRecordSink, reinterpret_cast<void**>(&recordSink));
  if (SUCCEEDED(hr)) hr = engine->GetSource(&source);
  if (SUCCEEDED(hr)) hr = recordSink->RemoveAllStreams();
  if (SUCCEEDED(hr)) hr = recordSink->SetOutputFileName(path);
  if (SUCCEEDED(hr) && videoEncoding != GUID_NULL) hr = AddVideoRecordStream(source, recordSink);
  if (SUCCEEDED(hr) && audioEncoding != GUID_NULL) hr = AddAudioRecordStream(recordSink);
  if (SUCCEEDED(hr)) {
    Mark before;
    mark(before);
    hr = engine->StartRecord();
    if (SUCCEEDED(hr)) {
      waitFor(before, RecordStarted);
      // The engine's answer says whether the file could be made: its failure is the start's.
      if (handled_[RecordStarted].load() != before.handled[RecordStarted]) hr = recordStartStatus_.load();
    }
  }
  releaseAndClear(sink);
  releaseAndClear(recordSink);
  releaseAndClear(source);
  return hr;
}

HRESULT CaptureManager::StopRecord() {
  if (!recording) return S_OK;
  Mark before;
  mark(before);
  HRESULT hr = engine->StopRecord(TRUE, FALSE);
  if (SUCCEEDED(hr)) waitFor(before, RecordStopped);
  return hr;
}

HRESULT CaptureManager::HandleEngineEvent(IMFMediaEvent* event) {
  HRESULT status = eventStatus(event);
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
      // Waits in progress end before the handle goes; the handle keeps its object while they do.
      ++handled_[EngineFailed];
      SetEvent(engineEvent);
      DestroyEngine();
    }
  }
  event->Release();
  SetEvent(engineEvent);  // a null handle after an error event: nothing to signal
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
  // The receiver of the message owns the added reference; when nothing can receive it, give it back.
  event->AddRef();
  if (!PostMessageA(eventWindow, engineEventMessage, reinterpret_cast<WPARAM>(event), 0)) event->Release();
  return S_OK;
}

}  // namespace capture::video::camera::mfce
