// Desktop duplication of one RandR monitor. The duplication has an X connection of its own,
// used only by the thread that acquires frames: DAMAGE tells it about drawing, XFIXES about
// cursor shapes, RandR about geometry changes. The staging texture's memory is shared with the
// server through MIT-SHM: RENDER copies the monitor's rectangle into it as a 32-bit picture,
// which sets alpha on the way, or, where the server cannot do that, GetImage fills it.
#pragma once

#include <xcb/render.h>
#include <xcb/xcb.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/linux/x11/d3d11objects.h"
#include "platform/linux/x11/display.h"

namespace platform::dxgi {

class Duplication : public platform::ComObject<IDXGIOutputDuplication, IID_IDXGIObject, IID_IDXGIOutputDuplication> {
 public:
  // Opens a duplication of monitor `name` of `screen` on display `display`.
  // `nameText` finds the monitor again on a display server that was restarted, where atoms differ.
  static HRESULT open(const std::string& display, int screen, xcb_atom_t name, const std::string& nameText,
                      IDXGIOutputDuplication** result);

  void GetDesc(DXGI_OUTDUPL_DESC* desc) override;
  HRESULT AcquireNextFrame(UINT timeoutMilliseconds, DXGI_OUTDUPL_FRAME_INFO* frameInfo,
                           IDXGIResource** desktopResource) override;
  HRESULT GetFramePointerShape(UINT bufferSize, void* buffer, UINT* requiredSize,
                               DXGI_OUTDUPL_POINTER_SHAPE_INFO* shapeInfo) override;
  HRESULT ReleaseFrame() override;

  // Grabs the monitor's rectangle into `destination` (same size, CPU memory), alpha set to 255.
  void grab(d3d11::Texture& destination);

 private:
  Duplication(x11::Connection connection, int screen, xcb_atom_t name);
  ~Duplication() override = default;
  bool setUp();
  void handleEvents();
  void handle(xcb_generic_event_t* event);
  void checkGeometry();
  bool pointerMoved();
  void fetchCursor();
  bool attach(const std::shared_ptr<d3d11::TextureMemory>& memory);
  void detach();
  bool makePicture();
  bool fetch(d3d11::TextureMemory& memory, int32_t top, int32_t rows);
  void convert(const uint8_t* from, size_t fromStride, uint8_t* to, int32_t rows) const;

  x11::Connection connection_;
  int screen_;
  xcb_atom_t name_;
  xcb_window_t root_ = 0;
  x11::Monitor monitor_;
  uint32_t damage_ = 0;
  uint8_t damageEvent_ = 0, xfixesEvent_ = 0, randrEvent_ = 0;

  bool held_ = false;
  bool first_ = true;
  bool lost_ = false;
  bool drawn_ = false;
  bool shapeChanged_ = false;

  // Pointer in root coordinates as last handed on.
  int32_t pointerX_ = 0, pointerY_ = 0;
  bool pointerOnScreen_ = false;
  // The cursor image in B, G, R, A with straight alpha.
  std::vector<uint8_t> cursor_;
  uint32_t cursorWidth_ = 0, cursorHeight_ = 0;
  int32_t hotX_ = 0, hotY_ = 0;

  // The root's pixels as GetImage gives them: bytes a pixel, bytes a row of `width` pixels, the
  // colour masks. B, G, R, X words need only their alpha set; other layouts are converted.
  struct Pixels {
    uint32_t bytes = 4;
    uint32_t red = 0xFF0000, green = 0xFF00, blue = 0xFF;
    uint32_t pad = 32;
    size_t stride(uint32_t width) const { return (static_cast<size_t>(width) * bytes * 8 + pad - 1) / pad * (pad / 8); }
    bool words() const { return bytes == 4 && red == 0xFF0000 && green == 0xFF00 && blue == 0xFF; }
    std::vector<uint32_t> words16;   // 2-byte pixels: the word of every value
    std::vector<uint8_t> levels[3];  // 4-byte pixels: the level of every blue, green, red value
  } pixels_;
  bool convertible_ = false;

  bool shm_ = false;
  uint32_t segment_ = 0;
  // RENDER: the root as a picture, and an ARGB picture on a pixmap in the attached segment.
  bool composite_ = false;
  xcb_render_pictformat_t argbFormat_ = 0;
  xcb_render_picture_t rootPicture_ = 0;
  xcb_pixmap_t pixmap_ = 0;
  xcb_render_picture_t picture_ = 0;
  std::shared_ptr<d3d11::TextureMemory> attached_;
  // Rows of the monitor drawn since the last grab (top inclusive, bottom exclusive); only they
  // are fetched again while the attached memory still holds the last grab.
  int32_t drawnTop_ = 0, drawnBottom_ = 0;
  std::weak_ptr<d3d11::TextureMemory> grabbedMemory_;
  uint64_t grabbedWrites_ = 0;
  bool grabbed_ = false;
  std::chrono::steady_clock::time_point wholeGrab_{};
};

}  // namespace platform::dxgi
