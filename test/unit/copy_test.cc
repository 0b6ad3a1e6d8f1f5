// The frame copy: the same bytes as memcpy whatever the alignment and length, nothing outside.
#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

#include "capture/video/copy.h"

TEST(CopyPicture, CopiesExactlyTheBytesAtAnyAlignmentAndLength) {
  std::vector<uint8_t> source(600);
  for (size_t i = 0; i < source.size(); ++i) source[i] = static_cast<uint8_t>(i * 7 + 3);
  for (size_t to = 0; to < 16; ++to) {
    for (size_t from = 0; from < 3; ++from) {
      for (size_t bytes : {0, 1, 15, 16, 17, 63, 64, 65, 127, 128, 129, 200, 511}) {
        std::vector<uint8_t> target(600, 0xEE);
        capture::video::copyPicture(target.data() + to, source.data() + from, bytes);
        for (size_t i = 0; i < target.size(); ++i) {
          const bool inside = i >= to && i < to + bytes;
          ASSERT_EQ(target[i], inside ? source[i - to + from] : 0xEE)
              << "to " << to << " from " << from << " bytes " << bytes << " at " << i;
        }
      }
    }
  }
}
