#include "platform/linux/pulse/pulseformat.h"

#include <cstring>

namespace platform::pulse {

namespace {

struct Speaker {
  DWORD bit;
  pa_channel_position_t position;
};

// In SPEAKER_* bit order, which is also the order of channels in an extensible format.
const Speaker speakers[] = {
    {SPEAKER_FRONT_LEFT, PA_CHANNEL_POSITION_FRONT_LEFT},
    {SPEAKER_FRONT_RIGHT, PA_CHANNEL_POSITION_FRONT_RIGHT},
    {SPEAKER_FRONT_CENTER, PA_CHANNEL_POSITION_FRONT_CENTER},
    {SPEAKER_LOW_FREQUENCY, PA_CHANNEL_POSITION_LFE},
    {SPEAKER_BACK_LEFT, PA_CHANNEL_POSITION_REAR_LEFT},
    {SPEAKER_BACK_RIGHT, PA_CHANNEL_POSITION_REAR_RIGHT},
    {SPEAKER_FRONT_LEFT_OF_CENTER, PA_CHANNEL_POSITION_FRONT_LEFT_OF_CENTER},
    {SPEAKER_FRONT_RIGHT_OF_CENTER, PA_CHANNEL_POSITION_FRONT_RIGHT_OF_CENTER},
    {SPEAKER_BACK_CENTER, PA_CHANNEL_POSITION_REAR_CENTER},
    {SPEAKER_SIDE_LEFT, PA_CHANNEL_POSITION_SIDE_LEFT},
    {SPEAKER_SIDE_RIGHT, PA_CHANNEL_POSITION_SIDE_RIGHT},
    {SPEAKER_TOP_CENTER, PA_CHANNEL_POSITION_TOP_CENTER},
    {SPEAKER_TOP_FRONT_LEFT, PA_CHANNEL_POSITION_TOP_FRONT_LEFT},
    {SPEAKER_TOP_FRONT_CENTER, PA_CHANNEL_POSITION_TOP_FRONT_CENTER},
    {SPEAKER_TOP_FRONT_RIGHT, PA_CHANNEL_POSITION_TOP_FRONT_RIGHT},
    {SPEAKER_TOP_BACK_LEFT, PA_CHANNEL_POSITION_TOP_REAR_LEFT},
    {SPEAKER_TOP_BACK_CENTER, PA_CHANNEL_POSITION_TOP_REAR_CENTER},
    {SPEAKER_TOP_BACK_RIGHT, PA_CHANNEL_POSITION_TOP_REAR_RIGHT},
};

DWORD bitOf(pa_channel_position_t position) {
  // A mono sink is one front-centre speaker, as a mono endpoint is on Windows.
  if (position == PA_CHANNEL_POSITION_MONO) return SPEAKER_FRONT_CENTER;
  for (const Speaker& speaker : speakers)
    if (speaker.position == position) return speaker.bit;
  return 0;
}

bool named(const pa_channel_map& map, pa_channel_position_t position) {
  for (unsigned i = 0; i < map.channels; ++i)
    if (map.map[i] == position) return true;
  return false;
}

// The channel map of a mask: the speakers it names in bit order, then, as in an extensible wave
// format, the channels no bit names. Those take the device's positions the mask leaves out, in
// the device's order (its aux channels, for a pro-audio sink), then AUX0, AUX1, ... that are
// still free. False when the mask names more speakers than there are channels.
bool mapOf(DWORD mask, uint8_t channels, const pa_channel_map* device, pa_channel_map& map) {
  pa_channel_map_init(&map);
  uint8_t count = 0;
  for (const Speaker& speaker : speakers) {
    if (!(mask & speaker.bit)) continue;
    if (count == channels) return false;
    map.map[count++] = speaker.position;
  }
  if (count == 1 && channels == 1) map.map[0] = PA_CHANNEL_POSITION_MONO;
  map.channels = count;
  for (unsigned i = 0; device && i < device->channels && count < channels; ++i) {
    const pa_channel_position_t position = device->map[i];
    if (position == PA_CHANNEL_POSITION_MONO ? mask & SPEAKER_FRONT_CENTER : named(map, position)) continue;
    map.map[count++] = position;
    map.channels = count;
  }
  for (int aux = PA_CHANNEL_POSITION_AUX0; aux <= PA_CHANNEL_POSITION_AUX31 && count < channels; ++aux) {
    if (named(map, static_cast<pa_channel_position_t>(aux))) continue;
    map.map[count++] = static_cast<pa_channel_position_t>(aux);
    map.channels = count;
  }
  return count == channels;
}

}  // namespace

DWORD channelMask(const pa_channel_map& map) {
  DWORD mask = 0;
  for (unsigned i = 0; i < map.channels; ++i) mask |= bitOf(map.map[i]);
  return mask;
}

WAVEFORMATEX* mixFormat(const pa_sample_spec& sampleSpec, const pa_channel_map& map) {
  auto* format = static_cast<WAVEFORMATEXTENSIBLE*>(CoTaskMemAlloc(sizeof(WAVEFORMATEXTENSIBLE)));
  std::memset(format, 0, sizeof(WAVEFORMATEXTENSIBLE));
  format->Format.wFormatTag = WAVE_FORMAT_EXTENSIBLE;
  format->Format.nChannels = sampleSpec.channels;
  format->Format.nSamplesPerSec = sampleSpec.rate;
  format->Format.wBitsPerSample = 32;
  format->Format.nBlockAlign = static_cast<WORD>(sampleSpec.channels * 4);
  format->Format.nAvgBytesPerSec = sampleSpec.rate * format->Format.nBlockAlign;
  format->Format.cbSize = sizeof(WAVEFORMATEXTENSIBLE) - sizeof(WAVEFORMATEX);
  format->Samples.wValidBitsPerSample = 32;
  format->dwChannelMask = channelMask(map);
  format->SubFormat = KSDATAFORMAT_SUBTYPE_IEEE_FLOAT;
  return &format->Format;
}

bool specOf(const WAVEFORMATEX* format, pa_sample_spec& sampleSpec, pa_channel_map& map, const pa_channel_map* device) {
  if (!format || format->nChannels == 0 || format->nChannels > PA_CHANNELS_MAX) return false;
  bool isFloat = false;
  const bool extensible = format->wFormatTag == WAVE_FORMAT_EXTENSIBLE &&
                          format->cbSize >= sizeof(WAVEFORMATEXTENSIBLE) - sizeof(WAVEFORMATEX);
  const auto* wide = reinterpret_cast<const WAVEFORMATEXTENSIBLE*>(format);
  if (extensible) {
    if (wide->SubFormat == KSDATAFORMAT_SUBTYPE_IEEE_FLOAT)
      isFloat = true;
    else if (!(wide->SubFormat == KSDATAFORMAT_SUBTYPE_PCM))
      return false;
  } else if (format->wFormatTag == WAVE_FORMAT_IEEE_FLOAT) {
    isFloat = true;
  } else if (format->wFormatTag != WAVE_FORMAT_PCM) {
    return false;
  }
  const unsigned bits = format->wBitsPerSample;
  if (format->nBlockAlign != format->nChannels * bits / 8) return false;
  if (isFloat && bits == 32)
    sampleSpec.format = PA_SAMPLE_FLOAT32LE;
  else if (!isFloat && bits == 8)
    sampleSpec.format = PA_SAMPLE_U8;
  else if (!isFloat && bits == 16)
    sampleSpec.format = PA_SAMPLE_S16LE;
  else if (!isFloat && bits == 24)
    sampleSpec.format = PA_SAMPLE_S24LE;
  else if (!isFloat && bits == 32)
    sampleSpec.format = PA_SAMPLE_S32LE;
  else
    return false;
  sampleSpec.rate = format->nSamplesPerSec;
  sampleSpec.channels = static_cast<uint8_t>(format->nChannels);
  if (!pa_sample_spec_valid(&sampleSpec)) return false;
  // An extensible format names its speakers by mask, and a mask of 0 names none (the form of an
  // endpoint whose channels have no speaker positions); a plain one has the usual layout.
  if (extensible) {
    if (!mapOf(wide->dwChannelMask, sampleSpec.channels, device, map)) return false;
  } else if (!pa_channel_map_init_auto(&map, sampleSpec.channels, PA_CHANNEL_MAP_WAVEEX)) {
    return false;
  }
  return true;
}

}  // namespace platform::pulse
