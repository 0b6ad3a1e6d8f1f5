// The video encoder against real files: the two-frame rule, timing from the frames' stamps,
// the row flip, the fixed stream parameters and the failure path.
#include "capture/video/encoder/mftencoder.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "media.h"

namespace {

using capture::video::Frame;
using capture::video::FrameQueue;
using capture::video::encoder::MFTEncoder;

// Red above the middle, blue below, in a display frame's top-down B, G, R, A rows.
std::unique_ptr<Frame> frameAt(uint64_t width, uint64_t height, int64_t timestamp) {
  auto frame = Frame::make(width, height, 0, timestamp);
  for (uint64_t y = 0; y < height; ++y) {
    for (uint64_t x = 0; x < width; ++x) {
      uint8_t* p = &frame->data[(y * width + x) * 4];
      const bool top = y < height / 2;
      p[0] = top ? 0 : 255;
      p[1] = 0;
      p[2] = top ? 255 : 0;
      p[3] = 255;
    }
  }
  return frame;
}

void push(FrameQueue& queue, int64_t timestamp) {
  auto frame = frameAt(queue.width, queue.height, timestamp);
  std::lock_guard<std::mutex> lock(queue.mutex);
  queue.frames.push_back(std::move(frame));
}

size_t queued(FrameQueue& queue) {
  std::lock_guard<std::mutex> lock(queue.mutex);
  return queue.frames.size();
}

// Waits (bounded) until the queue holds `count` frames.
bool waitForQueued(FrameQueue& queue, size_t count) {
  for (int i = 0; i < 2000; ++i) {
    if (queued(queue) == count) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return false;
}

// Runs a recording the way a display's recording thread does, and stops it once `written`
// frames have left the queue; returns what encode threw, if anything.
std::string record(FrameQueue& queue, const std::vector<int64_t>& stamps, size_t written) {
  for (int64_t stamp : stamps) push(queue, stamp);
  queue.stopped.store(false);
  auto done = std::async(std::launch::async, [&queue]() -> std::string {
    MFTEncoder encoder;
    try {
      encoder.encode(&queue);
    } catch (const std::runtime_error& error) {
      return error.what();
    }
    return "";
  });
  EXPECT_TRUE(waitForQueued(queue, stamps.size() - written));
  queue.stopped.store(true);
  // The encoder may already wait for one more frame; give it one, later than all the others.
  push(queue, stamps.back() + 1000);
  return done.get();
}

TEST(MFTEncoder, TimesSamplesFromTheFirstFrameWithTheFixedDuration) {
  media::TempFolder folder;
  const std::string path = folder.file("timing.mp4");
  FrameQueue queue(platform::widen(path), 320, 240, 0);
  EXPECT_EQ(record(queue, {1000, 1033, 1100, 1200}, 3), "");

  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  const auto& packets = file.streams[0].packets;
  ASSERT_GE(packets.size(), 3u);
  ASSERT_LE(packets.size(), 4u);  // a fourth when the stop came while it waited for a frame
  EXPECT_NEAR(packets[0].time, 0.0, 1e-6);
  EXPECT_NEAR(packets[1].time, 0.033, 1e-6);
  EXPECT_NEAR(packets[2].time, 0.100, 1e-6);
  // MP4 keeps the times; the last sample's own duration (1/60 s) ends the file.
  EXPECT_NEAR(packets.back().duration, 166666e-7, 2e-5);
  EXPECT_NEAR(file.duration, packets.back().time + 166666e-7, 1e-3);  // the movie header counts milliseconds
  EXPECT_EQ(file.streams[0].codec, "h264");
  EXPECT_EQ(file.streams[0].profile, FF_PROFILE_H264_MAIN);
  EXPECT_EQ(file.streams[0].width, 320);
  EXPECT_EQ(file.streams[0].height, 240);
}

TEST(MFTEncoder, FlippedRowsComeOutUprightInTheFile) {
  media::TempFolder folder;
  const std::string path = folder.file("upright.mp4");
  FrameQueue queue(platform::widen(path), 160, 120, 0);
  EXPECT_EQ(record(queue, {5000, 5033, 5066}, 2), "");
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  ASSERT_EQ(decoded.width, 160);
  ASSERT_EQ(decoded.height, 120);
  const uint8_t* top = &decoded.firstPicture[(10 * 160 + 80) * 4];
  const uint8_t* bottom = &decoded.firstPicture[(110 * 160 + 80) * 4];
  EXPECT_GT(top[2], 180);  // red above
  EXPECT_LT(top[0], 80);
  EXPECT_GT(bottom[0], 180);  // blue below
  EXPECT_LT(bottom[2], 80);
}

TEST(MFTEncoder, FullHdRecordingHasTheFixedStreamParameters) {
  media::TempFolder folder;
  const std::string path = folder.file("fullhd.mp4");
  FrameQueue queue(platform::widen(path), 1920, 1080, 0);
  EXPECT_EQ(record(queue, {100, 133, 166}, 2), "");
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  EXPECT_EQ(file.streams[0].width, 1920);
  EXPECT_EQ(file.streams[0].height, 1080);
  EXPECT_EQ(file.streams[0].profile, FF_PROFILE_H264_MAIN);
  EXPECT_GE(file.streams[0].packets.size(), 2u);
  EXPECT_LE(file.streams[0].packets.size(), 3u);
}

TEST(MFTEncoder, WritesNothingWhileOnlyOneFrameIsQueued) {
  media::TempFolder folder;
  const std::string path = folder.file("one.mp4");
  FrameQueue queue(platform::widen(path), 64, 64, 0);
  push(queue, 1000);
  queue.stopped.store(false);
  auto done = std::async(std::launch::async, [&queue] {
    MFTEncoder encoder;
    encoder.encode(&queue);
  });
  // The newest frame stays for the preview, however long the encoder waits.
  EXPECT_EQ(done.wait_for(std::chrono::milliseconds(150)), std::future_status::timeout);
  EXPECT_EQ(queued(queue), 1u);
  // A stop is honoured only after the next written frame.
  queue.stopped.store(true);
  EXPECT_EQ(done.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
  push(queue, 1040);
  done.get();
  EXPECT_EQ(queued(queue), 1u);
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams[0].packets.size(), 1u);
  EXPECT_NEAR(file.streams[0].packets[0].time, 0.0, 1e-6);
}

TEST(MFTEncoder, AFailureAfterStartUpShutsMediaFoundationDownBeforeItLeaves) {
  while (SUCCEEDED(MFShutdown())) {
  }
  media::TempFolder folder;
  FrameQueue queue(platform::widen(folder.file("missing/clip.mp4")), 64, 64, 0);
  queue.stopped.store(false);
  MFTEncoder encoder;
  try {
    encoder.encode(&queue);
    FAIL() << "encode did not throw";
  } catch (const std::runtime_error& error) {
    const std::string text = error.what();
    EXPECT_NE(text.find("\tnative/capture/video/encoder/mftencoder(54): 0x80070003: Could not create sink. "
                        "(The system cannot find the path specified.)"),
              std::string::npos)
        << text;
  }
  EXPECT_EQ(MFShutdown(), MF_E_PLATFORM_NOT_INITIALIZED);
}

}  // namespace
