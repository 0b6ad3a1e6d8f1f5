#include "platform/linux/x11/duplication.h"

#include <poll.h>
#include <unistd.h>
#include <xcb/damage.h>
#include <xcb/randr.h>
#include <xcb/render.h>
#include <xcb/shm.h>
#include <xcb/xfixes.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>

namespace platform::dxgi {

namespace {

template <class T>
std::unique_ptr<T, decltype(&std::free)> own(T* value) {
  return {value, &std::free};
}

// Frame and pointer times in 100 ns units of a steady clock, as QueryPerformanceCounter gives them.
int64_t ticks() {
  using Ticks = std::chrono::duration<int64_t, std::ratio<1, 10000000>>;
  return std::chrono::duration_cast<Ticks>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

// The desktop image of an acquired frame: copying it grabs the monitor.
class DesktopTexture : public d3d11::Texture {
 public:
  DesktopTexture(const D3D11_TEXTURE2D_DESC& desc, Duplication* duplication)
      : Texture(desc), duplication_(duplication) {}
  HRESULT QueryInterface(REFIID riid, void** object) override {
    if (riid == IID_IDXGIResource || riid == IID_IDXGIObject) {
      AddRef();
      *object = &resource_;
      return S_OK;
    }
    return Texture::QueryInterface(riid, object);
  }
  void copyTo(d3d11::Texture& destination) override { duplication_->grab(destination); }
  IDXGIResource* resource() {
    AddRef();
    return &resource_;
  }

 private:
  // The IDXGIResource face of the same object.
  struct Resource : IDXGIResource {
    explicit Resource(DesktopTexture* owner) : owner(owner) {}
    HRESULT QueryInterface(REFIID riid, void** object) override { return owner->QueryInterface(riid, object); }
    ULONG AddRef() override { return owner->AddRef(); }
    ULONG Release() override { return owner->Release(); }
    DesktopTexture* owner;
  };
  ComPtr<Duplication> duplication_;  // the frame keeps its duplication alive
  Resource resource_{this};
};

// An X error of a checked request, or none.
bool failed(xcb_connection_t* c, xcb_void_cookie_t cookie) {
  xcb_generic_error_t* error = xcb_request_check(c, cookie);
  free(error);
  return error != nullptr;
}

// The 32-bit B, G, R, A format the texture promises, and the format of the root's visual.
bool findFormats(xcb_connection_t* c, const xcb_screen_t* screen, xcb_render_pictformat_t* argb,
                 xcb_render_pictformat_t* root) {
  auto formats = own(xcb_render_query_pict_formats_reply(c, xcb_render_query_pict_formats(c), nullptr));
  if (!formats) return false;
  *argb = *root = 0;
  for (auto it = xcb_render_query_pict_formats_formats_iterator(formats.get()); it.rem;
       xcb_render_pictforminfo_next(&it)) {
    const xcb_render_pictforminfo_t& f = *it.data;
    const xcb_render_directformat_t& d = f.direct;
    if (f.type == XCB_RENDER_PICT_TYPE_DIRECT && f.depth == 32 && d.alpha_shift == 24 && d.alpha_mask == 0xFF &&
        d.red_shift == 16 && d.red_mask == 0xFF && d.green_shift == 8 && d.green_mask == 0xFF && d.blue_shift == 0 &&
        d.blue_mask == 0xFF) {
      *argb = f.id;
    }
  }
  for (auto s = xcb_render_query_pict_formats_screens_iterator(formats.get()); s.rem; xcb_render_pictscreen_next(&s))
    for (auto d = xcb_render_pictscreen_depths_iterator(s.data); d.rem; xcb_render_pictdepth_next(&d))
      for (auto v = xcb_render_pictdepth_visuals_iterator(d.data); v.rem; xcb_render_pictvisual_next(&v))
        if (v.data->visual == screen->root_visual) *root = v.data->format;
  return *argb && *root;
}

// The 8-bit value of every value of a colour mask of any width (5, 6, 8 or 10 bits).
std::vector<uint8_t> levels(uint32_t mask) {
  const uint32_t largest = mask >> __builtin_ctz(mask);
  std::vector<uint8_t> table(largest + 1);
  for (uint32_t v = 0; v <= largest; ++v) table[v] = static_cast<uint8_t>((v * 255u + largest / 2) / largest);
  return table;
}

bool overlaps(const xcb_rectangle_t& a, const x11::Monitor& m) {
  return a.x < m.x + m.width && m.x < a.x + a.width && a.y < m.y + m.height && m.y < a.y + a.height;
}

}  // namespace

HRESULT Duplication::open(const std::string& display, int screen, xcb_atom_t name, const std::string& nameText,
                          IDXGIOutputDuplication** result) {
  if (!result) return E_INVALIDARG;
  *result = nullptr;
  x11::Connection connection = x11::connect(display);
  if (!connection) return DXGI_ERROR_SESSION_DISCONNECTED;
  if (!nameText.empty()) {
    xcb_intern_atom_cookie_t cookie =
        xcb_intern_atom(connection.get(), 1, static_cast<uint16_t>(nameText.size()), nameText.c_str());
    if (xcb_intern_atom_reply_t* reply = xcb_intern_atom_reply(connection.get(), cookie, nullptr)) {
      if (reply->atom != XCB_ATOM_NONE) name = reply->atom;
      free(reply);
    }
  }
  ComPtr<Duplication> duplication;
  duplication.Attach(new Duplication(std::move(connection), screen, name));
  if (!duplication->setUp()) return DXGI_ERROR_UNSUPPORTED;
  *result = duplication.Detach();
  return S_OK;
}

Duplication::Duplication(x11::Connection connection, int screen, xcb_atom_t name)
    : connection_(std::move(connection)), screen_(screen), name_(name) {}

bool Duplication::setUp() {
  xcb_connection_t* c = connection_.get();
  xcb_screen_t* screen = x11::screenOf(c, screen_);
  if (!screen || !x11::findMonitor(c, screen_, name_, &monitor_)) return false;
  root_ = screen->root;

  // GetImage gives the root's own pixels; those of a true-colour visual at 16 or 32 bits a pixel
  // (depths 15, 16, 24, 30, 32) are converted to B, G, R, A here. RENDER converts any depth.
  const xcb_setup_t* setup = xcb_get_setup(c);
  for (auto it = xcb_setup_pixmap_formats_iterator(setup); it.rem; xcb_format_next(&it)) {
    if (it.data->depth != screen->root_depth) continue;
    pixels_.bytes = it.data->bits_per_pixel / 8u;
    pixels_.pad = it.data->scanline_pad;
    convertible_ = it.data->bits_per_pixel == 16 || it.data->bits_per_pixel == 32;
  }
  for (auto d = xcb_screen_allowed_depths_iterator(screen); d.rem; xcb_depth_next(&d)) {
    for (auto v = xcb_depth_visuals_iterator(d.data); v.rem; xcb_visualtype_next(&v)) {
      if (v.data->visual_id != screen->root_visual) continue;
      pixels_.red = v.data->red_mask;
      pixels_.green = v.data->green_mask;
      pixels_.blue = v.data->blue_mask;
      convertible_ = convertible_ && v.data->_class == XCB_VISUAL_CLASS_TRUE_COLOR && pixels_.red && pixels_.green &&
                     pixels_.blue && (pixels_.pad == 8 || pixels_.pad == 16 || pixels_.pad == 32);
    }
  }
  if (convertible_ && !pixels_.words()) {
    // Tables instead of arithmetic per pixel: a whole word for each 16-bit pixel, else the 8-bit
    // level of each colour's value.
    const std::vector<uint8_t> red = levels(pixels_.red), green = levels(pixels_.green), blue = levels(pixels_.blue);
    const auto word = [&](uint32_t pixel) {
      return uint32_t{blue[(pixel & pixels_.blue) >> __builtin_ctz(pixels_.blue)]} |
             uint32_t{green[(pixel & pixels_.green) >> __builtin_ctz(pixels_.green)]} << 8 |
             uint32_t{red[(pixel & pixels_.red) >> __builtin_ctz(pixels_.red)]} << 16 | 0xFF000000u;
    };
    if (pixels_.bytes == 2) {
      pixels_.words16.resize(65536);
      for (uint32_t pixel = 0; pixel < 65536; ++pixel) pixels_.words16[pixel] = word(pixel);
    } else {
      pixels_.levels[0] = blue;
      pixels_.levels[1] = green;
      pixels_.levels[2] = red;
    }
  }

  const xcb_query_extension_reply_t* damage = xcb_get_extension_data(c, &xcb_damage_id);
  const xcb_query_extension_reply_t* xfixes = xcb_get_extension_data(c, &xcb_xfixes_id);
  const xcb_query_extension_reply_t* randr = xcb_get_extension_data(c, &xcb_randr_id);
  if (!damage || !damage->present || !xfixes || !xfixes->present || !randr || !randr->present) return false;
  damageEvent_ = damage->first_event;
  xfixesEvent_ = xfixes->first_event;
  randrEvent_ = randr->first_event;

  // Extensions answer only once their versions are agreed.
  free(xcb_xfixes_query_version_reply(c, xcb_xfixes_query_version(c, 5, 0), nullptr));
  free(xcb_damage_query_version_reply(c, xcb_damage_query_version(c, 1, 1), nullptr));
  free(xcb_randr_query_version_reply(c, xcb_randr_query_version(c, 1, 5), nullptr));

  damage_ = xcb_generate_id(c);
  xcb_damage_create(c, damage_, root_, XCB_DAMAGE_REPORT_LEVEL_DELTA_RECTANGLES);
  xcb_xfixes_select_cursor_input(c, root_, XCB_XFIXES_CURSOR_NOTIFY_MASK_DISPLAY_CURSOR);
  xcb_randr_select_input(c, root_,
                         XCB_RANDR_NOTIFY_MASK_SCREEN_CHANGE | XCB_RANDR_NOTIFY_MASK_CRTC_CHANGE |
                             XCB_RANDR_NOTIFY_MASK_OUTPUT_CHANGE | XCB_RANDR_NOTIFY_MASK_RESOURCE_CHANGE);

  // Version 1.2 passes file descriptors, so the texture's memfd can be shared.
  auto shm = own(xcb_shm_query_version_reply(c, xcb_shm_query_version(c), nullptr));
  shm_ = shm && (shm->major_version > 1 || (shm->major_version == 1 && shm->minor_version >= 2));

  // RENDER writes the monitor into a 32-bit pixmap in the texture's memory: one pass of the
  // server that also makes alpha opaque. That needs pixmaps in shared memory.
  // Not for 4-byte pixels of other than 8-bit colours (depth 30): the server converts those pixel
  // by pixel, ~25 ms a 1080p frame, against ~3 ms for GetImage and the tables here.
  const xcb_query_extension_reply_t* render = xcb_get_extension_data(c, &xcb_render_id);
  xcb_render_pictformat_t rootFormat = 0;
  const bool ownConversionFaster = convertible_ && pixels_.bytes == 4 && !pixels_.words();
  if (!ownConversionFaster && shm_ && shm->shared_pixmaps && shm->pixmap_format == XCB_IMAGE_FORMAT_Z_PIXMAP &&
      render && render->present) {
    free(xcb_render_query_version_reply(c, xcb_render_query_version(c, 0, 11), nullptr));
    if (findFormats(c, screen, &argbFormat_, &rootFormat)) {
      rootPicture_ = xcb_generate_id(c);
      const uint32_t inferiors = XCB_SUBWINDOW_MODE_INCLUDE_INFERIORS;
      composite_ = !failed(c, xcb_render_create_picture_checked(c, rootPicture_, root_, rootFormat,
                                                                XCB_RENDER_CP_SUBWINDOW_MODE, &inferiors));
    }
  }
  xcb_flush(c);
  // A root neither RENDER nor the conversion can read (an indexed-colour screen without RENDER)
  // gives no duplication rather than wrong colours.
  if (!composite_ && !convertible_) return false;
  return !xcb_connection_has_error(c);
}

// Rows of root pixels to B, G, R, A rows packed at width * 4 bytes. `from` may be `to` itself:
// 2-byte pixels are taken from the last backwards, so each is read before its place in the wider
// picture is written; 4-byte pixels keep their places.
void Duplication::convert(const uint8_t* from, size_t fromStride, uint8_t* to, int32_t rows) const {
  const uint32_t width = monitor_.width;
  if (pixels_.words()) {
    if (from != to)
      for (int32_t y = 0; y < rows; ++y)
        std::memcpy(to + y * size_t{width} * 4, from + y * fromStride, size_t{width} * 4);
    // The server leaves the padding byte of a 24-bit pixel at 0; the format promises opaque alpha.
    auto* words = reinterpret_cast<uint32_t*>(to);
    const size_t count = size_t{width} * rows;
    for (size_t i = 0; i < count; ++i) words[i] |= 0xFF000000u;
    return;
  }
  if (pixels_.bytes == 2) {
    const uint32_t* words = pixels_.words16.data();
    for (int32_t y = rows - 1; y >= 0; --y) {
      const uint8_t* in = from + y * fromStride;
      uint8_t* out = to + y * size_t{width} * 4;
      for (int64_t x = static_cast<int64_t>(width) - 1; x >= 0; --x) {
        uint16_t pixel;
        std::memcpy(&pixel, in + x * 2, 2);
        std::memcpy(out + x * 4, &words[pixel], 4);
      }
    }
    return;
  }
  const uint8_t* blue = pixels_.levels[0].data();
  const uint8_t* green = pixels_.levels[1].data();
  const uint8_t* red = pixels_.levels[2].data();
  const int blueShift = __builtin_ctz(pixels_.blue), greenShift = __builtin_ctz(pixels_.green),
            redShift = __builtin_ctz(pixels_.red);
  for (int32_t y = 0; y < rows; ++y) {
    const uint8_t* in = from + y * fromStride;
    uint8_t* out = to + y * size_t{width} * 4;
    for (uint32_t x = 0; x < width; ++x) {
      uint32_t pixel;
      std::memcpy(&pixel, in + x * 4, 4);
      const uint32_t word = uint32_t{blue[(pixel & pixels_.blue) >> blueShift]} |
                            uint32_t{green[(pixel & pixels_.green) >> greenShift]} << 8 |
                            uint32_t{red[(pixel & pixels_.red) >> redShift]} << 16 | 0xFF000000u;
      std::memcpy(out + x * 4, &word, 4);
    }
  }
}

void Duplication::GetDesc(DXGI_OUTDUPL_DESC* desc) {
  if (!desc) return;
  std::memset(desc, 0, sizeof(*desc));
  desc->ModeDesc.Width = monitor_.width;
  desc->ModeDesc.Height = monitor_.height;
  desc->ModeDesc.Format = DXGI_FORMAT_B8G8R8A8_UNORM;
  desc->Rotation = DXGI_MODE_ROTATION_IDENTITY;
  desc->DesktopImageInSystemMemory = TRUE;
}

void Duplication::handle(xcb_generic_event_t* event) {
  uint8_t type = event->response_type & 0x7F;
  if (type == damageEvent_ + XCB_DAMAGE_NOTIFY) {
    auto* notify = reinterpret_cast<xcb_damage_notify_event_t*>(event);
    if (overlaps(notify->area, monitor_)) {
      const int32_t top = std::max<int32_t>(notify->area.y, monitor_.y) - monitor_.y;
      const int32_t bottom =
          std::min<int32_t>(notify->area.y + notify->area.height, monitor_.y + monitor_.height) - monitor_.y;
      if (drawnTop_ >= drawnBottom_) {
        drawnTop_ = top;
        drawnBottom_ = bottom;
      } else {
        drawnTop_ = std::min(drawnTop_, top);
        drawnBottom_ = std::max(drawnBottom_, bottom);
      }
      drawn_ = true;
    }
  } else if (type == xfixesEvent_ + XCB_XFIXES_CURSOR_NOTIFY) {
    shapeChanged_ = true;
  } else if (type == randrEvent_ + XCB_RANDR_SCREEN_CHANGE_NOTIFY || type == randrEvent_ + XCB_RANDR_NOTIFY) {
    checkGeometry();
  }
}

void Duplication::handleEvents() {
  while (xcb_generic_event_t* event = xcb_poll_for_event(connection_.get())) {
    handle(event);
    free(event);
  }
  if (xcb_connection_has_error(connection_.get())) lost_ = true;
}

// A monitor that moved, changed size or went away ends this duplication, as a mode change does.
void Duplication::checkGeometry() {
  x11::Monitor now;
  if (!x11::findMonitor(connection_.get(), screen_, name_, &now) || now.x != monitor_.x || now.y != monitor_.y ||
      now.width != monitor_.width || now.height != monitor_.height) {
    lost_ = true;
  }
}

// DAMAGE does not report pointer motion, so the pointer is asked for.
bool Duplication::pointerMoved() {
  auto pointer = own(xcb_query_pointer_reply(connection_.get(), xcb_query_pointer(connection_.get(), root_), nullptr));
  if (!pointer) return false;
  bool onScreen = pointer->same_screen != 0;
  bool moved = pointer->root_x != pointerX_ || pointer->root_y != pointerY_ || onScreen != pointerOnScreen_;
  pointerX_ = pointer->root_x;
  pointerY_ = pointer->root_y;
  pointerOnScreen_ = onScreen;
  return moved;
}

// XFIXES gives premultiplied ARGB words; shapes are handed on as B, G, R, A with straight alpha.
void Duplication::fetchCursor() {
  auto image = own(
      xcb_xfixes_get_cursor_image_reply(connection_.get(), xcb_xfixes_get_cursor_image(connection_.get()), nullptr));
  if (!image) return;
  cursorWidth_ = image->width;
  cursorHeight_ = image->height;
  hotX_ = image->xhot;
  hotY_ = image->yhot;
  const uint32_t* pixels = xcb_xfixes_get_cursor_image_cursor_image(image.get());
  size_t count = static_cast<size_t>(cursorWidth_) * cursorHeight_;
  cursor_.resize(count * 4);
  for (size_t i = 0; i < count; ++i) {
    uint32_t p = pixels[i];
    uint32_t a = p >> 24;
    uint8_t* out = &cursor_[i * 4];
    for (int channel = 0; channel < 3; ++channel) {
      uint32_t c = (p >> (8 * channel)) & 0xFF;
      out[channel] = a == 0 ? 0 : static_cast<uint8_t>(std::min<uint32_t>(255, (c * 255 + a / 2) / a));
    }
    out[3] = static_cast<uint8_t>(a);
  }
}

HRESULT Duplication::AcquireNextFrame(UINT timeoutMilliseconds, DXGI_OUTDUPL_FRAME_INFO* frameInfo,
                                      IDXGIResource** desktopResource) {
  if (!frameInfo || !desktopResource) return E_INVALIDARG;
  *desktopResource = nullptr;
  if (held_) return DXGI_ERROR_INVALID_CALL;
  handleEvents();
  if (lost_) return DXGI_ERROR_ACCESS_LOST;

  if (!first_ && !drawn_ && !shapeChanged_) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMilliseconds);
    int fd = xcb_get_file_descriptor(connection_.get());
    for (;;) {
      auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) break;
      pollfd waiting{fd, POLLIN, 0};
      xcb_flush(connection_.get());
      poll(&waiting, 1, static_cast<int>(left.count()));
      handleEvents();
      if (lost_) return DXGI_ERROR_ACCESS_LOST;
      if (drawn_ || shapeChanged_) break;
    }
  }
  // The pointer is asked for once a call, after the wait: the pump calls again at once, so a
  // second question before the wait would find what this one found (and cost a round trip).
  const bool moved = pointerMoved();
  handleEvents();  // events that came in with the reply
  if (lost_) return DXGI_ERROR_ACCESS_LOST;
  if (!first_ && !drawn_ && !shapeChanged_ && !moved) return DXGI_ERROR_WAIT_TIMEOUT;

  std::memset(frameInfo, 0, sizeof(*frameInfo));
  int64_t now = ticks();
  if (first_ || drawn_) {
    // Drawing after this point is reported again and makes the next frame.
    xcb_damage_subtract(connection_.get(), damage_, XCB_NONE, XCB_NONE);
    frameInfo->LastPresentTime.QuadPart = now;
    frameInfo->AccumulatedFrames = 1;
  }
  bool shape = first_ || shapeChanged_;
  if (shape) {
    fetchCursor();
    frameInfo->PointerShapeBufferSize = static_cast<UINT>(cursor_.size());
  }
  if (shape || moved) {
    // Windows reports the shape's top-left corner, and a pointer off this output as invisible.
    int32_t x = pointerX_ - monitor_.x;
    int32_t y = pointerY_ - monitor_.y;
    frameInfo->LastMouseUpdateTime.QuadPart = now;
    frameInfo->PointerPosition.Position.x = x - hotX_;
    frameInfo->PointerPosition.Position.y = y - hotY_;
    frameInfo->PointerPosition.Visible =
        pointerOnScreen_ && x >= 0 && y >= 0 && x < monitor_.width && y < monitor_.height ? TRUE : FALSE;
  }
  first_ = drawn_ = shapeChanged_ = false;
  held_ = true;

  D3D11_TEXTURE2D_DESC desc{};
  desc.Width = monitor_.width;
  desc.Height = monitor_.height;
  desc.MipLevels = 1;
  desc.ArraySize = 1;
  desc.Format = DXGI_FORMAT_B8G8R8A8_UNORM;
  desc.SampleDesc.Count = 1;
  desc.Usage = D3D11_USAGE_DEFAULT;
  ComPtr<DesktopTexture> texture;
  texture.Attach(new DesktopTexture(desc, this));
  *desktopResource = texture->resource();
  return S_OK;
}

HRESULT Duplication::GetFramePointerShape(UINT bufferSize, void* buffer, UINT* requiredSize,
                                          DXGI_OUTDUPL_POINTER_SHAPE_INFO* shapeInfo) {
  if (!requiredSize || !shapeInfo) return E_INVALIDARG;
  if (!held_) return DXGI_ERROR_INVALID_CALL;
  *requiredSize = static_cast<UINT>(cursor_.size());
  if (bufferSize < cursor_.size()) return DXGI_ERROR_MORE_DATA;
  if (!cursor_.empty()) {
    if (!buffer) return E_INVALIDARG;
    std::memcpy(buffer, cursor_.data(), cursor_.size());
  }
  shapeInfo->Type = DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR;
  shapeInfo->Width = cursorWidth_;
  shapeInfo->Height = cursorHeight_;
  shapeInfo->Pitch = cursorWidth_ * 4;
  shapeInfo->HotSpot.x = hotX_;
  shapeInfo->HotSpot.y = hotY_;
  return S_OK;
}

HRESULT Duplication::ReleaseFrame() {
  if (!held_) return DXGI_ERROR_INVALID_CALL;
  held_ = false;
  return S_OK;
}

bool Duplication::attach(const std::shared_ptr<d3d11::TextureMemory>& memory) {
  if (attached_ == memory) return true;
  detach();
  int fd = dup(memory->fd());  // xcb closes the descriptor it sends
  if (fd < 0) return false;
  xcb_connection_t* c = connection_.get();
  segment_ = xcb_generate_id(c);
  if (failed(c, xcb_shm_attach_fd_checked(c, segment_, fd, 0))) return false;
  attached_ = memory;
  if (composite_ && !makePicture()) composite_ = false;  // GetImage still works
  return true;
}

void Duplication::detach() {
  if (!attached_) return;
  xcb_connection_t* c = connection_.get();
  if (picture_) xcb_render_free_picture(c, picture_);
  if (pixmap_) xcb_free_pixmap(c, pixmap_);
  xcb_shm_detach(c, segment_);
  picture_ = pixmap_ = 0;
  attached_.reset();
}

// The attached segment as a pixmap of the monitor's size, rows packed at width * 4 bytes.
bool Duplication::makePicture() {
  xcb_connection_t* c = connection_.get();
  pixmap_ = xcb_generate_id(c);
  if (failed(c, xcb_shm_create_pixmap_checked(c, pixmap_, root_, monitor_.width, monitor_.height, 32, segment_, 0))) {
    pixmap_ = 0;
    return false;
  }
  picture_ = xcb_generate_id(c);
  if (failed(c, xcb_render_create_picture_checked(c, picture_, pixmap_, argbFormat_, 0, nullptr))) {
    picture_ = 0;
    return false;
  }
  return true;
}

// Full-width rows land in the segment at their own place, so a band of rows keeps the layout.
bool Duplication::fetch(d3d11::TextureMemory& memory, int32_t top, int32_t rows) {
  xcb_connection_t* c = connection_.get();
  const size_t rowBytes = static_cast<size_t>(monitor_.width) * 4;
  uint8_t* at = memory.data() + static_cast<size_t>(top) * rowBytes;
  if (picture_) {
    // The check's round trip also tells that the server has written the rows.
    return !failed(
        c, xcb_render_composite_checked(c, XCB_RENDER_PICT_OP_SRC, rootPicture_, XCB_NONE, picture_, monitor_.x,
                                        static_cast<int16_t>(monitor_.y + top), 0, 0, 0, static_cast<int16_t>(top),
                                        monitor_.width, static_cast<uint16_t>(rows)));
  }
  if (!convertible_) return false;
  const size_t stride = pixels_.stride(monitor_.width);
  if (shm_) {
    auto image = own(xcb_shm_get_image_reply(
        c,
        xcb_shm_get_image(c, root_, monitor_.x, static_cast<int16_t>(monitor_.y + top), monitor_.width,
                          static_cast<uint16_t>(rows), ~0u, XCB_IMAGE_FORMAT_Z_PIXMAP, segment_,
                          static_cast<uint32_t>(top * rowBytes)),
        nullptr));
    if (!image) return false;
    convert(at, stride, at, rows);
  } else {
    auto image = own(xcb_get_image_reply(
        c,
        xcb_get_image(c, XCB_IMAGE_FORMAT_Z_PIXMAP, root_, monitor_.x, static_cast<int16_t>(monitor_.y + top),
                      monitor_.width, static_cast<uint16_t>(rows), ~0u),
        nullptr));
    if (!image || static_cast<size_t>(xcb_get_image_data_length(image.get())) < stride * rows) return false;
    convert(xcb_get_image_data(image.get()), stride, at, rows);
  }
  return true;
}

void Duplication::grab(d3d11::Texture& destination) {
  const auto& memory = destination.memory();
  size_t bytes = static_cast<size_t>(monitor_.width) * monitor_.height * 4;
  if (!memory || memory->size() < bytes) return;
  if (shm_ && !attach(memory)) shm_ = false;
  // The memory still holds our last grab when nothing else wrote it since: then only the rows
  // drawn meanwhile are fetched. A whole grab once a second catches anything that changed the
  // screen without reporting damage.
  const auto now = std::chrono::steady_clock::now();
  const bool ours = grabbed_ && grabbedMemory_.lock() == memory && memory->writes() == grabbedWrites_;
  const bool whole = !ours || now - wholeGrab_ >= std::chrono::seconds(1);
  int32_t top = whole ? 0 : drawnTop_;
  int32_t bottom = whole ? static_cast<int32_t>(monitor_.height) : drawnBottom_;
  drawnTop_ = drawnBottom_ = 0;
  if (top < bottom && !fetch(*memory, top, bottom - top)) {
    grabbed_ = false;  // a failed fetch leaves the memory unknown
    return;
  }
  if (whole) wholeGrab_ = now;
  grabbed_ = true;
  grabbedMemory_ = memory;
  grabbedWrites_ = memory->writes();
}

}  // namespace platform::dxgi
