// One Media Foundation capture engine for one camera source: preview through sample callbacks,
// recording through the engine's record sink, and the engine's events turned into flags and one
// auto-reset event that the start and stop operations wait on.
#pragma once

#include <atomic>
#include <cstdint>

#include "capture/video/frame.h"
#include "platform/dxgi.h"
#include "platform/kernel32.h"
#include "platform/mfcapture.h"

namespace capture::video::camera::mfce {

class CaptureManager {
 public:
  // Engine events: handled on the engine's thread once `direct` is set, else posted to
  // `eventWindow` (dropped while there is none).
  class CaptureEngineCB : public IMFCaptureEngineOnEventCallback {
   public:
    explicit CaptureEngineCB(HWND eventWindow) : eventWindow(eventWindow) {}
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void** object) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;
    HRESULT STDMETHODCALLTYPE OnEvent(IMFMediaEvent* event) override;

    std::atomic<uint32_t> references{1};
    HWND eventWindow;
    std::atomic<bool> direct{false};  // set by the source while the engine may already deliver events
    CaptureManager* manager = nullptr;

   protected:
    virtual ~CaptureEngineCB() = default;
  };

  // Camera pictures: each one becomes the only frame of the manager's frame queue.
  class CaptureEngineVideoPreviewCB : public IMFCaptureEngineOnSampleCallback {
   public:
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void** object) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;
    HRESULT STDMETHODCALLTYPE OnSample(IMFSample* sample) override;

    std::atomic<uint32_t> references{1};
    CaptureManager* manager = nullptr;

   protected:
    virtual ~CaptureEngineVideoPreviewCB() = default;
  };

  // Microphone buffers: each one replaces the two level peaks.
  class CaptureEngineAudioPreviewCB : public IMFCaptureEngineOnSampleCallback {
   public:
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void** object) override;
    ULONG STDMETHODCALLTYPE AddRef() override;
    ULONG STDMETHODCALLTYPE Release() override;
    HRESULT STDMETHODCALLTYPE OnSample(IMFSample* sample) override;

    std::atomic<uint32_t> references{1};
    CaptureManager* manager = nullptr;

   protected:
    virtual ~CaptureEngineAudioPreviewCB() = default;
  };

  CaptureManager();
  ~CaptureManager();
  CaptureManager(const CaptureManager&) = delete;
  CaptureManager& operator=(const CaptureManager&) = delete;

  HRESULT Initialize(IUnknown* audioDevice, IUnknown* videoDevice);
  void DestroyEngine();
  bool HasEngine();
  HRESULT ConfigurePreview(UINT32& width, UINT32& height);
  HRESULT StartPreview(capture::video::FrameQueue* queue);
  HRESULT StopPreview();
  HRESULT StartRecord(LPCWSTR path);
  HRESULT StopRecord();
  // StopRecord in two halves, so that several engines end their clips at one moment: the engine
  // is told to stop now, and FinishStopRecord waits until the file is written.
  HRESULT BeginStopRecord();
  void FinishStopRecord();
  HRESULT HandleEngineEvent(IMFMediaEvent* event);

  bool IsPreviewing() const { return previewing; }
  bool IsRecording() const { return recording; }

  HWND eventWindow = nullptr;
  ComPtr<IMFCaptureEngine> engine;
  uint32_t hasAudio = 0;
  uint32_t hasVideo = 0;
  ComPtr<IMFCapturePreviewSink> previewSink;
  HWND previewWindow = nullptr;
  ComPtr<CaptureEngineVideoPreviewCB> videoSampleCallback;
  capture::video::FrameQueue* frameQueue = nullptr;
  ComPtr<CaptureEngineAudioPreviewCB> audioSampleCallback;  // kept across engines
  uint32_t audioChannels = 0;
  uint32_t audioBitsPerSample = 0;
  std::atomic<double> leftPeak{0.0};
  std::atomic<double> rightPeak{0.0};
  ComPtr<CaptureEngineCB> eventCallback;
  // Written on the engine's thread; a stale signal of engineEvent can end a wait before the write.
  std::atomic<bool> previewing{false};
  std::atomic<bool> recording{false};
  std::atomic<bool> photoPending{false};
  uint32_t errorId = 0;
  HANDLE engineEvent = nullptr;
  HANDLE powerRequest = INVALID_HANDLE_VALUE;
  bool powerRequestSet = false;
  ComPtr<IMFDXGIDeviceManager> dxgiManager;
  ComPtr<ID3D11Device> d3dDevice;
  UINT resetToken = 0;

 private:
  // Engine events handled so far, by kind. A wait ends when the event it waits for has been
  // handled (or the engine failed), not at the next signal of engineEvent: a signal of an earlier
  // event stays pending and would end it before the engine has answered.
  enum EventKind { PreviewStarted, PreviewStopped, RecordStarted, RecordStopped, EngineFailed, EventKinds };
  // How many events of each kind were handled before a command; its wait ends when one more is.
  struct Mark {
    uint32_t handled[EventKinds] = {};
  };
  Mark mark() const;
  void waitFor(const Mark& before, EventKind kind);

  HRESULT AddVideoRecordStream(IMFCaptureSource* source, IMFCaptureRecordSink* sink);
  HRESULT AddAudioRecordStream(IMFCaptureRecordSink* sink);

  std::atomic<uint32_t> handled_[EventKinds] = {};
  std::atomic<HRESULT> recordStartStatus_{S_OK};
  std::atomic<bool> failed_{false};  // the engine reported an error; its owner releases it
  Mark stopMark_;                    // events handled before a stop that is not waited for yet
  bool stopPending_ = false;
};

}  // namespace capture::video::camera::mfce
