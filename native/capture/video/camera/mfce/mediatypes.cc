#include "capture/video/camera/mfce/mediatypes.h"

namespace capture::video::camera::mfce {

namespace {

HRESULT copyUint64(IMFMediaType* from, IMFMediaType* to, REFGUID key) {
  UINT64 value = 0;
  HRESULT hr = from->GetUINT64(key, &value);
  if (FAILED(hr)) return hr;
  return to->SetUINT64(key, value);
}

HRESULT copyUint32(IMFMediaType* from, IMFMediaType* to, REFGUID key) {
  UINT32 value = 0;
  HRESULT hr = from->GetUINT32(key, &value);
  if (FAILED(hr)) return hr;
  return to->SetUINT32(key, value);
}

UINT32 uint32Or(IMFMediaType* type, REFGUID key, UINT32 fallback) {
  UINT32 value = 0;
  return SUCCEEDED(type->GetUINT32(key, &value)) ? value : fallback;
}

}  // namespace

HRESULT MakeVideoType(IMFMediaType* sourceType, REFGUID subtype, IMFMediaType** type) {
  if (!sourceType || !type) return E_POINTER;
  *type = nullptr;
  ComPtr<IMFMediaType> made;
  HRESULT hr = MFCreateMediaType(made.GetAddressOf());
  if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_SUBTYPE, subtype);
  if (SUCCEEDED(hr)) hr = copyUint64(sourceType, made.Get(), MF_MT_FRAME_SIZE);
  if (SUCCEEDED(hr)) hr = copyUint64(sourceType, made.Get(), MF_MT_FRAME_RATE);
  if (SUCCEEDED(hr)) hr = copyUint64(sourceType, made.Get(), MF_MT_PIXEL_ASPECT_RATIO);
  if (SUCCEEDED(hr)) hr = copyUint32(sourceType, made.Get(), MF_MT_INTERLACE_MODE);
  if (FAILED(hr)) return hr;
  *type = made.Detach();
  return hr;
}

HRESULT MakePcmType(IMFMediaType* audioType, IMFMediaType** type) {
  if (!audioType || !type) return E_POINTER;
  *type = nullptr;
  GUID major = GUID_NULL;
  HRESULT hr = audioType->GetMajorType(&major);
  if (FAILED(hr)) return hr;
  if (major != MFMediaType_Audio) return MF_E_INVALIDMEDIATYPE;

  GUID subtype = GUID_NULL;
  if (SUCCEEDED(audioType->GetGUID(MF_MT_SUBTYPE, &subtype)) && subtype == MFAudioFormat_PCM) {
    audioType->AddRef();
    *type = audioType;
    return S_OK;
  }

  const UINT32 channels = uint32Or(audioType, MF_MT_AUDIO_NUM_CHANNELS, 0);
  const UINT32 rate = uint32Or(audioType, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0);
  const UINT32 bits = uint32Or(audioType, MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
  if (channels == 0 || rate == 0) return MF_E_INVALIDTYPE;
  const UINT32 blockAlign = (bits / 8) * channels;

  ComPtr<IMFMediaType> made;
  hr = MFCreateMediaType(made.GetAddressOf());
  if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_PCM);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, channels);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, rate);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, blockAlign);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, blockAlign * rate);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, bits);
  if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
  if (FAILED(hr)) return hr;
  *type = made.Detach();
  return hr;
}

UINT32 EstimateBitrate(UINT32 width, UINT32 height, UINT32 numerator, UINT32 denominator) {
  // Single precision, in this order: the figures differ in the last digits otherwise.
  float bits = static_cast<float>(width) / 3.0f;
  bits = bits * static_cast<float>(height);
  bits = bits * static_cast<float>(numerator);
  bits = bits / static_cast<float>(denominator);
  return static_cast<UINT32>(bits);
}

UINT32 EstimateBitrate(IMFMediaType* videoType) {
  UINT64 size = 0;
  UINT64 rate = 0;
  videoType->GetUINT64(MF_MT_FRAME_SIZE, &size);
  videoType->GetUINT64(MF_MT_FRAME_RATE, &rate);
  return EstimateBitrate(static_cast<UINT32>(size >> 32), static_cast<UINT32>(size), static_cast<UINT32>(rate >> 32),
                         static_cast<UINT32>(rate));
}

}  // namespace capture::video::camera::mfce
