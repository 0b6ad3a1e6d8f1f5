// The video encoder against real files: a clip from its start to its stop whatever the picture
// does, timing from the frames' stamps, the row flip, the fixed stream parameters and the
// failure path.
#include "capture/video/encoder/mftencoder.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <future>
#include <thread>

#include "capture/clock.h"
#include "media.h"
#include "support.h"

namespace {

using capture::steadyMillis;
using capture::video::Clip;
using capture::video::Frame;
using capture::video::FrameQueue;
using capture::video::encoder::MFTEncoder;

constexpr uint8_t red[3] = {0, 0, 255};  // B, G, R
constexpr uint8_t blue[3] = {255, 0, 0};

// `top` above the middle, `bottom` below, in a display frame's top-down B, G, R, A rows.
std::unique_ptr<Frame> frameAt(const FrameQueue& queue, int64_t timestamp, const uint8_t* top = red,
                               const uint8_t* bottom = blue) {
  auto frame = Frame::make(queue.width, queue.height, 0, timestamp);
  for (uint64_t y = 0; y < queue.height; ++y) {
    for (uint64_t x = 0; x < queue.width; ++x) {
      uint8_t* p = &frame->data[(y * queue.width + x) * 4];
      std::memcpy(p, y < queue.height / 2 ? top : bottom, 3);
      p[3] = 255;
    }
  }
  return frame;
}

void push(FrameQueue& queue, std::unique_ptr<Frame> frame) {
  {
    std::lock_guard<std::mutex> lock(queue.mutex);
    while (queue.frames.size() > 1) queue.frames.pop_front();  // as the screen pump does
    queue.frames.push_back(std::move(frame));
  }
  queue.changed.notify_all();
}

void stop(FrameQueue& queue, Clip& clip, int64_t at) {
  {
    std::lock_guard<std::mutex> lock(queue.mutex);
    clip.stop = at;
  }
  queue.changed.notify_all();
}

void sleepUntil(int64_t ms) {
  std::this_thread::sleep_until(std::chrono::steady_clock::time_point(std::chrono::milliseconds(ms)));
}

// A recording on its own thread, as a display's recording thread runs it.
struct Recording {
  Recording(FrameQueue& queue, const std::shared_ptr<Clip>& clip) : clip(clip) {
    done = std::async(std::launch::async, [&queue, clip]() -> std::string {
      MFTEncoder encoder(clip);
      return testsupport::failureOf([&] { encoder.encode(&queue); });
    });
  }
  std::shared_ptr<Clip> clip;
  std::future<std::string> done;
};

std::vector<uint8_t> pixel(const std::vector<uint8_t>& picture, int width, int x, int y) {
  const uint8_t* p = &picture[(static_cast<size_t>(y) * width + x) * 4];
  return {p[0], p[1], p[2]};
}

bool near(const std::vector<uint8_t>& got, const uint8_t* want) {
  for (int i = 0; i < 3; ++i)
    if (std::abs(int(got[i]) - int(want[i])) > 60) return false;
  return true;
}

TEST(MFTEncoder, AStillPictureIsRecordedFromTheStartToTheStopAndTheFileEndsAtOnce) {
  media::TempFolder folder;
  FrameQueue queue(L"display", 320, 240, 0);
  const int64_t start = steadyMillis();
  // The picture current at the start was captured long before it.
  auto clip = std::make_shared<Clip>(platform::widen(folder.file("still.mp4")), start, frameAt(queue, start - 5000));
  push(queue, frameAt(queue, start - 5000));
  Recording recording(queue, clip);
  sleepUntil(start + 400);
  const int64_t end = steadyMillis();
  stop(queue, *clip, end);
  // Nothing more comes from the screen; the file is finished all the same.
  ASSERT_EQ(recording.done.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  EXPECT_EQ(recording.done.get(), "no failure");

  const media::File file = media::probe(folder.file("still.mp4"));
  ASSERT_TRUE(file.opened);
  const auto& packets = file.streams[0].packets;
  ASSERT_GE(packets.size(), 3u);  // the first picture, repeats, the picture held to the stop
  EXPECT_NEAR(packets[0].time, 0.0, 1e-6);
  for (size_t i = 1; i < packets.size(); ++i) EXPECT_GT(packets[i].time, packets[i - 1].time);
  // Times lie on the declared rate's grid; the picture held to the stop ends within a frame of it.
  for (const auto& packet : packets) EXPECT_NEAR(packet.time * 30, std::round(packet.time * 30), 1e-3) << packet.time;
  EXPECT_NEAR(file.duration, (end - start) / 1000.0, 1 / 30.0 + 1e-3);
  EXPECT_EQ(file.streams[0].codec, "h264");
  EXPECT_EQ(file.streams[0].profile, FF_PROFILE_H264_MAIN);
}

TEST(MFTEncoder, NewPicturesKeepTheirCaptureTimesAndThePictureCurrentAtTheStopEndsTheClip) {
  media::TempFolder folder;
  FrameQueue queue(L"display", 160, 120, 0);
  const int64_t start = steadyMillis();
  auto clip = std::make_shared<Clip>(platform::widen(folder.file("times.mp4")), start, frameAt(queue, start - 20));
  Recording recording(queue, clip);
  push(queue, frameAt(queue, start + 33));
  push(queue, frameAt(queue, start + 100));
  sleepUntil(start + 250);
  push(queue, frameAt(queue, start + 250, blue, red));  // turned upside down just before the stop
  stop(queue, *clip, start + 260);
  ASSERT_EQ(recording.done.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  EXPECT_EQ(recording.done.get(), "no failure");

  const media::File file = media::probe(folder.file("times.mp4"));
  ASSERT_TRUE(file.opened);
  std::vector<double> times;
  for (const auto& packet : file.streams[0].packets) times.push_back(packet.time);
  ASSERT_GE(times.size(), 4u);
  EXPECT_NEAR(times[0], 0.0, 1e-6);
  // Capture times are kept to the nearest frame of the declared rate; repeats of a still picture
  // may come in between.
  for (double want : {1 / 30.0, 3 / 30.0, 8 / 30.0})  // 33, 100 and 250 ms
    EXPECT_NE(std::find_if(times.begin(), times.end(), [want](double t) { return std::abs(t - want) < 1e-4; }),
              times.end())
        << want;
  EXPECT_NEAR(file.duration, 0.260, 1 / 30.0);

  const media::Decoded decoded = media::decode(folder.file("times.mp4"), AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  ASSERT_EQ(decoded.width, 160);
  // Rows go in upright: red above, blue below at first; the last picture the other way round.
  EXPECT_TRUE(near(pixel(decoded.firstPicture, 160, 80, 10), red));
  EXPECT_TRUE(near(pixel(decoded.firstPicture, 160, 80, 110), blue));
  EXPECT_TRUE(near(pixel(decoded.lastPicture, 160, 80, 10), blue));
  EXPECT_TRUE(near(pixel(decoded.lastPicture, 160, 80, 110), red));
}

TEST(MFTEncoder, AClipWithoutAPictureAtItsStartBeginsWithTheFirstOneAtTimeZero) {
  media::TempFolder folder;
  FrameQueue queue(L"display", 1920, 1080, 0);
  const int64_t start = steadyMillis();
  auto clip = std::make_shared<Clip>(platform::widen(folder.file("fullhd.mp4")), start, nullptr);
  Recording recording(queue, clip);
  push(queue, frameAt(queue, start + 50));
  push(queue, frameAt(queue, start + 83));
  stop(queue, *clip, start + 200);
  ASSERT_EQ(recording.done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  EXPECT_EQ(recording.done.get(), "no failure");
  const media::File file = media::probe(folder.file("fullhd.mp4"));
  ASSERT_TRUE(file.opened);
  EXPECT_EQ(file.streams[0].width, 1920);
  EXPECT_EQ(file.streams[0].height, 1080);
  ASSERT_GE(file.streams[0].packets.size(), 2u);
  EXPECT_NEAR(file.streams[0].packets[0].time, 0.0, 1e-6);
  EXPECT_NEAR(file.duration, 0.200, 1 / 30.0);
}

TEST(MFTEncoder, AFailureAfterStartUpShutsMediaFoundationDownBeforeItLeaves) {
  while (SUCCEEDED(MFShutdown())) {
  }
  media::TempFolder folder;
  FrameQueue queue(L"display", 64, 64, 0);
  MFTEncoder encoder(
      std::make_shared<Clip>(platform::widen(folder.file("missing/clip.mp4")), steadyMillis(), frameAt(queue, 1)));
  const std::string text = testsupport::failureOf([&] { encoder.encode(&queue); });
  EXPECT_NE(text.find("\tnative/capture/video/encoder/mftencoder(54): 0x80070003: Could not create sink. "
                      "(The system cannot find the path specified.)"),
            std::string::npos)
      << text;
  EXPECT_EQ(MFShutdown(), MF_E_PLATFORM_NOT_INITIALIZED);
}

}  // namespace
