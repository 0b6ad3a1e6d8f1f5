// Linux declarations of the Multimedia Device API and WASAPI subset. A playback endpoint is a
// PulseAudio sink; loopback capture records the sink's monitor source and the render client plays
// into the sink (wasapi.cc, pulse.cc). Names, signatures, GUIDs and codes are the Windows ones.
#pragma once

#include "platform/linux/com.h"
#include "platform/wave.h"

using LPCGUID = const GUID*;
using REFPROPVARIANT = const PROPVARIANT&;

constexpr DWORD ERROR_NOT_FOUND = 1168;

enum EDataFlow { eRender = 0, eCapture = 1, eAll = 2, EDataFlow_enum_count = 3 };
enum ERole { eConsole = 0, eMultimedia = 1, eCommunications = 2, ERole_enum_count = 3 };

constexpr DWORD DEVICE_STATE_ACTIVE = 0x1;
constexpr DWORD DEVICE_STATEMASK_ALL = 0xF;

constexpr DWORD STGM_READ = 0x0;

enum AUDCLNT_SHAREMODE { AUDCLNT_SHAREMODE_SHARED = 0, AUDCLNT_SHAREMODE_EXCLUSIVE = 1 };

constexpr DWORD AUDCLNT_STREAMFLAGS_CROSSPROCESS = 0x00010000;
constexpr DWORD AUDCLNT_STREAMFLAGS_LOOPBACK = 0x00020000;
constexpr DWORD AUDCLNT_STREAMFLAGS_EVENTCALLBACK = 0x00040000;
constexpr DWORD AUDCLNT_STREAMFLAGS_NOPERSIST = 0x00080000;

enum _AUDCLNT_BUFFERFLAGS {
  AUDCLNT_BUFFERFLAGS_DATA_DISCONTINUITY = 0x1,
  AUDCLNT_BUFFERFLAGS_SILENT = 0x2,
  AUDCLNT_BUFFERFLAGS_TIMESTAMP_ERROR = 0x4,
};

// Facility 2185 (0x889).
constexpr HRESULT audclntError(uint32_t n) { return hresult(0x88890000u | n); }
constexpr HRESULT audclntSuccess(uint32_t n) { return hresult(0x08890000u | n); }
constexpr HRESULT AUDCLNT_E_NOT_INITIALIZED = audclntError(0x1);
constexpr HRESULT AUDCLNT_E_ALREADY_INITIALIZED = audclntError(0x2);
constexpr HRESULT AUDCLNT_E_WRONG_ENDPOINT_TYPE = audclntError(0x3);
constexpr HRESULT AUDCLNT_E_DEVICE_INVALIDATED = audclntError(0x4);
constexpr HRESULT AUDCLNT_E_NOT_STOPPED = audclntError(0x5);
constexpr HRESULT AUDCLNT_E_BUFFER_TOO_LARGE = audclntError(0x6);
constexpr HRESULT AUDCLNT_E_OUT_OF_ORDER = audclntError(0x7);
constexpr HRESULT AUDCLNT_E_UNSUPPORTED_FORMAT = audclntError(0x8);
constexpr HRESULT AUDCLNT_E_INVALID_SIZE = audclntError(0x9);
constexpr HRESULT AUDCLNT_E_BUFFER_OPERATION_PENDING = audclntError(0xB);
constexpr HRESULT AUDCLNT_E_EXCLUSIVE_MODE_NOT_ALLOWED = audclntError(0xE);
constexpr HRESULT AUDCLNT_E_SERVICE_NOT_RUNNING = audclntError(0x10);
constexpr HRESULT AUDCLNT_S_BUFFER_EMPTY = audclntSuccess(0x1);

inline constexpr GUID CLSID_MMDeviceEnumerator = {
    0xBCDE0395, 0xE52F, 0x467C, {0x8E, 0x3D, 0xC4, 0x57, 0x92, 0x91, 0x69, 0x2E}};
inline constexpr GUID IID_IMMDeviceEnumerator = {
    0xA95664D2, 0x9614, 0x4F35, {0xA7, 0x46, 0xDE, 0x8D, 0xB6, 0x36, 0x17, 0xE6}};
inline constexpr GUID IID_IMMDevice = {0xD666063F, 0x1587, 0x4E43, {0x81, 0xF1, 0xB9, 0x48, 0xE8, 0x07, 0x36, 0x3F}};
inline constexpr GUID IID_IMMDeviceCollection = {
    0x0BD7A1BE, 0x7A1A, 0x44DB, {0x83, 0x97, 0xCC, 0x53, 0x92, 0x38, 0x7B, 0x5E}};
inline constexpr GUID IID_IPropertyStore = {
    0x886D8EEB, 0x8CF2, 0x4446, {0x8D, 0x02, 0xCD, 0xBA, 0x1D, 0xBD, 0xCF, 0x99}};
inline constexpr GUID IID_IAudioClient = {0x1CB9AD4C, 0xDBFA, 0x4C32, {0xB1, 0x78, 0xC2, 0xF5, 0x68, 0xA7, 0x03, 0xB2}};
inline constexpr GUID IID_IAudioCaptureClient = {
    0xC8ADBD64, 0xE71E, 0x48A0, {0xA4, 0xDE, 0x18, 0x5C, 0x39, 0x5C, 0xD3, 0x17}};
inline constexpr GUID IID_IAudioRenderClient = {
    0xF294ACFC, 0x3146, 0x4483, {0xA7, 0xBF, 0xAD, 0xDC, 0xA7, 0xC2, 0x60, 0xE2}};

inline constexpr PROPERTYKEY PKEY_Device_FriendlyName = {
    {0xA45C254E, 0xDF1C, 0x4EFD, {0x80, 0x20, 0x67, 0xD1, 0x46, 0xA8, 0x50, 0xE0}}, 14};

struct IPropertyStore : IUnknown {
  virtual HRESULT GetCount(DWORD* count) = 0;
  virtual HRESULT GetValue(REFPROPERTYKEY key, PROPVARIANT* value) = 0;
};

struct IMMDevice : IUnknown {
  virtual HRESULT Activate(REFIID iid, DWORD context, PROPVARIANT* activationParams, void** object) = 0;
  virtual HRESULT OpenPropertyStore(DWORD access, IPropertyStore** properties) = 0;
  virtual HRESULT GetId(LPWSTR* id) = 0;
};

struct IMMDeviceCollection : IUnknown {
  virtual HRESULT GetCount(UINT* count) = 0;
  virtual HRESULT Item(UINT index, IMMDevice** device) = 0;
};

struct IMMDeviceEnumerator : IUnknown {
  virtual HRESULT EnumAudioEndpoints(EDataFlow dataFlow, DWORD stateMask, IMMDeviceCollection** devices) = 0;
  virtual HRESULT GetDefaultAudioEndpoint(EDataFlow dataFlow, ERole role, IMMDevice** endpoint) = 0;
};

struct IAudioClient : IUnknown {
  virtual HRESULT Initialize(AUDCLNT_SHAREMODE shareMode, DWORD streamFlags, REFERENCE_TIME bufferDuration,
                             REFERENCE_TIME periodicity, const WAVEFORMATEX* format, LPCGUID sessionGuid) = 0;
  virtual HRESULT GetBufferSize(UINT32* bufferFrames) = 0;
  virtual HRESULT GetCurrentPadding(UINT32* paddingFrames) = 0;
  virtual HRESULT IsFormatSupported(AUDCLNT_SHAREMODE shareMode, const WAVEFORMATEX* format,
                                    WAVEFORMATEX** closestMatch) = 0;
  virtual HRESULT GetMixFormat(WAVEFORMATEX** deviceFormat) = 0;
  virtual HRESULT Start() = 0;
  virtual HRESULT Reset() = 0;
  virtual HRESULT GetService(REFIID riid, void** object) = 0;
};

struct IAudioCaptureClient : IUnknown {
  virtual HRESULT GetBuffer(BYTE** data, UINT32* framesToRead, DWORD* flags, UINT64* devicePosition,
                            UINT64* qpcPosition) = 0;
  virtual HRESULT ReleaseBuffer(UINT32 framesRead) = 0;
};

struct IAudioRenderClient : IUnknown {
  virtual HRESULT GetBuffer(UINT32 framesRequested, BYTE** data) = 0;
  virtual HRESULT ReleaseBuffer(UINT32 framesWritten, DWORD flags) = 0;
};

namespace platform::wasapi {

// The factory of CLSID_MMDeviceEnumerator in the class table.
HRESULT createDeviceEnumerator(REFIID riid, void** object);

}  // namespace platform::wasapi
