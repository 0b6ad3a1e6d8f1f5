// Media types the capture-engine manager asks its sinks for.
#pragma once

#include <cstdint>

#include "platform/mfcapture.h"

namespace capture::video::camera::mfce {

// A video type with the given subtype and the source's frame size, rate, pixel aspect ratio and
// interlace mode (each must be present).
HRESULT MakeVideoType(IMFMediaType* sourceType, REFGUID subtype, IMFMediaType** type);

// The PCM form of an audio type; the same object (one more reference) when it is PCM already.
HRESULT MakePcmType(IMFMediaType* audioType, IMFMediaType** type);

// Bits per second for encoding a video type: width / 3 * height * rate, in single precision.
UINT32 EstimateBitrate(IMFMediaType* videoType);

// The same figure from the numbers themselves.
UINT32 EstimateBitrate(UINT32 width, UINT32 height, UINT32 numerator, UINT32 denominator);

}  // namespace capture::video::camera::mfce
