// Level peaks of an audio packet: the loudest sample of each channel, 0.0 to 1.0.
#pragma once

#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/wave.h"

namespace capture::audio {

// Computes one peak per channel of `frames` interleaved frames of `format` (PCM or IEEE float,
// read as extensible) and stores them into `peaks` under `lock`. Throws std::runtime_error for
// a sample kind or width it cannot read.
void computePeaks(const uint8_t* data, uint32_t frames, const WAVEFORMATEXTENSIBLE* format, std::vector<double>& peaks,
                  std::mutex& lock);

}  // namespace capture::audio
