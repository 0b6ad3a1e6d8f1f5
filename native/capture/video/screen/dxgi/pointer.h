// The mouse pointer of a screen source: its last known shape, visibility and position, and its
// composition into captured frames (duplication delivers the desktop without it).
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "capture/video/frame.h"
#include "platform/dxgi.h"

namespace capture::video::screen::dxgi {

struct PointerInfo {
  std::unique_ptr<uint8_t[]> shapeBuffer;
  uint32_t shapeBufferSize = 0;
  DXGI_OUTDUPL_POINTER_SHAPE_INFO shapeInfo{};
  bool visible = false;
  POINT position{};  // top-left corner of the shape in the output's image
  int64_t lastTimeStamp = 0;
};

// IDXGIOutputDuplication::GetFramePointerShape, or a stand-in.
using FetchShape = std::function<HRESULT(UINT bufferSize, void* buffer, UINT* requiredSize,
                                         DXGI_OUTDUPL_POINTER_SHAPE_INFO* shapeInfo)>;

// Applies the pointer part of one frame's information; throws when the shape cannot be fetched.
void updatePointer(PointerInfo& pointer, const DXGI_OUTDUPL_FRAME_INFO& frameInfo, const FetchShape& fetchShape);

// Composes the pointer into the frame's B, G, R, A pixels in place.
void drawPointer(const PointerInfo& pointer, capture::video::Frame& frame);

}  // namespace capture::video::screen::dxgi
