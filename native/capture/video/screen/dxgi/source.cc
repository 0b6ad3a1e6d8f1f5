#include "capture/video/screen/dxgi/source.h"

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>

#include "capture/check.h"
#include "capture/clock.h"
#include "capture/log.h"
#include "capture/text.h"
#include "capture/video/copy.h"
#include "capture/video/scale.h"
#include "capture/video/screen/dxgi/duplicate.h"
#include "capture/video/screen/dxgi/recording.h"
#include "capture/video/screen/dxgi/texture.h"
#include "platform/user32.h"

namespace capture::video::screen::dxgi {

namespace {
// Pictures a recording may have waiting: half a second of a 60 Hz desktop, or eleven at 1080p.
constexpr uint64_t recordingBacklogBytes = 96 << 20;
constexpr uint64_t recordingBacklogPictures = 30;
}  // namespace

Source::Source(IDXGIOutput1* output, ID3D11Device* device, bool selected) : output(output), device(device) {
  acquireTimeout = 5;
  captureMouse = true;
  isSelected = selected;
  device->GetImmediateContext(context.GetAddressOf());
  featureLevel = device->GetFeatureLevel();
  DXGI_OUTPUT_DESC desc{};
  output->GetDesc(&desc);
  outputWidth = desc.DesktopCoordinates.right - desc.DesktopCoordinates.left;
  outputHeight = desc.DesktopCoordinates.bottom - desc.DesktopCoordinates.top;
  stagingTexture = adopt(createStagingTexture(device, outputWidth, outputHeight));
  duplication = adopt(duplicateOutput(output, device));
  queue = std::make_shared<capture::video::FrameQueue>(capture::toWide(name()), outputWidth, outputHeight, 0);
}

Source::~Source() = default;

std::string Source::name() {
  DXGI_OUTPUT_DESC desc{};
  output->GetDesc(&desc);
  MONITORINFOEXA info;
  std::memset(&info, 0, sizeof(info));
  info.cbSize = sizeof(MONITORINFOEXA);
  GetMonitorInfoA(desc.Monitor, &info);
  DISPLAY_DEVICEA dd;
  std::memset(&dd, 0, sizeof(dd));
  dd.cb = sizeof(DISPLAY_DEVICEA);
  EnumDisplayDevicesA(info.szDevice, 0, &dd, 0);
  DEVMODEA dm;
  std::memset(&dm, 0, sizeof(dm));
  dm.dmSize = sizeof(DEVMODEA);
  dm.dmDriverExtra = 0;
  EnumDisplaySettingsA(info.szDevice, ENUM_CURRENT_SETTINGS, &dm);
  return std::string(dd.DeviceString);
}

void Source::capture() {
  DXGI_OUTDUPL_FRAME_INFO frameInfo{};
  ComPtr<IDXGIResource> resource;
  HRESULT hr = duplication->AcquireNextFrame(acquireTimeout, &frameInfo, resource.GetAddressOf());
  if (hr == DXGI_ERROR_ACCESS_LOST) {
    duplication.Reset();
    bool reported = false;
    while (!duplication) {
      try {
        duplication = adopt(duplicateOutput(output.Get(), device.Get()));
      } catch (const std::exception& e) {
        // Access comes back after the mode change or desktop switch is over, or once the display
        // server runs again; until then the pump waits here without spinning. Said once.
        if (!reported) capture::logWarning(e.what());
        reported = true;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
      }
    }
    return;
  }
  if (hr == DXGI_ERROR_INVALID_CALL) {
    duplication->ReleaseFrame();
    return;
  }
  if (hr == DXGI_ERROR_WAIT_TIMEOUT) return;

  updatePointer(pointer, frameInfo,
                [this](UINT size, void* buffer, UINT* required, DXGI_OUTDUPL_POINTER_SHAPE_INFO* info) {
                  return duplication->GetFramePointerShape(size, buffer, required, info);
                });

  ComPtr<ID3D11Texture2D> texture;
  hr = resource ? resource->QueryInterface(IID_ID3D11Texture2D, reinterpret_cast<void**>(texture.GetAddressOf()))
                : E_POINTER;
  resource.Reset();
  capture::checkResult("native/capture/video/screen/dxgi/source", 85, hr, "Could not create temporary texture.");
  context->CopyResource(stagingTexture.Get(), texture.Get());
  texture.Reset();

  hr = duplication->ReleaseFrame();
  capture::checkResult("native/capture/video/screen/dxgi/source", 91, hr, "Could not release image frame.");

  D3D11_MAPPED_SUBRESOURCE mapped{};
  hr = context->Map(stagingTexture.Get(), 0, D3D11_MAP_READ, 0, &mapped);
  capture::checkResult("native/capture/video/screen/dxgi/source", 94, hr, "Could not map device context for image.");

  auto frame = capture::video::Frame::make(outputWidth, outputHeight, 0, capture::steadyMillis(), queue->pixels);
  // Rows are taken as packed at outputWidth * 4 bytes; RowPitch is not consulted.
  capture::video::copyPicture(frame->data.get(), mapped.pData, frame->size);
  if (captureMouse) drawPointer(pointer, *frame);

  {
    // While a clip records, pictures its thread has not taken yet stay, so that a busy machine
    // delays the encoder instead of losing them (up to a bound: an encoder that cannot keep up
    // loses the oldest). Otherwise the newest alone is kept, for the preview.
    const size_t keep =
        queue->stopped ? 1 : std::clamp<uint64_t>(recordingBacklogBytes / frame->size, 2, recordingBacklogPictures);
    std::lock_guard<std::mutex> lock(queue->mutex);
    while (queue->frames.size() > keep) queue->frames.pop_front();
    queue->frames.push_back(std::move(frame));
  }
  queue->changed.notify_all();
}

bool Source::preview(uint8_t* dst, uint32_t swapRedBlue, int32_t dstWidth, int32_t dstHeight) {
  std::lock_guard<std::mutex> lock(queue->mutex);
  if (queue->frames.empty()) return false;
  capture::video::scaleFrame(queue->frames.back()->data.get(), outputWidth, outputHeight, dst, dstWidth, dstHeight,
                             swapRedBlue);
  return true;
}

// The clip starts now, with the picture now current; a clip still recording ends here.
void Source::startEncode(std::string filename) {
  std::shared_ptr<capture::video::Clip> started;
  {
    std::lock_guard<std::mutex> lock(queue->mutex);
    const int64_t now = capture::steadyMillis();
    if (clip && clip->stop.load() == 0) clip->stop = now;
    queue->path = capture::toWide(filename);
    started = std::make_shared<capture::video::Clip>(queue->path, now,
                                                     queue->frames.empty() ? nullptr : queue->frames.back()->clone());
    clip = started;
    queue->stopped = false;
  }
  queue->changed.notify_all();
  startRecording(queue, started, unfinished.hold());
}

void Source::stopEncode() {
  {
    std::lock_guard<std::mutex> lock(queue->mutex);
    if (clip && clip->stop.load() == 0) clip->stop = capture::steadyMillis();
    queue->stopped = true;
  }
  queue->changed.notify_all();
}

void Source::finishClips(std::chrono::steady_clock::time_point deadline) {
  stopEncode();
  unfinished.waitUntil(deadline);
}

}  // namespace capture::video::screen::dxgi
