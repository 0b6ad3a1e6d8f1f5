#include "platform/linux/pulse/pulseformat.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/com.h"

namespace {

using namespace platform::pulse;

pa_channel_map parse(const char* text) {
  pa_channel_map map;
  EXPECT_NE(pa_channel_map_parse(&map, text), nullptr) << text;
  return map;
}

std::string print(const pa_channel_map& map) {
  char text[PA_CHANNEL_MAP_SNPRINT_MAX];
  return pa_channel_map_snprint(text, sizeof text, &map);
}

// The mix format of a sink, as the capture code sends it back to the audio client.
struct Mix {
  explicit Mix(const char* sinkMap, uint8_t channels) : sink(parse(sinkMap)) {
    const pa_sample_spec sampleSpec{PA_SAMPLE_FLOAT32LE, 48000, channels};
    format = mixFormat(sampleSpec, sink);
  }
  ~Mix() { CoTaskMemFree(format); }
  DWORD mask() const { return reinterpret_cast<const WAVEFORMATEXTENSIBLE*>(format)->dwChannelMask; }
  pa_channel_map sink;
  WAVEFORMATEX* format;
};

// The stream map that the audio client opens for the sink's own mix format: recording through it
// must not remix, so it holds the sink's positions (in wave order).
std::string streamMap(const Mix& mix, const pa_channel_map* device) {
  pa_sample_spec sampleSpec;
  pa_channel_map map;
  if (!specOf(mix.format, sampleSpec, map, device)) return "refused";
  return print(map);
}

TEST(PulseFormat, SinksWithSpeakerPositionsKeepTheirMasksAndMaps) {
  Mix stereo("front-left,front-right", 2);
  EXPECT_EQ(stereo.mask(), DWORD{SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT});
  EXPECT_EQ(streamMap(stereo, &stereo.sink), "front-left,front-right");
  Mix mono("mono", 1);
  EXPECT_EQ(mono.mask(), DWORD{SPEAKER_FRONT_CENTER});
  EXPECT_EQ(streamMap(mono, &mono.sink), "mono");
  // PulseAudio's 5.1 order differs from the wave order; the stream asks in wave order.
  Mix surround("front-left,rear-left,front-center,front-right,rear-right,lfe", 6);
  EXPECT_EQ(surround.mask(), DWORD{0x3F});
  EXPECT_EQ(streamMap(surround, &surround.sink), "front-left,front-right,front-center,lfe,rear-left,rear-right");
}

TEST(PulseFormat, ChannelsWithoutSpeakerPositionsMeetTheSinksOwnChannels) {
  Mix aux("aux0,aux1", 2);
  EXPECT_EQ(aux.mask(), 0u);
  EXPECT_EQ(streamMap(aux, &aux.sink), "aux0,aux1");
  Mix mixed("front-left,front-right,aux0,aux1", 4);
  EXPECT_EQ(mixed.mask(), DWORD{SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT});
  EXPECT_EQ(streamMap(mixed, &mixed.sink), "front-left,front-right,aux0,aux1");
  // Named speakers come first whatever the sink's order; aux numbers are the sink's own.
  Mix scattered("aux5,front-left,aux7", 3);
  EXPECT_EQ(streamMap(scattered, &scattered.sink), "front-left,aux5,aux7");
  // Without a device the unnamed channels are numbered from aux0.
  EXPECT_EQ(streamMap(mixed, nullptr), "front-left,front-right,aux0,aux1");
}

TEST(PulseFormat, MasksThatCannotFitTheChannelsAreRefused) {
  Mix stereo("front-left,front-right", 2);
  auto* wide = reinterpret_cast<WAVEFORMATEXTENSIBLE*>(stereo.format);
  wide->dwChannelMask = SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT | SPEAKER_FRONT_CENTER;
  EXPECT_EQ(streamMap(stereo, &stereo.sink), "refused");
  // A plain format has the usual layout of its channel count.
  WAVEFORMATEX plain{WAVE_FORMAT_IEEE_FLOAT, 2, 48000, 48000 * 8, 8, 32, 0};
  pa_sample_spec sampleSpec;
  pa_channel_map map;
  ASSERT_TRUE(specOf(&plain, sampleSpec, map, &stereo.sink));
  EXPECT_EQ(print(map), "front-left,front-right");
}

}  // namespace
