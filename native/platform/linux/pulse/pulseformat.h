// Wave formats of the audio client and the sample specifications and channel maps of PulseAudio.
#pragma once

#include <pulse/pulseaudio.h>

#include "platform/linux/com.h"
#include "platform/wave.h"

namespace platform::pulse {

// The mix format of a sink: its rate and channels as 32-bit float, with the channel mask of its
// channel map, in a CoTaskMemAlloc'ed extensible block. Channels without a speaker position (aux)
// add no bit: they follow the named ones, as in any extensible format.
WAVEFORMATEX* mixFormat(const pa_sample_spec& sampleSpec, const pa_channel_map& map);

// The sample specification and channel map of a PCM or float format, plain or extensible. Channels
// of an extensible format that its mask does not name get the positions `device` (the map of the
// sink the format is for, if known) has outside the mask, so they meet the same channels there.
// False when PulseAudio cannot carry the format.
bool specOf(const WAVEFORMATEX* format, pa_sample_spec& sampleSpec, pa_channel_map& map,
            const pa_channel_map* device = nullptr);

// SPEAKER_* bits of the positions a channel map names (positions without a bit add none).
DWORD channelMask(const pa_channel_map& map);

}  // namespace platform::pulse
