// Readable descriptions of Media Foundation audio subtypes and of wave formats, for diagnostics.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/mf.h"
#include "platform/wave.h"

namespace capture::audio {

struct AudioSubtype {
  std::string name;
  int32_t tag;  // stored with the entry; nothing interprets it
  GUID subtype;
};

// The fixed table of 23 audio subtypes, built when the module is loaded.
const std::vector<AudioSubtype>& audioSubtypes();

// The name of the first entry with this subtype, else "Unknown".
std::string nameOfSubtype(const GUID& subtype);
// The tag of the first entry with this subtype, else 0.
int32_t tagOfSubtype(const GUID& subtype);

// Seven labelled lines on standard output: tag, channels, rate, bytes per second, block
// alignment, bits per sample, extra size; each flushed.
void describeWaveFormat(const WAVEFORMATEX* format);

}  // namespace capture::audio
