// The "new source" descriptor: keys, order and values by kind of source.
#include <gtest/gtest.h>

#include "capture/audio/source.h"
#include "capture/video/source.h"
#include "descriptor.h"

namespace {

using capture::Descriptor;
using capture::DescriptorValue;

struct FakeBase : virtual capture::Source {
  int32_t kind = 0;
  int32_t type() override { return kind; }
  std::string name() override { return "Device \xC3\xA9"; }
  void startPreview() override {}
  void stopPreview() override {}
  void capture() override {}
  void stopCapturing() override {}
  void startEncode(std::string) override {}
  void stopEncode() override {}
  bool selected() override { return kind == 0; }
};
struct FakeVideo : FakeBase, capture::video::Source {
  bool preview(uint8_t*, uint32_t, int32_t, int32_t) override { return false; }
  uint32_t width() override { return 1920; }
  uint32_t height() override { return 1080; }
  int32_t size() override { return 1920 * 1080 * 4; }
  int32_t pixelWidth() override { return 4; }
  int32_t channelOrder() override { return 0; }
};
struct FakeAudio : FakeBase, capture::audio::Source {
  uint16_t channels() override { return 2; }
  double peak(int32_t) override { return 0; }
};

std::vector<std::string> keys(const Descriptor& d) {
  std::vector<std::string> out;
  for (const auto& field : d) out.push_back(field.first);
  return out;
}

// Ids, kinds, selection and geometry reach the host as the integration tests check; what a
// JavaScript object cannot show is the key order with "size" twice and the UTF-8 of names.
TEST(Descriptor, VideoSourcesCarryGeometryWithSizeTwiceAudioSourcesDoNot) {
  FakeVideo display;
  const Descriptor d = capture::describeSource(3, display);
  EXPECT_EQ(keys(d), (std::vector<std::string>{"id", "name", "selected", "type", "pixelWidth", "width", "height",
                                               "size", "size"}));
  EXPECT_EQ(d[1].second, DescriptorValue(std::string("Device \xC3\xA9")));
  EXPECT_EQ(d[7].second, DescriptorValue(8294400));
  EXPECT_EQ(d[8].second, d[7].second);

  FakeAudio microphone;
  microphone.kind = capture::CameraMicrophone;
  EXPECT_EQ(keys(capture::describeSource(1, microphone)), (std::vector<std::string>{"id", "name", "selected", "type"}));
  EXPECT_STREQ(capture::typeName(42), "wasapi");  // any kind it does not know
}

}  // namespace
