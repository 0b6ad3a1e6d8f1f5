#include "capture/video/screen/dxgi/pointer.h"

#include "capture/check.h"

namespace capture::video::screen::dxgi {

void updatePointer(PointerInfo& pointer, const DXGI_OUTDUPL_FRAME_INFO& frameInfo, const FetchShape& fetchShape) {
  if (frameInfo.LastMouseUpdateTime.QuadPart == 0) return;
  pointer.lastTimeStamp = frameInfo.LastMouseUpdateTime.QuadPart;
  pointer.visible = frameInfo.PointerPosition.Visible != 0;
  if (pointer.visible) pointer.position = frameInfo.PointerPosition.Position;
  if (frameInfo.PointerShapeBufferSize == 0) return;

  pointer.shapeBufferSize = frameInfo.PointerShapeBufferSize;
  pointer.shapeBuffer.reset();
  pointer.shapeBuffer.reset(new uint8_t[pointer.shapeBufferSize]);
  DXGI_OUTDUPL_POINTER_SHAPE_INFO info{};
  UINT required = pointer.shapeBufferSize;
  HRESULT hr = fetchShape(pointer.shapeBufferSize, pointer.shapeBuffer.get(), &required, &info);
  pointer.shapeBufferSize = required;
  capture::checkResult("native/capture/video/screen/dxgi/source", 217, hr, "Couldn't get pointer size.");
  pointer.shapeInfo = info;
}

void drawPointer(const PointerInfo& pointer, capture::video::Frame& frame) {
  if (!pointer.visible) return;
  const uint32_t type = pointer.shapeInfo.Type;
  const uint64_t shapeWidth = pointer.shapeInfo.Width;
  const uint64_t shapeHeight = pointer.shapeInfo.Height;
  const uint64_t pitch = pointer.shapeInfo.Pitch;
  const uint8_t* shape = pointer.shapeBuffer.get();
  const uint64_t rows = type == DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MONOCHROME ? shapeHeight / 2 : shapeHeight;
  const uint64_t width = frame.width;
  const uint64_t height = frame.height;
  uint8_t* pixels = frame.data.get();

  // As unsigned numbers, negative coordinates lie beyond the frame: such a pointer is not drawn.
  const uint64_t y0 = static_cast<uint64_t>(static_cast<int64_t>(pointer.position.y));
  const uint64_t x0 = static_cast<uint64_t>(static_cast<int64_t>(pointer.position.x));
  if (y0 >= height) return;

  for (uint64_t y = y0, sy = 0; y < height && sy < rows; ++y, ++sy) {
    for (uint64_t x = x0, sx = 0; x < width && sx < shapeWidth; ++x, ++sx) {
      uint8_t* p = pixels + (y * width + x) * 4;
      const uint8_t b = p[0], g = p[1], r = p[2];
      uint8_t nb, ng, nr;
      if (type == DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MONOCHROME) {
        const uint8_t bit = static_cast<uint8_t>(0x80 >> (sx % 8));
        const bool andBit = (shape[sy * pitch + sx / 8] & bit) != 0;
        const bool xorBit = (shape[(shapeHeight / 2 + sy) * pitch + sx / 8] & bit) != 0;
        nb = andBit ? b : 0;
        ng = andBit ? g : 0;
        nr = andBit ? r : 0;
        if (xorBit) {
          nb = static_cast<uint8_t>(255 - nb);
          ng = static_cast<uint8_t>(255 - ng);
          nr = static_cast<uint8_t>(255 - nr);
        }
      } else {
        // Colour shapes are addressed by their width, not by Pitch.
        const uint8_t* s = shape + (sy * shapeWidth + sx) * 4;
        if (type == DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MASKED_COLOR) {
          if (s[3] == 0) {
            nb = s[0];
            ng = s[1];
            nr = s[2];
          } else {
            // Blue and green both come from the screen's blue: kept as the recordings have it.
            nb = static_cast<uint8_t>(b ^ s[1]);
            ng = static_cast<uint8_t>(b ^ s[1]);
            nr = static_cast<uint8_t>(r ^ s[2]);
          }
        } else {
          const float a = s[3] / 255.0f;
          nb = static_cast<uint8_t>(static_cast<int32_t>(b * (1 - a) + s[0] * a));
          ng = static_cast<uint8_t>(static_cast<int32_t>(g * (1 - a) + s[1] * a));
          nr = static_cast<uint8_t>(static_cast<int32_t>(r * (1 - a) + s[2] * a));
        }
      }
      const uint32_t value = 0xFF000000u | static_cast<uint32_t>(nr) << 16 | static_cast<uint32_t>(ng) << 8 | nb;
      p[0] = static_cast<uint8_t>(value);
      p[1] = static_cast<uint8_t>(value >> 8);
      p[2] = static_cast<uint8_t>(value >> 16);
      p[3] = static_cast<uint8_t>(value >> 24);
    }
  }
}

}  // namespace capture::video::screen::dxgi
