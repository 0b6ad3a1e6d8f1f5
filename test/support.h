// Small helpers that several unit tests share.
#pragma once

#include <chrono>
#include <stdexcept>
#include <string>
#include <thread>

#include "platform/wave.h"

namespace testsupport {

// Polls `condition` every 5 ms for up to ten seconds; its value then.
template <class Condition>
bool eventually(Condition condition) {
  for (int i = 0; i < 2000 && !condition(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(5));
  return condition();
}

// The text of the failure `call` throws, or "no failure".
template <class Call>
std::string failureOf(Call call) {
  try {
    call();
  } catch (const std::runtime_error& error) {
    return error.what();
  }
  return "no failure";
}

// An extensible wave format whose samples fill their `bits`, as an endpoint's mix format is.
inline WAVEFORMATEXTENSIBLE waveFormat(WORD channels, DWORD rate, WORD bits, const GUID& subFormat, DWORD mask) {
  WAVEFORMATEXTENSIBLE format{};
  format.Format.wFormatTag = WAVE_FORMAT_EXTENSIBLE;
  format.Format.nChannels = channels;
  format.Format.nSamplesPerSec = rate;
  format.Format.wBitsPerSample = bits;
  format.Format.nBlockAlign = static_cast<WORD>(channels * bits / 8);
  format.Format.nAvgBytesPerSec = rate * format.Format.nBlockAlign;
  format.Format.cbSize = 22;
  format.Samples.wValidBitsPerSample = bits;
  format.dwChannelMask = mask;
  format.SubFormat = subFormat;
  return format;
}

}  // namespace testsupport
