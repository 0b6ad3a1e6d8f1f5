// A capture engine whose source reports a chosen device type and whose record and preview sinks
// remember what they were given, for the capture-engine manager's tests.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "fakes/com.h"
#include "platform/mfcapture.h"

namespace fakes {

class FakeCaptureSource : public ComObject<IMFCaptureSource, IID_IMFCaptureSource> {
 public:
  IMFMediaType* videoType = nullptr;  // borrowed; null: no such stream (and there is never an audio stream)

  HRESULT GetService(REFIID, REFIID, IUnknown**) override { return E_NOTIMPL; }
  HRESULT GetCurrentDeviceMediaType(DWORD stream, IMFMediaType** type) override {
    if (stream == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO || !videoType) return MF_E_INVALIDSTREAMNUMBER;
    videoType->AddRef();
    *type = videoType;
    return S_OK;
  }
};

// One object serves as the record sink and the preview sink.
class FakeSink : public ComObject<IMFCaptureRecordSink, IID_IMFCaptureSink, IID_IMFCaptureRecordSink> {
 public:
  ~FakeSink() override {
    for (IMFMediaType* type : added) type->Release();
  }
  std::vector<DWORD> sources;
  std::vector<IMFMediaType*> added;  // one reference each
  std::wstring fileName;
  int removeAllCalls = 0;
  HRESULT audioAnswer = S_OK;  // what AddStream answers for the audio stream

  HRESULT GetService(DWORD, REFGUID, REFIID, IUnknown**) override { return E_NOTIMPL; }
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    if (source == MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO && FAILED(audioAnswer)) return audioAnswer;
    sources.push_back(source);
    type->AddRef();
    added.push_back(type);
    *index = static_cast<DWORD>(added.size() - 1);
    return S_OK;
  }
  HRESULT RemoveAllStreams() override {
    ++removeAllCalls;
    return S_OK;
  }
  HRESULT SetOutputFileName(LPCWSTR name) override {
    fileName = name;
    return S_OK;
  }
  HRESULT SetSampleCallback(DWORD, IMFCaptureEngineOnSampleCallback*) override { return S_OK; }
};

class FakePreviewSink : public ComObject<IMFCapturePreviewSink, IID_IMFCaptureSink, IID_IMFCapturePreviewSink> {
 public:
  ~FakePreviewSink() override {
    for (IMFMediaType* type : added) type->Release();
    for (IMFCaptureEngineOnSampleCallback* callback : callbacks)
      if (callback) callback->Release();
  }
  std::vector<DWORD> sources;
  std::vector<IMFMediaType*> added;                          // one reference each
  std::vector<IMFCaptureEngineOnSampleCallback*> callbacks;  // by sink stream index, one reference each

  HRESULT GetService(DWORD, REFGUID, REFIID, IUnknown**) override { return E_NOTIMPL; }
  HRESULT AddStream(DWORD source, IMFMediaType* type, IMFAttributes*, DWORD* index) override {
    sources.push_back(source);
    type->AddRef();
    added.push_back(type);
    callbacks.push_back(nullptr);
    *index = static_cast<DWORD>(added.size() - 1);
    return S_OK;
  }
  HRESULT RemoveAllStreams() override { return E_NOTIMPL; }
  HRESULT SetRenderHandle(HANDLE) override { return E_NOTIMPL; }
  HRESULT SetSampleCallback(DWORD index, IMFCaptureEngineOnSampleCallback* callback) override {
    if (index >= callbacks.size()) return MF_E_INVALIDSTREAMNUMBER;
    if (callbacks[index]) callbacks[index]->Release();
    callback->AddRef();
    callbacks[index] = callback;
    return S_OK;
  }
};

class FakeCaptureEngine : public ComObject<IMFCaptureEngine, IID_IMFCaptureEngine> {
 public:
  FakeCaptureEngine() : source(new FakeCaptureSource), sink(new FakeSink), preview(new FakePreviewSink) {}
  ~FakeCaptureEngine() override {
    source->Release();
    sink->Release();
    preview->Release();
  }
  FakeCaptureSource* source;
  FakeSink* sink;  // the record sink
  FakePreviewSink* preview;
  int startRecordCalls = 0;
  int stopRecordCalls = 0;
  int getSinkCalls = 0;
  // How the engine answers a command: called with the event it would send (type and status);
  // unset, nothing is answered.
  std::function<void(const GUID&, HRESULT)> answer;
  HRESULT recordStartStatus = S_OK;  // the status of the record-started answer

  HRESULT Initialize(IMFCaptureEngineOnEventCallback*, IMFAttributes*, IUnknown*, IUnknown*) override { return S_OK; }
  HRESULT StartPreview() override { return answered(MF_CAPTURE_ENGINE_PREVIEW_STARTED, S_OK); }
  HRESULT StopPreview() override { return answered(MF_CAPTURE_ENGINE_PREVIEW_STOPPED, S_OK); }
  HRESULT StartRecord() override {
    ++startRecordCalls;
    return answered(MF_CAPTURE_ENGINE_RECORD_STARTED, recordStartStatus);
  }
  HRESULT StopRecord(BOOL, BOOL) override {
    ++stopRecordCalls;
    return answered(MF_CAPTURE_ENGINE_RECORD_STOPPED, S_OK);
  }
  HRESULT GetSink(MF_CAPTURE_ENGINE_SINK_TYPE type, IMFCaptureSink** result) override {
    ++getSinkCalls;
    IMFCaptureSink* chosen = type == MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW ? static_cast<IMFCaptureSink*>(preview)
                                                                         : static_cast<IMFCaptureSink*>(sink);
    chosen->AddRef();
    *result = chosen;
    return S_OK;
  }
  HRESULT GetSource(IMFCaptureSource** result) override {
    source->AddRef();
    *result = source;
    return S_OK;
  }

 private:
  HRESULT answered(const GUID& type, HRESULT status) {
    if (answer) answer(type, status);
    return S_OK;
  }
};

}  // namespace fakes
