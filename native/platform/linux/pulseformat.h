// Wave formats of the audio client and the sample specifications and channel maps of PulseAudio.
#pragma once

#include <pulse/pulseaudio.h>

#include "platform/linux/com.h"
#include "platform/wave.h"

namespace platform::pulse {

// The mix format of a sink: its rate and channels as 32-bit float, with the channel mask of its
// channel map, in a CoTaskMemAlloc'ed extensible block.
WAVEFORMATEX* mixFormat(const pa_sample_spec& sampleSpec, const pa_channel_map& map);

// The sample specification and channel map of a PCM or float format, plain or extensible. False
// when PulseAudio cannot carry it.
bool specOf(const WAVEFORMATEX* format, pa_sample_spec& sampleSpec, pa_channel_map& map);

// SPEAKER_* bits of the positions a channel map names (positions without a bit add none).
DWORD channelMask(const pa_channel_map& map);

}  // namespace platform::pulse
