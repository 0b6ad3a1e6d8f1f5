// The AAC types the sink writer's encoder takes, best first: 48 kHz stereo at the highest rate.
#include "platform/linux/mfcapture.h"

HRESULT MFTranscodeGetAudioOutputAvailableTypes(REFGUID subtype, DWORD, IMFAttributes*, IMFCollection** types) {
  if (!types) return E_POINTER;
  *types = nullptr;
  if (subtype != MFAudioFormat_AAC) return MF_E_TOPO_CODEC_NOT_FOUND;
  ComPtr<IMFCollection> collection;
  HRESULT hr = MFCreateCollection(collection.GetAddressOf());
  if (FAILED(hr)) return hr;
  static const UINT32 rates[] = {48000, 44100};
  static const UINT32 channelCounts[] = {2, 1};
  static const UINT32 bytesPerSecond[] = {24000, 20000, 16000, 12000};
  for (UINT32 rate : rates) {
    for (UINT32 channels : channelCounts) {
      for (UINT32 bytes : bytesPerSecond) {
        ComPtr<IMFMediaType> type;
        hr = MFCreateMediaType(type.GetAddressOf());
        if (SUCCEEDED(hr)) hr = type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
        if (SUCCEEDED(hr)) hr = type->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_AAC);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, rate);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, channels);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, bytes);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, 1);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AAC_PAYLOAD_TYPE, 0);
        if (SUCCEEDED(hr)) hr = type->SetUINT32(MF_MT_AAC_AUDIO_PROFILE_LEVEL_INDICATION, 0x29);
        if (SUCCEEDED(hr)) hr = collection->AddElement(type.Get());
        if (FAILED(hr)) return hr;
      }
    }
  }
  *types = collection.Detach();
  return S_OK;
}
