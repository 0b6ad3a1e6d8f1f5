#include "platform/linux/ffmpeg/evenpicture.h"

#include <cstring>

namespace platform::evenpicture {

int evenSize(int size) { return size + (size & 1); }

void pad(const uint8_t* source, int width, int height, uint8_t* dst) {
  const size_t row = static_cast<size_t>(width) * 4;
  const size_t paddedRow = static_cast<size_t>(evenSize(width)) * 4;
  for (int y = 0; y < height; ++y) {
    uint8_t* to = dst + y * paddedRow;
    std::memcpy(to, source + y * row, row);
    if (paddedRow > row) std::memcpy(to + row, to + row - 4, 4);
  }
  if (evenSize(height) > height) std::memcpy(dst + height * paddedRow, dst + (height - 1) * paddedRow, paddedRow);
}

void repeatEdges(uint8_t* plane, ptrdiff_t stride, int width, int height) {
  if (width & 1)
    for (int y = 0; y < height; ++y) plane[y * stride + width] = plane[y * stride + width - 1];
  if (height & 1) std::memcpy(plane + height * stride, plane + (height - 1) * stride, evenSize(width));
}

}  // namespace platform::evenpicture
