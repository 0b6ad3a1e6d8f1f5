// Display capture: pointer composition, pointer updates and the grab of a display source,
// against scripted DXGI objects.
#include <gtest/gtest.h>

#include <array>
#include <stdexcept>
#include <string>

#include "capture/clock.h"
#include "capture/video/screen/dxgi/pointer.h"
#include "capture/video/screen/dxgi/source.h"
#include "fakes/dxgi.h"
#include "support.h"

using capture::video::Frame;
using capture::video::screen::dxgi::drawPointer;
using capture::video::screen::dxgi::PointerInfo;
using capture::video::screen::dxgi::Source;
using capture::video::screen::dxgi::updatePointer;
using testsupport::failureOf;

namespace {

std::unique_ptr<Frame> filledFrame(uint64_t width, uint64_t height, std::array<uint8_t, 4> pixel) {
  auto frame = Frame::make(width, height, 0, 0);
  for (uint64_t i = 0; i < width * height; ++i) std::memcpy(&frame->data[i * 4], pixel.data(), 4);
  return frame;
}

std::array<uint8_t, 4> pixelAt(const Frame& frame, uint64_t x, uint64_t y) {
  std::array<uint8_t, 4> p;
  std::memcpy(p.data(), &frame.data[(y * frame.width + x) * 4], 4);
  return p;
}

using Pixel = std::array<uint8_t, 4>;

// A visible colour pointer of one colour, w x h, at (x, y).
PointerInfo colourPointer(uint32_t type, uint32_t w, uint32_t h, LONG x, LONG y, Pixel colour, uint32_t pitch = 0) {
  PointerInfo p;
  p.visible = true;
  p.position = {x, y};
  p.shapeInfo.Type = type;
  p.shapeInfo.Width = w;
  p.shapeInfo.Height = h;
  p.shapeInfo.Pitch = pitch ? pitch : w * 4;
  p.shapeBufferSize = std::max(p.shapeInfo.Pitch, w * 4) * h;
  p.shapeBuffer.reset(new uint8_t[p.shapeBufferSize]);
  for (uint32_t i = 0; i < w * h; ++i) std::memcpy(&p.shapeBuffer[i * 4], colour.data(), 4);
  return p;
}

// Counts the pixels of a frame that differ from `background`.
int changedPixels(const Frame& frame, Pixel background) {
  int n = 0;
  for (uint64_t i = 0; i < frame.width * frame.height; ++i)
    n += std::memcmp(&frame.data[i * 4], background.data(), 4) != 0;
  return n;
}

}  // namespace

TEST(PointerComposition, MonochromeMasksKeepBlackenInvertAndWhiten) {
  // A 32 x 64 shape is 32 x 32 pixels: AND mask rows 0-31, XOR mask rows 32-63, 4 bytes a row.
  PointerInfo p;
  p.visible = true;
  p.position = {0, 0};
  p.shapeInfo = {DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MONOCHROME, 32, 64, 4, {0, 0}};
  p.shapeBufferSize = 64 * 4;
  p.shapeBuffer = std::make_unique<uint8_t[]>(p.shapeBufferSize);
  // Columns 0-7: AND 1, XOR 0; 8-15: AND 0, XOR 0; 16-23: AND 1, XOR 1; 24-31: AND 0, XOR 1.
  for (int row = 0; row < 32; ++row) {
    uint8_t* andRow = &p.shapeBuffer[row * 4];
    uint8_t* xorRow = &p.shapeBuffer[(32 + row) * 4];
    andRow[0] = 0xFF, andRow[1] = 0x00, andRow[2] = 0xFF, andRow[3] = 0x00;
    xorRow[0] = 0x00, xorRow[1] = 0x00, xorRow[2] = 0xFF, xorRow[3] = 0xFF;
  }
  auto frame = filledFrame(40, 40, {10, 20, 30, 0});
  drawPointer(p, *frame);
  EXPECT_EQ(pixelAt(*frame, 3, 5), (Pixel{10, 20, 30, 255}));
  EXPECT_EQ(pixelAt(*frame, 9, 5), (Pixel{0, 0, 0, 255}));
  EXPECT_EQ(pixelAt(*frame, 20, 31), (Pixel{245, 235, 225, 255}));
  EXPECT_EQ(pixelAt(*frame, 31, 0), (Pixel{255, 255, 255, 255}));
  // 32 rows and 32 columns are drawn, nothing beyond.
  EXPECT_EQ(pixelAt(*frame, 3, 32), (Pixel{10, 20, 30, 0}));
  EXPECT_EQ(pixelAt(*frame, 32, 3), (Pixel{10, 20, 30, 0}));
  EXPECT_EQ(changedPixels(*frame, {10, 20, 30, 0}), 32 * 32);
}

TEST(PointerComposition, MaskedColourXorsWithScreenBlueOrReplaces) {
  auto frame = filledFrame(4, 4, {10, 20, 30, 0});
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MASKED_COLOR, 1, 1, 0, 0, {1, 2, 3, 255}), *frame);
  EXPECT_EQ(pixelAt(*frame, 0, 0), (Pixel{8, 8, 29, 255}));
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MASKED_COLOR, 1, 1, 1, 0, {1, 2, 3, 0}), *frame);
  EXPECT_EQ(pixelAt(*frame, 1, 0), (Pixel{1, 2, 3, 255}));
}

TEST(PointerComposition, ColourBlendsByAlphaAndAlwaysSetsOpaque) {
  auto frame = filledFrame(4, 4, {0, 0, 0, 0});
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 1, 1, 0, 0, {255, 255, 255, 128}), *frame);
  EXPECT_EQ(pixelAt(*frame, 0, 0), (Pixel{128, 128, 128, 255}));

  auto other = filledFrame(4, 4, {10, 20, 30, 7});
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 2, 2, 1, 1, {200, 100, 50, 0}), *other);
  EXPECT_EQ(pixelAt(*other, 1, 1), (Pixel{10, 20, 30, 255}));
  EXPECT_EQ(pixelAt(*other, 2, 2), (Pixel{10, 20, 30, 255}));
  EXPECT_EQ(pixelAt(*other, 0, 0), (Pixel{10, 20, 30, 7}));
}

TEST(PointerComposition, ColourShapesAreAddressedByWidthNotPitch) {
  // Pitch says 8 pixels a row, but rows are read at Width (2 pixels) apart.
  PointerInfo p = colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 2, 2, 0, 0, {0, 0, 0, 255}, 32);
  std::memcpy(&p.shapeBuffer[2 * 4], Pixel{9, 9, 9, 255}.data(), 4);  // third pixel: row 1, column 0
  auto frame = filledFrame(4, 4, {50, 50, 50, 255});
  drawPointer(p, *frame);
  EXPECT_EQ(pixelAt(*frame, 0, 1), (Pixel{9, 9, 9, 255}));
}

TEST(PointerComposition, ClipsAtRightAndBottomAndSkipsNegativeCorners) {
  const Pixel white{255, 255, 255, 255};
  const Pixel grey{100, 100, 100, 255};
  auto frame = filledFrame(64, 48, grey);
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 32, 32, 64 - 3, 10, white), *frame);
  EXPECT_EQ(changedPixels(*frame, grey), 3 * 32);
  EXPECT_EQ(pixelAt(*frame, 63, 10), white);
  EXPECT_EQ(pixelAt(*frame, 60, 10), grey);

  frame = filledFrame(64, 48, grey);
  drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 32, 32, 10, 48 - 2, white), *frame);
  EXPECT_EQ(changedPixels(*frame, grey), 2 * 32);

  for (POINT corner : {POINT{-5, 10}, POINT{10, -1}, POINT{64, 0}, POINT{0, 48}}) {
    frame = filledFrame(64, 48, grey);
    drawPointer(colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 32, 32, corner.x, corner.y, white), *frame);
    EXPECT_EQ(changedPixels(*frame, grey), 0) << corner.x << "," << corner.y;
  }

  PointerInfo hidden = colourPointer(DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 4, 4, 0, 0, white);
  hidden.visible = false;
  frame = filledFrame(8, 8, grey);
  drawPointer(hidden, *frame);
  EXPECT_EQ(changedPixels(*frame, grey), 0);
}

namespace {

DXGI_OUTDUPL_FRAME_INFO pointerUpdate(int64_t time, LONG x, LONG y, bool visible, UINT shapeSize = 0) {
  DXGI_OUTDUPL_FRAME_INFO info{};
  info.LastMouseUpdateTime.QuadPart = time;
  info.PointerPosition.Position = {x, y};
  info.PointerPosition.Visible = visible ? TRUE : FALSE;
  info.PointerShapeBufferSize = shapeSize;
  return info;
}

}  // namespace

TEST(PointerUpdate, FollowsPositionVisibilityAndShape) {
  PointerInfo p;
  int fetches = 0;
  auto fetch = [&](UINT size, void* buffer, UINT* required, DXGI_OUTDUPL_POINTER_SHAPE_INFO* info) {
    ++fetches;
    EXPECT_EQ(size, 16u);
    std::memset(buffer, 0xAB, size);
    *required = size;
    *info = {DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 2, 2, 8, {1, 1}};
    return S_OK;
  };

  // No update time: nothing changes although the other fields are set.
  updatePointer(p, pointerUpdate(0, 5, 6, true, 16), fetch);
  EXPECT_FALSE(p.visible);
  EXPECT_EQ(p.position.x, 0);
  EXPECT_EQ(fetches, 0);

  updatePointer(p, pointerUpdate(100, 5, 6, true, 16), fetch);
  EXPECT_TRUE(p.visible);
  EXPECT_EQ(p.position.x, 5);
  EXPECT_EQ(p.position.y, 6);
  EXPECT_EQ(p.lastTimeStamp, 100);
  EXPECT_EQ(fetches, 1);
  EXPECT_EQ(p.shapeBufferSize, 16u);
  EXPECT_EQ(p.shapeInfo.Width, 2u);
  EXPECT_EQ(p.shapeBuffer[15], 0xAB);

  // A position update without a shape keeps the shape.
  const uint8_t* shape = p.shapeBuffer.get();
  updatePointer(p, pointerUpdate(200, 7, 8, true), fetch);
  EXPECT_EQ(fetches, 1);
  EXPECT_EQ(p.shapeBuffer.get(), shape);
  EXPECT_EQ(p.position.x, 7);

  // Invisible: hidden, old position kept.
  updatePointer(p, pointerUpdate(300, 50, 60, false), fetch);
  EXPECT_FALSE(p.visible);
  EXPECT_EQ(p.position.x, 7);
  EXPECT_EQ(p.position.y, 8);
  EXPECT_EQ(p.lastTimeStamp, 300);
}

TEST(PointerUpdate, FailedShapeFetchThrowsAndKeepsShapeInfo) {
  PointerInfo p;
  p.shapeInfo.Width = 11;
  auto fetch = [](UINT, void*, UINT* required, DXGI_OUTDUPL_POINTER_SHAPE_INFO* info) {
    *required = 64;
    info->Width = 99;
    return DXGI_ERROR_MORE_DATA;
  };
  const std::string text = failureOf([&] { updatePointer(p, pointerUpdate(1, 0, 0, true, 32), fetch); });
  EXPECT_NE(text.find("native/capture/video/screen/dxgi/source"), std::string::npos) << text;
  EXPECT_NE(text.find("217"), std::string::npos) << text;
  EXPECT_NE(text.find("Couldn't get pointer size."), std::string::npos) << text;
  EXPECT_EQ(p.shapeInfo.Width, 11u);
  EXPECT_NE(p.shapeBuffer, nullptr);
  EXPECT_EQ(p.shapeBufferSize, 64u);  // the required size came back
}

namespace {

// One 8 x 4 output with a scripted duplication whose desktop image is numbered pixels.
class DisplayGrab : public ::testing::Test {
 protected:
  DisplayGrab() : output(RECT{1920, 0, 1928, 4}), desktop(8, 4), first(&desktop), second(&desktop) {
    for (size_t i = 0; i < desktop.pixels.size(); ++i) desktop.pixels[i] = static_cast<uint8_t>(i);
    output.next.push_back(&first);
  }

  void acquireFrame(DXGI_OUTDUPL_FRAME_INFO info = {}) { first.steps.push_back({S_OK, info}); }

  static std::string failure(Source& source) {
    return failureOf([&] { source.capture(); });
  }

  fakes::Output output;
  fakes::Device device;
  fakes::Texture desktop;
  fakes::Duplication first, second;
};

}  // namespace

TEST_F(DisplayGrab, OpensTheOutputAtItsDesktopSize) {
  Source source(&output, &device, true);
  EXPECT_EQ(source.outputWidth, 8);
  EXPECT_EQ(source.outputHeight, 4);
  EXPECT_EQ(source.size(), 8 * 4 * 4);
  EXPECT_TRUE(source.selected());
  EXPECT_EQ(source.acquireTimeout, 5u);
  EXPECT_EQ(device.lastDesc.Usage, D3D11_USAGE_STAGING);
  EXPECT_EQ(device.lastDesc.CPUAccessFlags, static_cast<UINT>(D3D11_CPU_ACCESS_READ));
  EXPECT_EQ(device.lastDesc.Format, DXGI_FORMAT_B8G8R8A8_UNORM);
  EXPECT_EQ(source.queue->width, 8u);
  EXPECT_TRUE(source.queue->stopped);
  EXPECT_EQ(source.duplication.Get(), &first);
}

TEST_F(DisplayGrab, FailedDuplicationFailsTheSourceAndReleasesWhatItTook) {
  output.next.clear();
  output.failures.push_back(E_ACCESSDENIED);
  const std::string text = failureOf([&] { Source source(&output, &device, false); });
  EXPECT_NE(text.find("Could not get output duplicator from device."), std::string::npos) << text;
  EXPECT_NE(text.find("native/capture/video/screen/dxgi/duplicate"), std::string::npos) << text;
  EXPECT_EQ(output.references, 1u);
  EXPECT_EQ(device.references, 1u);
  EXPECT_EQ(device.textures.at(0)->references, 0u);
}

TEST_F(DisplayGrab, CopiesTheDesktopAndDrawsThePointer) {
  first.shape.assign(4, 0);
  std::memcpy(first.shape.data(), Pixel{1, 2, 3, 255}.data(), 4);
  first.shapeInfo = {DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR, 1, 1, 4, {0, 0}};
  acquireFrame(pointerUpdate(10, 2, 1, true, 4));
  Source source(&output, &device, false);
  const int64_t before = capture::steadyMillis();
  source.capture();

  ASSERT_EQ(source.queue->frames.size(), 1u);
  const Frame& frame = *source.queue->frames.back();
  EXPECT_EQ(frame.width, 8u);
  EXPECT_EQ(frame.height, 4u);
  EXPECT_EQ(frame.channelOrder, 0u);
  // Timed by the clock that only runs forward, which clips are timed by.
  EXPECT_GE(frame.timestamp, before);
  EXPECT_LE(frame.timestamp, capture::steadyMillis());
  EXPECT_EQ(pixelAt(frame, 2, 1), (Pixel{1, 2, 3, 255}));
  EXPECT_EQ(std::memcmp(frame.data.get(), desktop.pixels.data(), 40), 0);  // row 0 and part of row 1
  EXPECT_FALSE(first.held);
  EXPECT_EQ(first.resource.references, 1u);
  EXPECT_EQ(desktop.references, 1u);
  EXPECT_EQ(first.lastTimeout, 5u);

  // Without the pointer, a later frame is the plain desktop, but the pointer state still moves.
  source.captureMouse = false;
  acquireFrame(pointerUpdate(20, 5, 3, true));
  source.capture();
  EXPECT_EQ(source.pointer.position.x, 5);
  EXPECT_EQ(std::memcmp(source.queue->frames.back()->data.get(), desktop.pixels.data(), desktop.pixels.size()), 0);
}

TEST_F(DisplayGrab, PreviewIsFalseBeforeAFrameAndAStillDesktopAddsNothing) {
  Source source(&output, &device, false);
  std::vector<uint8_t> preview(8 * 4 * 4, 7);
  EXPECT_FALSE(source.preview(preview.data(), 1, 2, 2));
  EXPECT_EQ(preview[0], 7);

  acquireFrame();
  source.capture();
  source.capture();  // time-out
  EXPECT_EQ(source.queue->frames.size(), 1u);
  EXPECT_EQ(device.context.copies, 1);
  // The preview keeps the last frame.
  EXPECT_TRUE(source.preview(preview.data(), 1, 8, 4));
  EXPECT_EQ(preview[0], desktop.pixels[2]);  // red and blue exchanged
  EXPECT_EQ(preview[2], desktop.pixels[0]);
  EXPECT_EQ(preview[5], desktop.pixels[5]);
}

TEST_F(DisplayGrab, WhileAClipRecordsThePicturesItHasNotTakenStayAndTheirMemoryIsUsedAgain) {
  Source source(&output, &device, false);
  source.queue->stopped = false;
  for (int i = 0; i < 40; ++i) {
    desktop.pixels[0] = static_cast<uint8_t>(i);
    acquireFrame();
    source.capture();
  }
  // Up to a bound (30 waiting besides the newest): an encoder that cannot keep up loses the oldest.
  ASSERT_EQ(source.queue->frames.size(), 31u);
  EXPECT_EQ(source.queue->frames.front()->data[0], 9);
  EXPECT_EQ(source.queue->frames.back()->data[0], 39);

  const uint8_t* taken = source.queue->frames.front()->data.get();
  source.queue->frames.pop_front();  // the recording thread is done with it
  source.queue->stopped = true;
  acquireFrame();
  source.capture();
  EXPECT_EQ(source.queue->frames.back()->data.get(), taken);
  EXPECT_EQ(source.queue->frames.back()->data.get_deleter().pool, source.queue->pixels);
  EXPECT_EQ(source.queue->frames.size(), 2u);
}

TEST_F(DisplayGrab, OtherAcquisitionResultsAreTakenAsFrames) {
  first.steps.push_back({S_FALSE, {}});
  Source source(&output, &device, false);
  source.capture();
  EXPECT_EQ(source.queue->frames.size(), 1u);
}

TEST_F(DisplayGrab, LostAccessReduplicatesUntilItWorks) {
  first.steps.push_back({DXGI_ERROR_ACCESS_LOST, {}});
  Source source(&output, &device, false);
  ID3D11Texture2D* staging = source.stagingTexture.Get();
  output.failures = {E_ACCESSDENIED, DXGI_ERROR_UNSUPPORTED};
  output.next.push_back(&second);
  source.capture();
  EXPECT_EQ(source.duplication.Get(), &second);
  EXPECT_EQ(first.references, 0u);
  EXPECT_EQ(output.duplications, 4);  // opening, two failures, success
  EXPECT_EQ(source.stagingTexture.Get(), staging);
  EXPECT_TRUE(source.queue->frames.empty());

  second.steps.push_back({S_OK, {}});
  source.capture();
  EXPECT_EQ(source.queue->frames.size(), 1u);
  EXPECT_EQ(source.outputWidth, 8);
}

TEST_F(DisplayGrab, LeftoverFrameIsReleasedAndAFailedMapDropsOnlyThatFrame) {
  acquireFrame();
  acquireFrame();
  Source source(&output, &device, false);
  first.releaseResult = DXGI_ERROR_INVALID_CALL;
  device.context.mapResult = E_INVALIDARG;
  first.held = true;  // a frame left over; acquisition says so
  source.capture();
  EXPECT_EQ(first.releases, 1);
  EXPECT_FALSE(first.held);
  EXPECT_EQ(first.steps.size(), 2u);

  first.releaseResult = S_OK;
  std::string text = failure(source);
  EXPECT_NE(text.find("94"), std::string::npos) << text;
  EXPECT_NE(text.find("Could not map device context for image."), std::string::npos) << text;
  EXPECT_TRUE(source.queue->frames.empty());
  EXPECT_FALSE(first.held);  // released at step 6, before the map failed

  // Map works again: the next frame comes through.
  device.context.mapResult = S_OK;
  source.capture();
  EXPECT_EQ(source.queue->frames.size(), 1u);
}

TEST_F(DisplayGrab, EachCheckedStepReportsItsLine) {
  Source source(&output, &device, false);

  first.steps.push_back({S_OK, pointerUpdate(1, 0, 0, true, 4)});
  first.shape.assign(8, 0);  // more than the frame announced: the fetch fails
  std::string text = failure(source);
  EXPECT_NE(text.find("217"), std::string::npos) << text;
  EXPECT_TRUE(first.held);  // left acquired
  source.capture();         // invalid call: released
  EXPECT_FALSE(first.held);

  first.shape.clear();
  first.resource.texture = nullptr;
  acquireFrame();
  text = failure(source);
  EXPECT_NE(text.find("85"), std::string::npos) << text;
  EXPECT_NE(text.find("Could not create temporary texture."), std::string::npos) << text;
  EXPECT_TRUE(first.held);
  EXPECT_EQ(first.resource.references, 1u);
  source.capture();

  first.resource.texture = &desktop;
  first.releaseResult = E_FAIL;
  acquireFrame();
  text = failure(source);
  EXPECT_NE(text.find("91"), std::string::npos) << text;
  EXPECT_NE(text.find("Could not release image frame."), std::string::npos) << text;
  EXPECT_TRUE(source.queue->frames.empty());
}

TEST_F(DisplayGrab, DestructionReleasesEveryObject) {
  {
    Source source(&output, &device, false);
    EXPECT_EQ(output.references, 2u);
    EXPECT_EQ(device.references, 2u);
  }
  EXPECT_EQ(output.references, 1u);
  EXPECT_EQ(device.references, 1u);
  EXPECT_EQ(device.context.references, 1u);
  EXPECT_EQ(first.references, 0u);
  EXPECT_EQ(device.textures.at(0)->references, 0u);
}
