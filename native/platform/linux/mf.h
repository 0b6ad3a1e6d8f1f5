// Linux declarations of the Media Foundation subset: the interfaces with the SDK's method lists
// in the SDK's order, its GUID values and its codes. The objects live in mfattributes.cc,
// mfbuffer.cc and sinkwriter.cc; start-up counting in mfstartup.cc. The sink writer encodes
// through FFmpeg on the caller's thread.
#pragma once

#include "platform/linux/com.h"
#include "platform/linux/wave.h"

// Start-up.
constexpr ULONG MF_SDK_VERSION = 0x0002;
constexpr ULONG MF_API_VERSION = 0x0070;
constexpr ULONG MF_VERSION = (MF_SDK_VERSION << 16) | MF_API_VERSION;  // 0x20070
constexpr DWORD MFSTARTUP_NOSOCKET = 0x1;
constexpr DWORD MFSTARTUP_LITE = MFSTARTUP_NOSOCKET;
constexpr DWORD MFSTARTUP_FULL = 0;

HRESULT MFStartup(ULONG version, DWORD flags = MFSTARTUP_FULL);
HRESULT MFShutdown();

// Codes.
constexpr HRESULT MF_E_PLATFORM_NOT_INITIALIZED = hresult(0xC00D36B0);
constexpr HRESULT MF_E_BUFFERTOOSMALL = hresult(0xC00D36B1);
constexpr HRESULT MF_E_INVALIDREQUEST = hresult(0xC00D36B2);
constexpr HRESULT MF_E_INVALIDSTREAMNUMBER = hresult(0xC00D36B3);
constexpr HRESULT MF_E_INVALIDMEDIATYPE = hresult(0xC00D36B4);
constexpr HRESULT MF_E_NOT_INITIALIZED = hresult(0xC00D36B6);
constexpr HRESULT MF_E_UNSUPPORTED_SERVICE = hresult(0xC00D36BA);
constexpr HRESULT MF_E_INVALIDTYPE = hresult(0xC00D36BD);
constexpr HRESULT MF_E_UNSUPPORTED_BYTESTREAM_TYPE = hresult(0xC00D36C4);
constexpr HRESULT MF_E_NO_SAMPLE_TIMESTAMP = hresult(0xC00D36C8);
constexpr HRESULT MF_E_NO_SAMPLE_DURATION = hresult(0xC00D36C9);
constexpr HRESULT MF_E_INVALID_STREAM_DATA = hresult(0xC00D36CB);
constexpr HRESULT MF_E_BAD_STARTUP_VERSION = hresult(0xC00D36E3);
constexpr HRESULT MF_E_ATTRIBUTENOTFOUND = hresult(0xC00D36E6);
constexpr HRESULT MF_E_SINK_NO_SAMPLES_PROCESSED = hresult(0xC00D4A44);
constexpr HRESULT MF_E_TOPO_CODEC_NOT_FOUND = hresult(0xC00D5212);
constexpr HRESULT MF_E_TRANSFORM_TYPE_NOT_SET = hresult(0xC00D6D60);

using REFPROPVARIANT = const PROPVARIANT&;
using UINT8 = uint8_t;

enum MFVideoInterlaceMode : DWORD {
  MFVideoInterlace_Unknown = 0,
  MFVideoInterlace_Progressive = 2,
  MFVideoInterlace_FieldInterleavedUpperFirst = 3,
  MFVideoInterlace_FieldInterleavedLowerFirst = 4,
  MFVideoInterlace_FieldSingleUpper = 5,
  MFVideoInterlace_FieldSingleLower = 6,
  MFVideoInterlace_MixedInterlaceOrProgressive = 7,
};
enum eAVEncH264VProfile : DWORD {
  eAVEncH264VProfile_unknown = 0,
  eAVEncH264VProfile_Simple = 66,
  eAVEncH264VProfile_Base = 66,
  eAVEncH264VProfile_Main = 77,
  eAVEncH264VProfile_High = 100,
  eAVEncH264VProfile_ConstrainedBase = 256,
};

// Interface ids.
inline constexpr GUID IID_IMFAttributes = {
    0x2cd2d921, 0xc447, 0x44a7, {0xa1, 0x3c, 0x4a, 0xda, 0xbf, 0xc2, 0x47, 0xe3}};
inline constexpr GUID IID_IMFMediaType = {0x44ae0fa8, 0xea31, 0x4109, {0x8d, 0x2e, 0x4c, 0xae, 0x49, 0x97, 0xc5, 0x55}};
inline constexpr GUID IID_IMFMediaBuffer = {
    0x045fa593, 0x8799, 0x42b8, {0xbc, 0x8d, 0x89, 0x68, 0xc6, 0x45, 0x35, 0x07}};
inline constexpr GUID IID_IMFSample = {0xc40a00f2, 0xb93a, 0x4d80, {0xae, 0x8c, 0x5a, 0x1c, 0x63, 0x4f, 0x58, 0xe4}};
inline constexpr GUID IID_IMFCollection = {
    0x5bc8a76b, 0x869a, 0x46a3, {0x9b, 0x03, 0xfa, 0x21, 0x8a, 0x66, 0xae, 0xbe}};
inline constexpr GUID IID_IMFActivate = {0x7fee9e9a, 0x4a89, 0x47a6, {0x89, 0x9c, 0xb6, 0xa5, 0x3a, 0x70, 0xfb, 0x67}};
inline constexpr GUID IID_IMFMediaEvent = {
    0xdf598932, 0xf10c, 0x4e39, {0xbb, 0xa2, 0xc3, 0x08, 0xf1, 0x01, 0xda, 0xa3}};
inline constexpr GUID IID_IMFSinkWriter = {
    0x3137f1cd, 0xfe5e, 0x4805, {0xa5, 0xd8, 0xfb, 0x47, 0x74, 0x48, 0xcb, 0x3d}};

struct IMFAttributes : IUnknown {
  virtual HRESULT GetUINT32(REFGUID key, UINT32* value) = 0;
  virtual HRESULT GetUINT64(REFGUID key, UINT64* value) = 0;
  virtual HRESULT GetGUID(REFGUID key, GUID* value) = 0;
  virtual HRESULT GetAllocatedString(REFGUID key, LPWSTR* value, UINT32* length) = 0;
  virtual HRESULT GetBlobSize(REFGUID key, UINT32* size) = 0;
  virtual HRESULT GetBlob(REFGUID key, UINT8* buffer, UINT32 bufferSize, UINT32* size) = 0;
  virtual HRESULT SetItem(REFGUID key, REFPROPVARIANT value) = 0;
  virtual HRESULT DeleteItem(REFGUID key) = 0;
  virtual HRESULT DeleteAllItems() = 0;
  virtual HRESULT SetUINT32(REFGUID key, UINT32 value) = 0;
  virtual HRESULT SetUINT64(REFGUID key, UINT64 value) = 0;
  virtual HRESULT SetGUID(REFGUID key, REFGUID value) = 0;
  virtual HRESULT SetString(REFGUID key, LPCWSTR value) = 0;
  virtual HRESULT SetBlob(REFGUID key, const UINT8* buffer, UINT32 size) = 0;
  virtual HRESULT SetUnknown(REFGUID key, IUnknown* value) = 0;
  virtual HRESULT GetCount(UINT32* count) = 0;
  virtual HRESULT CopyAllItems(IMFAttributes* destination) = 0;
};

struct IMFMediaType : IMFAttributes {
  virtual HRESULT GetMajorType(GUID* majorType) = 0;
};

struct IMFMediaBuffer : IUnknown {
  virtual HRESULT Lock(BYTE** buffer, DWORD* maxLength, DWORD* currentLength) = 0;
  virtual HRESULT Unlock() = 0;
  virtual HRESULT GetCurrentLength(DWORD* length) = 0;
  virtual HRESULT SetCurrentLength(DWORD length) = 0;
  virtual HRESULT GetMaxLength(DWORD* length) = 0;
};

struct IMFSample : IMFAttributes {
  virtual HRESULT GetSampleTime(LONGLONG* time) = 0;
  virtual HRESULT SetSampleTime(LONGLONG time) = 0;
  virtual HRESULT GetSampleDuration(LONGLONG* duration) = 0;
  virtual HRESULT SetSampleDuration(LONGLONG duration) = 0;
  virtual HRESULT GetBufferCount(DWORD* count) = 0;
  virtual HRESULT GetBufferByIndex(DWORD index, IMFMediaBuffer** buffer) = 0;
  virtual HRESULT ConvertToContiguousBuffer(IMFMediaBuffer** buffer) = 0;
  virtual HRESULT AddBuffer(IMFMediaBuffer* buffer) = 0;
};

struct IMFCollection : IUnknown {
  virtual HRESULT GetElement(DWORD index, IUnknown** element) = 0;
  virtual HRESULT AddElement(IUnknown* element) = 0;
};

// Declared here as the SDK's mfobjects.h does; the capture family makes the objects.
struct IMFActivate : IMFAttributes {};

struct IMFMediaEvent : IMFAttributes {
  virtual HRESULT GetExtendedType(GUID* extendedType) = 0;
  virtual HRESULT GetStatus(HRESULT* status) = 0;
  virtual HRESULT GetValue(PROPVARIANT* value) = 0;
};

struct IMFByteStream;  // not provided: the sink writer is always made from a URL

struct IMFSinkWriter : IUnknown {
  virtual HRESULT AddStream(IMFMediaType* targetMediaType, DWORD* streamIndex) = 0;
  virtual HRESULT SetInputMediaType(DWORD streamIndex, IMFMediaType* inputMediaType,
                                    IMFAttributes* encodingParameters) = 0;
  virtual HRESULT BeginWriting() = 0;
  virtual HRESULT WriteSample(DWORD streamIndex, IMFSample* sample) = 0;
  virtual HRESULT Finalize() = 0;
};

HRESULT MFCreateAttributes(IMFAttributes** attributes, UINT32 initialSize);
HRESULT MFCreateMediaType(IMFMediaType** mediaType);
HRESULT MFCreateMemoryBuffer(DWORD maxLength, IMFMediaBuffer** buffer);
HRESULT MFCreateSample(IMFSample** sample);
HRESULT MFCreateCollection(IMFCollection** collection);
HRESULT MFCreateSinkWriterFromURL(LPCWSTR url, IMFByteStream* byteStream, IMFAttributes* attributes,
                                  IMFSinkWriter** sinkWriter);
HRESULT MFInitMediaTypeFromWaveFormatEx(IMFMediaType* mediaType, const WAVEFORMATEX* format, UINT32 size);

// Packed pairs: the first value in the upper 32 bits, the second in the lower.
inline HRESULT MFSetAttributeSize(IMFAttributes* attributes, REFGUID key, UINT32 width, UINT32 height) {
  return attributes->SetUINT64(key, (static_cast<UINT64>(width) << 32) | height);
}
inline HRESULT MFSetAttributeRatio(IMFAttributes* attributes, REFGUID key, UINT32 numerator, UINT32 denominator) {
  return attributes->SetUINT64(key, (static_cast<UINT64>(numerator) << 32) | denominator);
}
inline HRESULT MFGetAttributeSize(IMFAttributes* attributes, REFGUID key, UINT32* width, UINT32* height) {
  UINT64 packed = 0;
  HRESULT hr = attributes->GetUINT64(key, &packed);
  if (SUCCEEDED(hr)) {
    *width = static_cast<UINT32>(packed >> 32);
    *height = static_cast<UINT32>(packed);
  }
  return hr;
}

namespace platform {
// The GUID of a wave format tag or FOURCC in the base {xxxxxxxx-0000-0010-8000-00AA00389B71},
// as the SDK builds its media subtypes.
constexpr GUID mediaSubtype(uint32_t tag) {
  return {tag, 0x0000, 0x0010, {0x80, 0x00, 0x00, 0xAA, 0x00, 0x38, 0x9B, 0x71}};
}
constexpr uint32_t fourcc(char a, char b, char c, char d) {
  return static_cast<uint32_t>(static_cast<uint8_t>(a)) | (static_cast<uint32_t>(static_cast<uint8_t>(b)) << 8) |
         (static_cast<uint32_t>(static_cast<uint8_t>(c)) << 16) |
         (static_cast<uint32_t>(static_cast<uint8_t>(d)) << 24);
}
}  // namespace platform

// Media type attributes.
inline constexpr GUID MF_MT_MAJOR_TYPE = {0x48eba18e, 0xf8c9, 0x4687, {0xbf, 0x11, 0x0a, 0x74, 0xc9, 0xf9, 0x6a, 0x8f}};
inline constexpr GUID MF_MT_SUBTYPE = {0xf7e34c9a, 0x42e8, 0x4714, {0xb7, 0x4b, 0xcb, 0x29, 0xd7, 0x2c, 0x35, 0xe5}};
inline constexpr GUID MF_MT_ALL_SAMPLES_INDEPENDENT = {
    0xc9173739, 0x5e56, 0x461c, {0xb7, 0x13, 0x46, 0xfb, 0x99, 0x5c, 0xb9, 0x5f}};
inline constexpr GUID MF_MT_USER_DATA = {0xb6bc765f, 0x4c3b, 0x40a4, {0xbd, 0x51, 0x25, 0x35, 0xb6, 0x6f, 0xe0, 0x9d}};
inline constexpr GUID MF_MT_AVG_BITRATE = {
    0x20332624, 0xfb0d, 0x4d9e, {0xbd, 0x0d, 0xcb, 0xf6, 0x78, 0x6c, 0x10, 0x2e}};
inline constexpr GUID MF_MT_INTERLACE_MODE = {
    0xe2724bb8, 0xe676, 0x4806, {0xb4, 0xb2, 0xa8, 0xd6, 0xef, 0xb4, 0x4c, 0xcd}};
inline constexpr GUID MF_MT_FRAME_SIZE = {0x1652c33d, 0xd6b2, 0x4012, {0xb8, 0x34, 0x72, 0x03, 0x08, 0x49, 0xa3, 0x7d}};
inline constexpr GUID MF_MT_FRAME_RATE = {0xc459a2e8, 0x3d2c, 0x4e44, {0xb1, 0x32, 0xfe, 0xe5, 0x15, 0x6c, 0x7b, 0xb0}};
inline constexpr GUID MF_MT_PIXEL_ASPECT_RATIO = {
    0xc6376a1e, 0x8d0a, 0x4027, {0xbe, 0x45, 0x6d, 0x9a, 0x0a, 0xd3, 0x9b, 0xb6}};
inline constexpr GUID MF_MT_MPEG2_PROFILE = {
    0xad76a80b, 0x2d5c, 0x4e0b, {0xb3, 0x75, 0x64, 0xe5, 0x20, 0x13, 0x70, 0x36}};
inline constexpr GUID MF_MT_MPEG_SEQUENCE_HEADER = {
    0x3c036de7, 0x3ad0, 0x4c9e, {0x92, 0x16, 0xee, 0x6d, 0x6a, 0xc2, 0x1c, 0xb3}};
inline constexpr GUID MF_MT_DEFAULT_STRIDE = {
    0x644b4e48, 0x1e02, 0x4516, {0xb0, 0xeb, 0xc0, 0x1c, 0xa9, 0xd4, 0x9a, 0xc6}};
inline constexpr GUID MF_MT_AUDIO_BITS_PER_SAMPLE = {
    0xf2deb57f, 0x40fa, 0x4764, {0xaa, 0x33, 0xed, 0x4f, 0x2d, 0x1f, 0xf6, 0x69}};
inline constexpr GUID MF_MT_AUDIO_SAMPLES_PER_SECOND = {
    0x5faeeae7, 0x0290, 0x4c31, {0x9e, 0x8a, 0xc5, 0x34, 0xf6, 0x8d, 0x9d, 0xba}};
inline constexpr GUID MF_MT_AUDIO_NUM_CHANNELS = {
    0x37e48bf5, 0x645e, 0x4c5b, {0x89, 0xde, 0xad, 0xa9, 0xe2, 0x9b, 0x69, 0x6a}};
inline constexpr GUID MF_MT_AUDIO_AVG_BYTES_PER_SECOND = {
    0x1aab75c8, 0xcfef, 0x451c, {0xab, 0x95, 0xac, 0x03, 0x4b, 0x8e, 0x17, 0x31}};
inline constexpr GUID MF_MT_AUDIO_BLOCK_ALIGNMENT = {
    0x322de230, 0x9eeb, 0x43bd, {0xab, 0x7a, 0xff, 0x41, 0x22, 0x51, 0x54, 0x1d}};
inline constexpr GUID MF_MT_AUDIO_CHANNEL_MASK = {
    0x55fb5765, 0x644a, 0x4caf, {0x84, 0x79, 0x93, 0x89, 0x83, 0xbb, 0x15, 0x88}};
inline constexpr GUID MF_MT_AUDIO_VALID_BITS_PER_SAMPLE = {
    0xd9bf8d6a, 0x9530, 0x4b7c, {0x9d, 0xdf, 0xff, 0x6f, 0xd5, 0x8b, 0xbd, 0x06}};
inline constexpr GUID MF_MT_AUDIO_PREFER_WAVEFORMATEX = {
    0xa901aaba, 0xe037, 0x458a, {0xbd, 0xf6, 0x54, 0x5b, 0xe2, 0x07, 0x40, 0x42}};
inline constexpr GUID MF_MT_AAC_PAYLOAD_TYPE = {
    0xbfbabe79, 0x7434, 0x4d1c, {0x94, 0xf0, 0x72, 0xa3, 0xb9, 0xe1, 0x71, 0x88}};
inline constexpr GUID MF_MT_AAC_AUDIO_PROFILE_LEVEL_INDICATION = {
    0x7632f0e6, 0x9538, 0x4d61, {0xac, 0xda, 0xea, 0x29, 0xc8, 0xc1, 0x44, 0x56}};

// Sample attributes.
inline constexpr GUID MFSampleExtension_CleanPoint = {
    0x9cdf01d8, 0xa0f0, 0x43ba, {0xb0, 0x77, 0xea, 0xa0, 0x6c, 0xbd, 0x72, 0x8a}};

// Sink writer and transcode attributes.
inline constexpr GUID MF_LOW_LATENCY = {0x9c27891a, 0xed7a, 0x40e1, {0x88, 0xe8, 0xb2, 0x27, 0x27, 0xa0, 0x24, 0xee}};
inline constexpr GUID MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS = {
    0xa634a91c, 0x822b, 0x41b9, {0xa4, 0x94, 0x4d, 0xe4, 0x64, 0x36, 0x12, 0xb0}};
inline constexpr GUID MF_SINK_WRITER_DISABLE_THROTTLING = {
    0x08b845d8, 0x2b74, 0x4afe, {0x9d, 0x53, 0xbe, 0x16, 0xd2, 0xd5, 0xae, 0x4f}};
inline constexpr GUID MF_TRANSCODE_CONTAINERTYPE = {
    0x150ff23f, 0x4abc, 0x478b, {0xac, 0x4f, 0xe1, 0x91, 0x6f, 0xba, 0x1c, 0xca}};
inline constexpr GUID MFTranscodeContainerType_ASF = {
    0x430f6f6e, 0xb6bf, 0x4fc1, {0xa0, 0xbd, 0x9e, 0xe4, 0x6e, 0xee, 0x2a, 0xfb}};
inline constexpr GUID MFTranscodeContainerType_MPEG4 = {
    0xdc6cd05d, 0xb9d0, 0x40ef, {0xbd, 0x35, 0xfa, 0x62, 0x2c, 0x1a, 0xb2, 0x8a}};
inline constexpr GUID MFTranscodeContainerType_MP3 = {
    0xe438b912, 0x83f1, 0x4de6, {0x9e, 0x3a, 0x9f, 0xfb, 0xc6, 0xdd, 0x24, 0xd1}};
inline constexpr GUID MFTranscodeContainerType_3GP = {
    0x34c50167, 0x4472, 0x4f34, {0x9e, 0xa0, 0xc4, 0x9f, 0xba, 0xcf, 0x03, 0x7d}};
inline constexpr GUID MFTranscodeContainerType_AC3 = {
    0x6d8d91c3, 0x8c91, 0x4ed1, {0x87, 0x42, 0x8c, 0x34, 0x7d, 0x5b, 0x44, 0xd0}};
inline constexpr GUID MFTranscodeContainerType_ADTS = {
    0x132fd27d, 0x0f02, 0x43de, {0xa3, 0x01, 0x38, 0xfb, 0xbb, 0xb3, 0x83, 0x4e}};
inline constexpr GUID MFTranscodeContainerType_MPEG2 = {
    0xbfc2dbf9, 0x7bb4, 0x4f8f, {0xaf, 0xde, 0xe1, 0x12, 0xc4, 0x4b, 0xa8, 0x82}};
inline constexpr GUID MFTranscodeContainerType_WAVE = {
    0x64c3453c, 0x0f26, 0x4741, {0xbe, 0x63, 0x87, 0xbd, 0xf8, 0xbb, 0x93, 0x5b}};
inline constexpr GUID MFTranscodeContainerType_FMPEG4 = {
    0x9ba876f1, 0x419f, 0x4b77, {0xa1, 0xe0, 0x35, 0x95, 0x9d, 0x9d, 0x40, 0x04}};
inline constexpr GUID MFTranscodeContainerType_AMR = {
    0x025d5ad3, 0x621a, 0x475b, {0x96, 0x4d, 0x66, 0xb1, 0xc8, 0x24, 0xf0, 0x79}};

// Major types.
inline constexpr GUID MFMediaType_Audio = platform::mediaSubtype(0x73647561);  // 'auds'
inline constexpr GUID MFMediaType_Video = platform::mediaSubtype(0x73646976);  // 'vids'

// Video subtypes (D3DFMT values or FOURCCs in the base GUID).
inline constexpr GUID MFVideoFormat_RGB32 = platform::mediaSubtype(22);   // D3DFMT_X8R8G8B8
inline constexpr GUID MFVideoFormat_ARGB32 = platform::mediaSubtype(21);  // D3DFMT_A8R8G8B8
inline constexpr GUID MFVideoFormat_RGB24 = platform::mediaSubtype(20);   // D3DFMT_R8G8B8
inline constexpr GUID MFVideoFormat_H264 = platform::mediaSubtype(platform::fourcc('H', '2', '6', '4'));
inline constexpr GUID MFVideoFormat_H264_ES = {
    0x3f40f4f0, 0x5622, 0x4ff8, {0xb6, 0xd8, 0xa1, 0x7a, 0x58, 0x4b, 0xee, 0x5e}};
inline constexpr GUID MFVideoFormat_NV12 = platform::mediaSubtype(platform::fourcc('N', 'V', '1', '2'));
inline constexpr GUID MFVideoFormat_YUY2 = platform::mediaSubtype(platform::fourcc('Y', 'U', 'Y', '2'));
inline constexpr GUID MFVideoFormat_I420 = platform::mediaSubtype(platform::fourcc('I', '4', '2', '0'));
inline constexpr GUID MFVideoFormat_IYUV = platform::mediaSubtype(platform::fourcc('I', 'Y', 'U', 'V'));
inline constexpr GUID MFVideoFormat_MJPG = platform::mediaSubtype(platform::fourcc('M', 'J', 'P', 'G'));

// Audio subtypes.
inline constexpr GUID MFAudioFormat_PCM = platform::mediaSubtype(0x0001);
inline constexpr GUID MFAudioFormat_Float = platform::mediaSubtype(0x0003);
inline constexpr GUID MFAudioFormat_DTS = platform::mediaSubtype(0x0008);
inline constexpr GUID MFAudioFormat_DRM = platform::mediaSubtype(0x0009);
inline constexpr GUID MFAudioFormat_MSP1 = platform::mediaSubtype(0x000A);
inline constexpr GUID MFAudioFormat_MPEG = platform::mediaSubtype(0x0050);
inline constexpr GUID MFAudioFormat_MP3 = platform::mediaSubtype(0x0055);
inline constexpr GUID MFAudioFormat_Dolby_AC3_SPDIF = platform::mediaSubtype(0x0092);
inline constexpr GUID MFAudioFormat_WMAudioV8 = platform::mediaSubtype(0x0161);
inline constexpr GUID MFAudioFormat_WMAudioV9 = platform::mediaSubtype(0x0162);
inline constexpr GUID MFAudioFormat_WMAudio_Lossless = platform::mediaSubtype(0x0163);
inline constexpr GUID MFAudioFormat_WMASPDIF = platform::mediaSubtype(0x0164);
inline constexpr GUID MFAudioFormat_ADTS = platform::mediaSubtype(0x1600);
inline constexpr GUID MFAudioFormat_AAC = platform::mediaSubtype(0x1610);
inline constexpr GUID MFAudioFormat_ALAC = platform::mediaSubtype(0x6C61);
inline constexpr GUID MFAudioFormat_Opus = platform::mediaSubtype(0x704F);
inline constexpr GUID MFAudioFormat_AMR_NB = platform::mediaSubtype(0x7361);
inline constexpr GUID MFAudioFormat_AMR_WB = platform::mediaSubtype(0x7362);
inline constexpr GUID MFAudioFormat_AMR_WP = platform::mediaSubtype(0x7363);
inline constexpr GUID MFAudioFormat_FLAC = platform::mediaSubtype(0xF1AC);
inline constexpr GUID MFAudioFormat_Dolby_AC3 = {
    0xe06d802c, 0xdb46, 0x11cf, {0xb4, 0xd1, 0x00, 0x80, 0x5f, 0x6c, 0xbb, 0xea}};
inline constexpr GUID MFAudioFormat_Dolby_DDPlus = {
    0xa7fb87af, 0x2d02, 0x42fb, {0xa4, 0xd4, 0x05, 0xcd, 0x93, 0x84, 0x3b, 0xdd}};
inline constexpr GUID MFAudioFormat_Float_SpatialObjects = {
    0xfa39cd94, 0xbc64, 0x4ab1, {0x9b, 0x71, 0xdc, 0xd0, 0x9d, 0x5a, 0x7e, 0x7a}};
