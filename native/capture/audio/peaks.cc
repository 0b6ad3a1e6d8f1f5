#include "capture/audio/peaks.h"

#include <cstring>
#include <stdexcept>
#include <string>

#include "capture/check.h"

namespace capture::audio {

namespace {

// The failures keep the text of the capture source that reports them.
[[noreturn]] void fail(int line, const char* message) {
  throw std::runtime_error(std::string("native/capture/audio/wasapi/source(") + std::to_string(line) + "): " + message);
}

template <class T>
T sampleAt(const uint8_t* data, size_t index) {
  T value;
  std::memcpy(&value, data + index * sizeof(T), sizeof(T));
  return value;
}

}  // namespace

void computePeaks(const uint8_t* data, uint32_t frames, const WAVEFORMATEXTENSIBLE* format, std::vector<double>& peaks,
                  std::mutex& lock) {
  bool isFloat;
  if (format->SubFormat == KSDATAFORMAT_SUBTYPE_PCM)
    isFloat = false;
  else if (format->SubFormat == KSDATAFORMAT_SUBTYPE_IEEE_FLOAT)
    isFloat = true;
  else
    fail(322, "Peaks cannot be calculated as the data format is unknown.");

  const uint16_t channels = format->Format.nChannels;
  const uint16_t bits = format->Format.wBitsPerSample;
  std::vector<double> local(channels, 0.0);
  for (uint32_t f = 0; f < frames; ++f) {
    for (uint16_t c = 0; c < channels; ++c) {
      const size_t index = static_cast<size_t>(f) * channels + c;
      double x;
      if (!isFloat) {
        switch (bits) {
          // 8-bit samples are read as signed on purpose: the unsigned mid-point shows full level.
          case 8: x = sampleAt<int8_t>(data, index) / 127.0; break;
          case 16: x = sampleAt<int16_t>(data, index) / 32767.0; break;
          case 32: x = sampleAt<int32_t>(data, index) / 2147483647.0; break;
          case 64: x = static_cast<double>(sampleAt<int64_t>(data, index)) / static_cast<double>(INT64_MAX); break;
          default: fail(354, "Peaks cannot be calculated as the bit depth is unknown.");
        }
      } else {
        switch (bits) {
          case 32: x = sampleAt<float>(data, index); break;
          case 64: x = sampleAt<double>(data, index); break;
          default: fail(366, "Peaks cannot be calculated as the bit depth is unknown.");
        }
      }
      // A NaN fails both comparisons below and never raises a peak.
      if (!(x > 0)) x *= -1;
      if (x > 1.0) x = 1.0;
      if (x > local[c]) local[c] = x;
    }
  }
  std::lock_guard<std::mutex> hold(lock);
  for (size_t i = 0; i < peaks.size(); ++i) capture::at(peaks, i) = capture::at(local, i);
}

}  // namespace capture::audio
