#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>
#include <stdexcept>
#include <vector>

#include "capture/audio/peaks.h"

namespace {

WAVEFORMATEXTENSIBLE formatOf(const GUID& kind, WORD bits, WORD channels) {
  WAVEFORMATEXTENSIBLE format{};
  format.Format.wFormatTag = WAVE_FORMAT_EXTENSIBLE;
  format.Format.nChannels = channels;
  format.Format.nSamplesPerSec = 48000;
  format.Format.wBitsPerSample = bits;
  format.Format.nBlockAlign = static_cast<WORD>(channels * bits / 8);
  format.Format.cbSize = 22;
  format.SubFormat = kind;
  return format;
}

template <class T>
std::vector<uint8_t> bytesOf(std::vector<T> samples) {
  std::vector<uint8_t> bytes(samples.size() * sizeof(T));
  if (!samples.empty()) std::memcpy(bytes.data(), samples.data(), bytes.size());
  return bytes;
}

// Runs the computation into a peaks vector that starts from `before` for every channel.
template <class T>
std::vector<double> peaksOf(const WAVEFORMATEXTENSIBLE& format, std::vector<T> samples, double before = 0.5) {
  std::vector<double> peaks(format.Format.nChannels, before);
  std::mutex lock;
  std::vector<uint8_t> bytes = bytesOf(samples);
  const uint32_t frames = static_cast<uint32_t>(samples.size() / format.Format.nChannels);
  capture::audio::computePeaks(bytes.data(), frames, &format, peaks, lock);
  return peaks;
}

std::string failureOf(const WAVEFORMATEXTENSIBLE& format, const std::vector<uint8_t>& bytes, uint32_t frames) {
  std::vector<double> peaks(format.Format.nChannels, 0.25);
  std::mutex lock;
  try {
    capture::audio::computePeaks(bytes.data(), frames, &format, peaks, lock);
  } catch (const std::runtime_error& e) {
    EXPECT_EQ(peaks, std::vector<double>(format.Format.nChannels, 0.25)) << "a failure keeps the stored peaks";
    return e.what();
  }
  return "no failure";
}

TEST(AudioPeaks, IntegerWidthsScaleToTheirFullScale) {
  const GUID pcm = KSDATAFORMAT_SUBTYPE_PCM;
  EXPECT_EQ(peaksOf(formatOf(pcm, 8, 2), std::vector<int8_t>{127, -64, 10, 0}), (std::vector<double>{1.0, 64 / 127.0}));
  EXPECT_EQ(peaksOf(formatOf(pcm, 16, 2), std::vector<int16_t>{16384, -32767, -100, 200}),
            (std::vector<double>{16384 / 32767.0, 1.0}));
  EXPECT_EQ(peaksOf(formatOf(pcm, 32, 1), std::vector<int32_t>{-1073741824, 5}),
            (std::vector<double>{1073741824 / 2147483647.0}));
  const int64_t quarter = std::numeric_limits<int64_t>::max() / 4;
  std::vector<double> wide = peaksOf(formatOf(pcm, 64, 1), std::vector<int64_t>{-quarter, 7});
  EXPECT_DOUBLE_EQ(wide[0], 0.25);
}

TEST(AudioPeaks, FullScaleNegativeAndSignedEightBitClampToOne) {
  const GUID pcm = KSDATAFORMAT_SUBTYPE_PCM;
  EXPECT_EQ(peaksOf(formatOf(pcm, 16, 1), std::vector<int16_t>{-32768}), std::vector<double>{1.0});
  // 0x80, the silent mid-point of unsigned 8-bit audio, reads as -128 and shows full level.
  EXPECT_EQ(peaksOf(formatOf(pcm, 8, 1), std::vector<uint8_t>{0x80, 0x80}), std::vector<double>{1.0});
  EXPECT_EQ(peaksOf(formatOf(pcm, 32, 1), std::vector<int32_t>{std::numeric_limits<int32_t>::min()}),
            std::vector<double>{1.0});
}

TEST(AudioPeaks, FloatSamplesKeepSignZeroNanAndClamp) {
  const GUID ieee = KSDATAFORMAT_SUBTYPE_IEEE_FLOAT;
  EXPECT_EQ(peaksOf(formatOf(ieee, 32, 2), std::vector<float>{0.25f, -0.75f, -0.5f, 0.125f}),
            (std::vector<double>{0.5, 0.75}));
  std::vector<double> zero = peaksOf(formatOf(ieee, 32, 2), std::vector<float>{-0.0f, 0.0f});
  EXPECT_EQ(zero, (std::vector<double>{0.0, 0.0}));
  const float nan = std::numeric_limits<float>::quiet_NaN();
  EXPECT_EQ(peaksOf(formatOf(ieee, 32, 2), std::vector<float>{nan, 3.5f, nan, -2.0f}), (std::vector<double>{0.0, 1.0}));
  EXPECT_EQ(peaksOf(formatOf(ieee, 64, 1), std::vector<double>{-0.375, 0.25, std::nan("")}),
            std::vector<double>{0.375});
}

TEST(AudioPeaks, EachPacketReplacesThePreviousPeaks) {
  const GUID ieee = KSDATAFORMAT_SUBTYPE_IEEE_FLOAT;
  // The stored values start at 0.5; a quieter packet lowers them (no hold, no decay).
  EXPECT_EQ(peaksOf(formatOf(ieee, 32, 2), std::vector<float>{0.125f, 0.0625f}, 0.5),
            (std::vector<double>{0.125, 0.0625}));
  // No frames: every channel reads 0.
  EXPECT_EQ(peaksOf(formatOf(ieee, 32, 2), std::vector<float>{}, 0.5), (std::vector<double>{0.0, 0.0}));
  EXPECT_EQ(peaksOf(formatOf(ieee, 32, 1), std::vector<float>{0.5f, -0.625f, 0.25f}), std::vector<double>{0.625});
}

TEST(AudioPeaks, UnreadableFormatsFailWithTheSourceText) {
  const std::vector<uint8_t> bytes(64, 0x11);
  const GUID unknown = {0x00000092, 0x0000, 0x0010, {0x80, 0x00, 0x00, 0xAA, 0x00, 0x38, 0x9B, 0x71}};
  // The kind is checked before anything else, even for an empty packet.
  EXPECT_EQ(failureOf(formatOf(unknown, 16, 2), bytes, 0),
            "native/capture/audio/wasapi/source(322): Peaks cannot be calculated as the data format is unknown.");
  EXPECT_EQ(failureOf(formatOf(KSDATAFORMAT_SUBTYPE_PCM, 24, 2), bytes, 4),
            "native/capture/audio/wasapi/source(354): Peaks cannot be calculated as the bit depth is unknown.");
  EXPECT_EQ(failureOf(formatOf(KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, 16, 2), bytes, 4),
            "native/capture/audio/wasapi/source(366): Peaks cannot be calculated as the bit depth is unknown.");
  // The width is checked at the first sample, so an empty packet of an unknown width passes.
  EXPECT_EQ(failureOf(formatOf(KSDATAFORMAT_SUBTYPE_PCM, 24, 2), bytes, 0), "no failure");
}

TEST(AudioPeaks, TwentyFourBitsInThirtyTwoBitContainersReadAsThirtyTwo) {
  WAVEFORMATEXTENSIBLE format = formatOf(KSDATAFORMAT_SUBTYPE_PCM, 32, 1);
  format.Samples.wValidBitsPerSample = 24;
  EXPECT_EQ(peaksOf(format, std::vector<int32_t>{-1073741824}), (std::vector<double>{1073741824 / 2147483647.0}));
}

}  // namespace
