#include "capture/audio/formats.h"

#include <cstring>
#include <iostream>

namespace capture::audio {

namespace {

#if defined(_WIN32) && (!defined(NTDDI_WIN10_RS2) || NTDDI_VERSION < NTDDI_WIN10_RS2)
// The SDK declares this subtype only for newer targets than the add-on's; its published value.
const GUID floatSpatialObjects = {0xfa39cd94, 0xbc64, 0x4ab1, {0x9b, 0x71, 0xdc, 0xd0, 0x9d, 0x5a, 0x7e, 0x7a}};
#else
const GUID& floatSpatialObjects = MFAudioFormat_Float_SpatialObjects;
#endif

// Built during the module's static initialisation, before any call from JavaScript.
const std::vector<AudioSubtype> table = {
    {"Advanced Audio Coding (AAC)", 2, MFAudioFormat_AAC},
    {"Audio Data Transport Stream (ADTS)", 1, MFAudioFormat_ADTS},
    {"Apple Lossless Audio Codec (ALAC)", 1, MFAudioFormat_ALAC},
    {"Adaptive Multi-Rate Audio", 1, MFAudioFormat_AMR_NB},
    {"Adaptive Multi-Rate Wideband Audio", 1, MFAudioFormat_AMR_WB},
    {"Adaptive Multi-Rate WP Audio", 1, MFAudioFormat_AMR_WP},
    {"Dolby Digital AC3", 2, MFAudioFormat_Dolby_AC3},
    {"Dolby AC-3 Audio / Sony/Philips Digital Interface", 1, MFAudioFormat_Dolby_AC3_SPDIF},
    {"Dolby Digital Plus", 1, MFAudioFormat_Dolby_DDPlus},
    {"Encrypted Audio Data", 1, MFAudioFormat_DRM},
    {"Digital Theater Systems (DTS) Audio", 1, MFAudioFormat_DTS},
    {"Free Lossless Audio Codec (FLAC)", 2, MFAudioFormat_FLAC},
    {"Uncompressed Floating-Point Audio", 1, MFAudioFormat_Float},
    {"Uncompressed Floating-Point Audio (SO)", 0, floatSpatialObjects},
    {"MPEG Audio Layer-3 (MP3)", 3, MFAudioFormat_MP3},
    {"MPEG Audio Payload", 2, MFAudioFormat_MPEG},
    {"Windows Media Audio 9 Voice Codec", 0, MFAudioFormat_MSP1},
    {"Opus", 0, MFAudioFormat_Opus},
    {"Uncompressed PCM Audio", 1, MFAudioFormat_PCM},
    {"Windows Media Audio 9 Professional Codec / S/PDIF", 0, MFAudioFormat_WMASPDIF},
    {"Windows Media Audio 9 Lossless Codec", 0, MFAudioFormat_WMAudio_Lossless},
    {"Windows Media Audio 8 Codec", 0, MFAudioFormat_WMAudioV8},
    {"Windows Media Audio 9 Codec", 0, MFAudioFormat_WMAudioV9},
};

const AudioSubtype* find(const GUID& subtype) {
  for (const AudioSubtype& entry : table)
    if (std::memcmp(&entry.subtype, &subtype, sizeof(GUID)) == 0) return &entry;
  return nullptr;
}

}  // namespace

const std::vector<AudioSubtype>& audioSubtypes() { return table; }

std::string nameOfSubtype(const GUID& subtype) {
  const AudioSubtype* entry = find(subtype);
  return entry ? entry->name : "Unknown";
}

int32_t tagOfSubtype(const GUID& subtype) {
  const AudioSubtype* entry = find(subtype);
  return entry ? entry->tag : 0;
}

void describeWaveFormat(const WAVEFORMATEX* format) {
  const uint16_t tag = format->wFormatTag, channels = format->nChannels, blockAlign = format->nBlockAlign,
                 bits = format->wBitsPerSample, size = format->cbSize;
  const uint32_t rate = format->nSamplesPerSec, bytesPerSecond = format->nAvgBytesPerSec;
  std::cout << "Format: " << tag << std::endl;
  std::cout << "Channels: " << channels << std::endl;
  std::cout << "Samples Per Sec: " << rate << std::endl;
  std::cout << "Bytes Per Sec: " << bytesPerSecond << std::endl;
  std::cout << "Block Align: " << blockAlign << std::endl;
  std::cout << "Bits Per Sample: " << bits << std::endl;
  std::cout << "Size: " << size << std::endl;
}

}  // namespace capture::audio
