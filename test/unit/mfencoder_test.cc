// The audio encoder against real files.
#include "capture/audio/mfencoder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <memory>
#include <vector>

#include "media.h"
#include "support.h"

namespace {

using capture::audio::MFEncoder;
using ::testing::HasSubstr;
using testsupport::failureOf;
using testsupport::waveFormat;

// Packets of `frames` frames of a 440 Hz tone at amplitude 0.5, in the format's sample kind.
std::vector<uint8_t> tone(const WAVEFORMATEXTENSIBLE& format, int64_t first, uint32_t frames) {
  const WORD channels = format.Format.nChannels, bytes = format.Format.wBitsPerSample / 8;
  const bool isFloat = format.SubFormat == KSDATAFORMAT_SUBTYPE_IEEE_FLOAT;
  std::vector<uint8_t> data(static_cast<size_t>(frames) * format.Format.nBlockAlign);
  for (uint32_t f = 0; f < frames; ++f) {
    const double value = 0.5 * std::sin(2 * M_PI * 440 * double(first + f) / format.Format.nSamplesPerSec);
    for (WORD c = 0; c < channels; ++c) {
      uint8_t* out = &data[(static_cast<size_t>(f) * channels + c) * bytes];
      if (isFloat) {
        const float v = static_cast<float>(value);
        std::memcpy(out, &v, 4);
      } else {
        const int16_t v = static_cast<int16_t>(std::lround(value * 32767));
        std::memcpy(out, &v, 2);
      }
    }
  }
  return data;
}

// Records `packets` packets of `frames` frames stamped as a capture source stamps them.
void recordTone(MFEncoder& encoder, const WAVEFORMATEXTENSIBLE& format, int packets, uint32_t frames) {
  for (int i = 0; i < packets; ++i) {
    const auto data = tone(format, int64_t(i) * frames, frames);
    const int64_t time = int64_t(i) * frames * 10000000 / format.Format.nSamplesPerSec;
    encoder.write(data.data(), frames, &format.Format, time);
  }
}

TEST(MFEncoder, FloatStereoEndpointGivesAnAacFileOfItsRateAndChannels) {
  media::TempFolder folder;
  const std::string path = folder.file("endpoint.mp4");
  const auto format =
      waveFormat(2, 48000, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT);
  testing::internal::CaptureStdout();
  auto encoder = std::make_unique<MFEncoder>(path, &format);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "File: " + path + "\n");
  recordTone(*encoder, format, 150, 480);  // 1.5 s in 10 ms packets
  encoder->finalize();
  encoder.reset();

  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  EXPECT_EQ(file.streams[0].codec, "aac");
  EXPECT_EQ(file.streams[0].sampleRate, 48000);
  EXPECT_EQ(file.streams[0].channels, 2);
  EXPECT_NEAR(file.duration, 1.5, 1.5 * 0.03);
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_AUDIO);
  EXPECT_EQ(decoded.errors, 0);
  std::vector<float> left = media::channel(decoded.samples, 2, 0);
  ASSERT_GT(left.size(), 48000u);
  left.assign(left.begin() + 12000, left.begin() + 60000);
  const double power = media::power(left, 440, 48000);
  EXPECT_NEAR(std::sqrt(power) * 2, 0.5, 0.05);
  EXPECT_LT(media::power(left, 1000, 48000), power / 1000);
}

TEST(MFEncoder, SampleSizesFollowTheBlockAlignment) {
  // 16-bit stereo: 4 bytes a frame. A size taken from anything but nBlockAlign x frames would
  // change how long the file plays.
  media::TempFolder folder;
  const std::string path = folder.file("pcm.mp4");
  const auto format = waveFormat(2, 44100, 16, KSDATAFORMAT_SUBTYPE_PCM, 3);
  testing::internal::CaptureStdout();
  {
    MFEncoder encoder(path, &format);
    recordTone(encoder, format, 10, 4410);                // 1 s
    encoder.write(nullptr, 0, &format.Format, 10000000);  // a packet of no frames is written too
    encoder.finalize();
  }
  testing::internal::GetCapturedStdout();
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  EXPECT_EQ(file.streams[0].sampleRate, 44100);
  EXPECT_NEAR(file.duration, 1.0, 0.03);
}

TEST(MFEncoder, AMissingFolderOrAnUnknownSubFormatFailsTheConstruction) {
  media::TempFolder folder;
  const auto floats = waveFormat(2, 48000, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, 3);
  testing::internal::CaptureStdout();
  EXPECT_THAT(failureOf([&] { MFEncoder encoder(folder.file("missing/a.mp4"), &floats); }),
              HasSubstr("\tnative/capture/audio/mfencoder(35): 0x80070003: Could not create sink."));
  testing::internal::GetCapturedStdout();
  MFShutdown();
  // An unknown subformat fails after the output stream.
  const std::string path = folder.file("unknown.mp4");
  const auto aac = waveFormat(2, 48000, 32, MFAudioFormat_AAC, 3);
  testing::internal::CaptureStdout();
  EXPECT_EQ(failureOf([&] { MFEncoder encoder(path, &aac); }),
            "native/capture/audio/mfencoder(144): Unable to set format tag.");
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "File: " + path + "\n");
  EXPECT_TRUE(std::filesystem::exists(path));  // the sink was made before the failure
  MFShutdown();                                // the failed constructor left Media Foundation started, as it should
}

TEST(MFEncoder, WriteAfterFinalizeFailsInThePlatform) {
  media::TempFolder folder;
  const auto format = waveFormat(1, 48000, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, SPEAKER_FRONT_CENTER);
  testing::internal::CaptureStdout();
  MFEncoder encoder(folder.file("late.mp4"), &format);
  testing::internal::GetCapturedStdout();
  recordTone(encoder, format, 5, 480);
  encoder.finalize();
  const auto data = tone(format, 0, 480);
  EXPECT_THAT(failureOf([&] { encoder.write(data.data(), 480, &format.Format, 500000); }),
              HasSubstr("mfencoder(106): 0xc00d36b2: Could not write sample."));
  EXPECT_THAT(failureOf([&] { encoder.finalize(); }),
              HasSubstr("mfencoder(113): 0xc00d36b2: Unable to finalize audio encoder."));
}

TEST(MFEncoder, EachEncoderStartsAndShutsDownMediaFoundationOnceAndWarnsOfAnUnpairedShutDown) {
  while (SUCCEEDED(MFShutdown())) {
  }
  media::TempFolder folder;
  const auto format = waveFormat(2, 48000, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, 3);
  testing::internal::CaptureStdout();
  auto first = std::make_unique<MFEncoder>(folder.file("1.mp4"), &format);
  auto second = std::make_unique<MFEncoder>(folder.file("2.mp4"), &format);
  testing::internal::GetCapturedStdout();
  first.reset();  // unfinalised: released and shut down all the same
  second.reset();
  EXPECT_EQ(MFShutdown(), MF_E_PLATFORM_NOT_INITIALIZED);

  // Media Foundation shut down under the encoder: its own shut-down becomes a warning line.
  testing::internal::CaptureStdout();
  auto encoder = std::make_unique<MFEncoder>(folder.file("w.mp4"), &format);
  while (SUCCEEDED(MFShutdown())) {
  }
  encoder.reset();
  const std::string out = testing::internal::GetCapturedStdout();
  EXPECT_NE(out.find(": Warning: "), std::string::npos) << out;
  EXPECT_NE(out.find("mfencoder(75): 0xc00d36b0: Could not properly shut down audio encoder."), std::string::npos)
      << out;
}

}  // namespace
