// Linux declarations of the Media Foundation capture subset. Cameras are V4L2 devices (and, for
// tests, FFmpeg lavfi sources named in TAVIO_TEST_CAMERAS); microphones are PulseAudio sources
// that are not monitors. The engine reads them with libavdevice (mfcaptureengine.cc).
#pragma once

#include "platform/linux/mf.h"
#include "platform/linux/user32.h"

#include <string>

constexpr HRESULT MF_E_NO_CAPTURE_DEVICES_AVAILABLE = hresult(0xC00DABE0);
constexpr HRESULT MF_E_AUDIO_RECORDING_DEVICE_INVALIDATED = hresult(0xC00D3EA1);
constexpr HRESULT MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED = hresult(0xC00D3EA2);
constexpr HRESULT MF_E_CAPTURE_SOURCE_NO_VIDEO_STREAM_PRESENT = hresult(0xC00DABE7);
constexpr HRESULT MF_E_CAPTURE_SOURCE_NO_AUDIO_STREAM_PRESENT = hresult(0xC00DABE8);

enum _MFT_ENUM_FLAG : UINT32 {
  MFT_ENUM_FLAG_SYNCMFT = 0x1,
  MFT_ENUM_FLAG_ASYNCMFT = 0x2,
  MFT_ENUM_FLAG_HARDWARE = 0x4,
  MFT_ENUM_FLAG_FIELDOFUSE = 0x8,
  MFT_ENUM_FLAG_LOCALMFT = 0x10,
  MFT_ENUM_FLAG_TRANSCODE_ONLY = 0x20,
  MFT_ENUM_FLAG_SORTANDFILTER = 0x40,
  MFT_ENUM_FLAG_ALL = 0x3F,
};

// Engine events (extended types of the events handed to IMFCaptureEngineOnEventCallback).
inline constexpr GUID MF_CAPTURE_ENGINE_INITIALIZED = {
    0x219992bc, 0xcf92, 0x4531, {0xa1, 0xae, 0x96, 0xe1, 0xe8, 0x86, 0xc8, 0xf1}};
inline constexpr GUID MF_CAPTURE_ENGINE_PREVIEW_STARTED = {
    0xa416df21, 0xf9d3, 0x4a74, {0x99, 0x1b, 0xb8, 0x17, 0x29, 0x89, 0x52, 0xc4}};
inline constexpr GUID MF_CAPTURE_ENGINE_PREVIEW_STOPPED = {
    0x13d5143c, 0x1edd, 0x4e50, {0xa2, 0xef, 0x35, 0x0a, 0x47, 0x67, 0x80, 0x60}};
inline constexpr GUID MF_CAPTURE_ENGINE_RECORD_STARTED = {
    0xac2b027b, 0xddf9, 0x48a0, {0x89, 0xbe, 0x38, 0xab, 0x35, 0xef, 0x45, 0xc0}};
inline constexpr GUID MF_CAPTURE_ENGINE_RECORD_STOPPED = {
    0x55e5200a, 0xf98f, 0x4c0d, {0xa9, 0xec, 0x9e, 0xb2, 0x5e, 0xd3, 0xd7, 0x73}};
inline constexpr GUID MF_CAPTURE_ENGINE_PHOTO_TAKEN = {
    0x3c50c445, 0x7304, 0x48eb, {0x86, 0x5d, 0xbb, 0xa1, 0x9b, 0xa3, 0xaf, 0x5c}};
inline constexpr GUID MF_CAPTURE_ENGINE_ERROR = {
    0x46b89fc6, 0x33cc, 0x4399, {0x9d, 0xad, 0x78, 0x4d, 0xe7, 0x7d, 0x58, 0x7c}};

// Engine attributes.
inline constexpr GUID MF_CAPTURE_ENGINE_D3D_MANAGER = {
    0x76e25e7b, 0xd595, 0x4283, {0x96, 0x2c, 0xc5, 0x94, 0xaf, 0xd7, 0x8d, 0xdf}};
inline constexpr GUID MF_CAPTURE_ENGINE_USE_AUDIO_DEVICE_ONLY = {
    0x1c8077da, 0x8466, 0x4dc4, {0x8b, 0x8e, 0x27, 0x6b, 0x3f, 0x85, 0x92, 0x3b}};
inline constexpr GUID MF_CAPTURE_ENGINE_USE_VIDEO_DEVICE_ONLY = {
    0x7e025171, 0xcf32, 0x4f2e, {0x8f, 0x19, 0x41, 0x05, 0x77, 0xb7, 0x3a, 0x66}};

// Device enumeration.
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_FRIENDLY_NAME = {
    0x60d0e559, 0x52f8, 0x4fa2, {0xbb, 0xce, 0xac, 0xdb, 0x34, 0xa8, 0xec, 0x01}};
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE = {
    0xc60ac5fe, 0x252a, 0x478f, {0xa0, 0xef, 0xbc, 0x8f, 0xa5, 0xf7, 0xca, 0xd3}};
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID = {
    0x8ac3587a, 0x4ae7, 0x42d8, {0x99, 0xe0, 0x0a, 0x60, 0x13, 0xee, 0xf9, 0x0f}};
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_GUID = {
    0x14dd9a1c, 0x7cff, 0x41be, {0xb1, 0xb9, 0xba, 0x1a, 0xc6, 0xec, 0xb5, 0x71}};
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_SYMBOLIC_LINK = {
    0x58f0aad8, 0x22bf, 0x4f8a, {0xbb, 0x3d, 0xd2, 0xc4, 0x97, 0x8c, 0x6e, 0x2f}};
inline constexpr GUID MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_ENDPOINT_ID = {
    0x30da9258, 0xfeb9, 0x47a7, {0xa4, 0x53, 0x76, 0x3a, 0x7a, 0x8e, 0x1c, 0x5f}};

// Interfaces and classes.
inline constexpr GUID IID_IMFCaptureEngineOnEventCallback = {
    0xaeda51c0, 0x9025, 0x4983, {0x90, 0x12, 0xde, 0x59, 0x7b, 0x88, 0xb0, 0x89}};
inline constexpr GUID IID_IMFCaptureEngineOnSampleCallback = {
    0x52150b82, 0xab39, 0x4467, {0x98, 0x0f, 0xe4, 0x8b, 0xf0, 0x82, 0x2e, 0xcd}};
inline constexpr GUID IID_IMFCaptureSink = {
    0x72d6135b, 0x35e9, 0x412c, {0xb9, 0x26, 0xfd, 0x52, 0x65, 0xf2, 0xa8, 0x85}};
inline constexpr GUID IID_IMFCaptureRecordSink = {
    0x3323b55a, 0xf92a, 0x4fe2, {0x8e, 0xdc, 0xe9, 0xbf, 0xc0, 0x63, 0x4d, 0x77}};
inline constexpr GUID IID_IMFCapturePreviewSink = {
    0x77346cfd, 0x5b49, 0x4d73, {0xac, 0xe0, 0x5b, 0x52, 0xa8, 0x59, 0xf2, 0xe0}};
inline constexpr GUID IID_IMFCaptureSource = {
    0x439a42a8, 0x0d2c, 0x4505, {0xbe, 0x83, 0xf7, 0x9b, 0x2a, 0x05, 0xd5, 0xc4}};
inline constexpr GUID IID_IMFCaptureEngine = {
    0xa6bba433, 0x176b, 0x48b2, {0xb3, 0x75, 0x53, 0xaa, 0x03, 0x47, 0x32, 0x07}};
inline constexpr GUID IID_IMFCaptureEngineClassFactory = {
    0x8f02d140, 0x56fc, 0x4302, {0xa7, 0x05, 0x3a, 0x97, 0xc7, 0x8b, 0xe7, 0x79}};
inline constexpr GUID IID_IMFDXGIDeviceManager = {
    0xeb533d5d, 0x2db6, 0x40f8, {0x97, 0xa9, 0x49, 0x46, 0x92, 0x01, 0x4f, 0x07}};
inline constexpr GUID CLSID_MFCaptureEngine = {
    0xefce38d3, 0x8914, 0x4674, {0xa7, 0xdf, 0xae, 0x1b, 0x3d, 0x65, 0x4b, 0x8a}};
inline constexpr GUID CLSID_MFCaptureEngineClassFactory = {
    0xefce38d3, 0x8914, 0x4674, {0xa7, 0xdf, 0xae, 0x1b, 0x3d, 0x65, 0x4b, 0x8a}};

enum MF_CAPTURE_ENGINE_SINK_TYPE : DWORD {
  MF_CAPTURE_ENGINE_SINK_TYPE_RECORD = 0,
  MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW = 1,
  MF_CAPTURE_ENGINE_SINK_TYPE_PHOTO = 2,
};
enum : DWORD {
  MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW = 0xFFFFFFFA,
  MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD = 0xFFFFFFF9,
  MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_PHOTO = 0xFFFFFFF8,
  MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO = 0xFFFFFFF7,
  MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_METADATA = 0xFFFFFFF6,
  MF_CAPTURE_ENGINE_MEDIASOURCE = 0xFFFFFFFF,
};

struct IMFCaptureEngineOnEventCallback : IUnknown {
  virtual HRESULT OnEvent(IMFMediaEvent* event) = 0;
};

struct IMFCaptureEngineOnSampleCallback : IUnknown {
  virtual HRESULT OnSample(IMFSample* sample) = 0;
};

struct IMFCaptureSink : IUnknown {
  virtual HRESULT GetService(DWORD sinkStreamIndex, REFGUID service, REFIID riid, IUnknown** object) = 0;
  virtual HRESULT AddStream(DWORD sourceStreamIndex, IMFMediaType* mediaType, IMFAttributes* attributes,
                            DWORD* sinkStreamIndex) = 0;
  virtual HRESULT RemoveAllStreams() = 0;
};

struct IMFCaptureRecordSink : IMFCaptureSink {
  virtual HRESULT SetOutputFileName(LPCWSTR fileName) = 0;
  virtual HRESULT SetSampleCallback(DWORD sinkStreamIndex, IMFCaptureEngineOnSampleCallback* callback) = 0;
};

struct IMFCapturePreviewSink : IMFCaptureSink {
  virtual HRESULT SetRenderHandle(HANDLE handle) = 0;
  virtual HRESULT SetSampleCallback(DWORD sinkStreamIndex, IMFCaptureEngineOnSampleCallback* callback) = 0;
};

struct IMFCaptureSource : IUnknown {
  virtual HRESULT GetService(REFIID service, REFIID riid, IUnknown** object) = 0;
  virtual HRESULT GetCurrentDeviceMediaType(DWORD sourceStreamIndex, IMFMediaType** mediaType) = 0;
};

struct IMFCaptureEngine : IUnknown {
  virtual HRESULT Initialize(IMFCaptureEngineOnEventCallback* eventCallback, IMFAttributes* attributes,
                             IUnknown* audioSource, IUnknown* videoSource) = 0;
  virtual HRESULT StartPreview() = 0;
  virtual HRESULT StopPreview() = 0;
  virtual HRESULT StartRecord() = 0;
  virtual HRESULT StopRecord(BOOL finalize, BOOL flushUnprocessedSamples) = 0;
  virtual HRESULT GetSink(MF_CAPTURE_ENGINE_SINK_TYPE type, IMFCaptureSink** sink) = 0;
  virtual HRESULT GetSource(IMFCaptureSource** source) = 0;
};

struct IMFCaptureEngineClassFactory : IUnknown {
  virtual HRESULT CreateInstance(REFCLSID clsid, REFIID riid, LPVOID* object) = 0;
};

struct IMFDXGIDeviceManager : IUnknown {
  virtual HRESULT ResetDevice(IUnknown* device, UINT resetToken) = 0;
};

HRESULT MFEnumDeviceSources(IMFAttributes* attributes, IMFActivate*** devices, UINT32* count);
HRESULT MFCreateDXGIDeviceManager(UINT* resetToken, IMFDXGIDeviceManager** manager);
HRESULT MFTranscodeGetAudioOutputAvailableTypes(REFGUID subtype, DWORD flags, IMFAttributes* codecConfig,
                                                IMFCollection** types);

namespace platform {

// The capture engine's class factory, for the class table of CoCreateInstance.
HRESULT createCaptureEngineClassFactory(REFIID riid, void** object);

// Attributes of our device objects beyond the SDK's: a microphone's rate and channel count.
inline constexpr GUID deviceAudioRate = {0x7d1c2a40, 0x5b3e, 0x4c61, {0x9f, 0x20, 0x3a, 0x11, 0x6e, 0x52, 0x90, 0x01}};
inline constexpr GUID deviceAudioChannels = {
    0x7d1c2a40, 0x5b3e, 0x4c61, {0x9f, 0x20, 0x3a, 0x11, 0x6e, 0x52, 0x90, 0x02}};

// Makes a device object with the given category, friendly name and link (the symbolic link of a
// camera, e.g. "v4l2:/dev/video0", "lavfi:testsrc2=size=640x480:rate=30", or, for a test camera
// that sends H.264 as it encodes it itself, "lavfi:h264:testsrc2=size=640x480:rate=30"; the
// PulseAudio source name of a microphone).
HRESULT createDeviceActivate(REFGUID category, const std::wstring& friendlyName, const std::wstring& link,
                             IMFActivate** activate);

}  // namespace platform
