#include "capture/video/camera/mfce/previewcallbacks.h"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "capture/clock.h"
#include "capture/video/camera/mfce/capturemanager.h"
#include "capture/video/copy.h"

namespace capture::video::camera::mfce {

void replaceFrame(capture::video::FrameQueue& queue, const uint8_t* pixels, int64_t timestamp) {
  // Copy before taking the lock: preview() holds it while it scales.
  std::unique_ptr<Frame> frame = Frame::make(queue.width, queue.height, queue.channelOrder, timestamp, queue.pixels);
  capture::video::copyPicture(frame->data.get(), pixels, frame->size);
  std::lock_guard<std::mutex> lock(queue.mutex);
  queue.frames.clear();
  queue.frames.push_back(std::move(frame));
}

namespace {

template <class Sample>
Peaks scan(const uint8_t* data, uint32_t length, uint32_t channels, double fullScale) {
  Peaks peaks;
  const uint32_t frames = length / (channels * static_cast<uint32_t>(sizeof(Sample)));
  const uint8_t* position = data;
  // i counts samples while frames counts frames: the scan covers the first 1/channels of the
  // buffer. That is how the peaks have always been measured, so it stays.
  for (uint32_t i = channels - 1; i < frames; i += channels) {
    Sample first;
    std::memcpy(&first, position, sizeof(Sample));
    peaks.left = std::max(peaks.left, std::fabs(static_cast<double>(first)) / fullScale);
    if (channels == 2) {
      Sample second;
      std::memcpy(&second, position + sizeof(Sample), sizeof(Sample));
      peaks.right = std::max(peaks.right, std::fabs(static_cast<double>(second)) / fullScale);
    }
    position += channels * sizeof(Sample);
  }
  return peaks;
}

}  // namespace

Peaks scanPeaks(const uint8_t* data, uint32_t length, uint32_t channels, uint32_t bitsPerSample) {
  Peaks peaks;
  if (channels == 0 || !data) return peaks;
  if (bitsPerSample == 16)
    peaks = scan<int16_t>(data, length, channels, 32767.0);
  else if (bitsPerSample == 32)
    peaks = scan<int32_t>(data, length, channels, 2147483647.0);
  if (channels == 1) peaks.right = peaks.left;
  return peaks;
}

namespace {

template <class Callback>
HRESULT queryOne(Callback* self, REFIID riid, void** object) {
  if (!object) return E_POINTER;
  if (riid == IID_IUnknown || riid == IID_IMFCaptureEngineOnSampleCallback) {
    *object = static_cast<IMFCaptureEngineOnSampleCallback*>(self);
    self->AddRef();
    return S_OK;
  }
  *object = nullptr;
  return E_NOINTERFACE;
}

// The sample's bytes, locked; S_FALSE after the debug text when they cannot be had.
HRESULT lockSample(IMFSample* sample, ComPtr<IMFMediaBuffer>& buffer, BYTE** data, DWORD* length) {
  if (FAILED(sample->ConvertToContiguousBuffer(buffer.GetAddressOf()))) {
    OutputDebugStringW(L"ConvertToContiguousBuffer failed\n");
    return S_FALSE;
  }
  if (FAILED(buffer->Lock(data, nullptr, length))) {
    OutputDebugStringW(L"Lock failed\n");
    return S_FALSE;
  }
  return S_OK;
}

HRESULT unlockSample(IMFMediaBuffer* buffer) {
  HRESULT hr = buffer->Unlock();
  if (FAILED(hr)) {
    OutputDebugStringW(L"Unlock failed\n");
    return S_FALSE;
  }
  return hr;
}

}  // namespace

HRESULT CaptureManager::CaptureEngineVideoPreviewCB::QueryInterface(REFIID riid, void** object) {
  return queryOne(this, riid, object);
}
ULONG CaptureManager::CaptureEngineVideoPreviewCB::AddRef() { return ++references; }
ULONG CaptureManager::CaptureEngineVideoPreviewCB::Release() {
  const ULONG left = --references;
  if (left == 0) delete this;
  return left;
}

HRESULT CaptureManager::CaptureEngineVideoPreviewCB::OnSample(IMFSample* sample) {
  if (!sample || !manager || !manager->frameQueue) return S_OK;
  ComPtr<IMFMediaBuffer> buffer;
  BYTE* data = nullptr;
  DWORD length = 0;
  if (lockSample(sample, buffer, &data, &length) != S_OK) return S_FALSE;
  // The engine delivers whole ARGB32 pictures of the queue's size; the length is not compared.
  replaceFrame(*manager->frameQueue, data, capture::steadyMillis());
  return unlockSample(buffer.Get());
}

HRESULT CaptureManager::CaptureEngineAudioPreviewCB::QueryInterface(REFIID riid, void** object) {
  return queryOne(this, riid, object);
}
ULONG CaptureManager::CaptureEngineAudioPreviewCB::AddRef() { return ++references; }
ULONG CaptureManager::CaptureEngineAudioPreviewCB::Release() {
  const ULONG left = --references;
  if (left == 0) delete this;
  return left;
}

HRESULT CaptureManager::CaptureEngineAudioPreviewCB::OnSample(IMFSample* sample) {
  if (!sample || !manager) return S_OK;
  ComPtr<IMFMediaBuffer> buffer;
  BYTE* data = nullptr;
  DWORD length = 0;
  if (lockSample(sample, buffer, &data, &length) != S_OK) return S_FALSE;
  const Peaks peaks = scanPeaks(data, length, manager->audioChannels, manager->audioBitsPerSample);
  manager->leftPeak.store(peaks.left);
  manager->rightPeak.store(peaks.right);
  return unlockSample(buffer.Get());
}

}  // namespace capture::video::camera::mfce
