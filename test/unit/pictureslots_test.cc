// Where a camera's pictures go in a clip, with reads that come late by varying amounts as they do
// on a busy machine.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <random>
#include <vector>

#include "platform/linux/capture/pictureslots.h"

namespace {

using platform::pictureslots::PictureSlots;

constexpr int64_t frame = 333333;  // 30 frames a second, in 100 ns
constexpr int64_t ms = 10000;

struct Picture {
  int64_t deviceTime;
  int64_t readTime;
};

// A steady device whose pictures are stamped within half a millisecond of its frame rate and read
// `delay` after that, never before the one before; the first is read at `firstRead`.
std::vector<Picture> steadyDevice(int count, int64_t firstRead, std::mt19937& random,
                                  std::uniform_int_distribution<int64_t> delay) {
  std::uniform_int_distribution<int64_t> stamp(-ms / 2, ms / 2);
  std::vector<Picture> pictures;
  const int64_t firstDelay = delay(random);
  for (int n = 0; n < count; ++n) {
    const int64_t read = firstRead + n * frame + (n ? delay(random) - firstDelay : 0);
    pictures.push_back(
        {123456789 + n * frame + stamp(random), pictures.empty() ? read : std::max(read, pictures.back().readTime)});
  }
  return pictures;
}

std::vector<int64_t> place(const std::vector<Picture>& pictures) {
  PictureSlots slots;
  slots.open(pictures[0].deviceTime, pictures[0].readTime, frame);
  std::vector<int64_t> placed{0};
  for (size_t n = 1; n < pictures.size(); ++n)
    placed.push_back(slots.place(pictures[n].deviceTime, pictures[n].readTime, frame));
  return placed;
}

TEST(PictureSlots, EveryPictureOfASteadyDeviceHasASlotOfItsOwnWhereverTheClipStartsAndHoweverReadsJitter) {
  std::mt19937 random(7);
  for (int64_t phase = 0; phase < frame; phase += frame / 64) {
    for (const int64_t spread : {3 * ms, 15 * ms}) {
      const auto pictures = steadyDevice(300, phase, random, std::uniform_int_distribution<int64_t>(0, spread));
      const auto placed = place(pictures);
      for (size_t n = 2; n < placed.size(); ++n)
        ASSERT_EQ(placed[n] - placed[n - 1], frame)
            << "picture " << n << ", first read at " << phase << ", reads up to " << spread << " late";
      for (size_t n = 1; n < placed.size(); ++n)
        ASSERT_LE(placed[n], pictures[n].readTime + frame / 2) << "picture " << n << ", first read at " << phase;
    }
  }
}

TEST(PictureSlots, PicturesReadLateAtTheStartOrAfterAClockJumpAreNeverHalfASlotAfterTheirReads) {
  // The clip's first picture and the next five come 100 ms late, the rest back to back until they
  // are on time again; then the device's clock jumps ten seconds ahead.
  std::vector<Picture> pictures;
  for (int n = 0; n < 60; ++n) {
    const int64_t onTime = 2 * ms + n * frame;
    const int64_t read = n < 6 ? onTime + 100 * ms : std::max(onTime, pictures.back().readTime + ms);
    pictures.push_back({n * frame + (n >= 40 ? 100000000 : 0), read});
  }
  const auto placed = place(pictures);
  for (size_t n = 1; n < placed.size(); ++n) {
    ASSERT_LE(placed[n], pictures[n].readTime + frame / 2) << "picture " << n;
    ASSERT_GE(placed[n], placed[n - 1]) << "picture " << n;
  }
  for (size_t n : {size_t{20}, size_t{45}}) EXPECT_EQ(placed[n] - placed[n - 1], frame) << "picture " << n;
}

TEST(PictureSlots, APictureCapturedInTheFirstSlotOrBeforeTakesItFromTheOneCurrentAtTheStart) {
  PictureSlots slots;
  slots.open(0, -10 * ms, frame);  // read 10 ms before the start
  EXPECT_EQ(slots.place(frame, frame - 10 * ms, frame), 0);
  EXPECT_EQ(slots.place(2 * frame, 2 * frame - 10 * ms, frame), frame);
  PictureSlots slow;
  slow.open(0, -50 * ms, frame);  // its successor, captured before the start, is read after it
  EXPECT_EQ(slow.place(frame, 5 * ms, frame), 0);
}

}  // namespace
