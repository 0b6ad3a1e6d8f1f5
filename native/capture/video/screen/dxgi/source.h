// A display output captured by desktop duplication, the pointer drawn in by software.
#pragma once

#include <atomic>
#include <memory>
#include <string>

#include "capture/unfinished.h"
#include "capture/video/frame.h"
#include "capture/video/screen/dxgi/pointer.h"
#include "capture/video/source.h"
#include "platform/dxgi.h"

namespace capture::video::screen::dxgi {

class Source : public capture::video::Source {
 public:
  // Opens the output: staging texture and duplication. The source takes its own reference on
  // the output and on the shared device.
  Source(IDXGIOutput1* output, ID3D11Device* device, bool selected);
  ~Source() override;

  int32_t type() override { return capture::Screen; }
  std::string name() override;
  void startPreview() override {}
  void stopPreview() override {}
  void capture() override;
  void stopCapturing() override {}
  void startEncode(std::string filename) override;
  void stopEncode() override;
  void finishClips(std::chrono::steady_clock::time_point deadline) override;
  bool selected() override { return isSelected; }

  bool preview(uint8_t* dst, uint32_t swapRedBlue, int32_t dstWidth, int32_t dstHeight) override;
  uint32_t width() override { return static_cast<uint32_t>(outputWidth); }
  uint32_t height() override { return static_cast<uint32_t>(outputHeight); }
  int32_t size() override { return outputHeight * outputWidth * 4; }
  int32_t pixelWidth() override { return 4; }
  int32_t channelOrder() override { return 0; }

  // Shared with the recording thread, which may outlive the source.
  std::shared_ptr<capture::video::FrameQueue> queue;
  std::shared_ptr<capture::video::Clip> clip;  // the latest clip, guarded by queue->mutex
  capture::UnfinishedClips unfinished;
  ComPtr<IDXGIOutput1> output;
  ComPtr<ID3D11Device> device;
  ComPtr<ID3D11DeviceContext> context;
  ComPtr<ID3D11Texture2D> stagingTexture;
  D3D_FEATURE_LEVEL featureLevel{};
  ComPtr<IDXGIOutputDuplication> duplication;
  int32_t outputWidth = 0;
  int32_t outputHeight = 0;
  uint32_t acquireTimeout = 5;
  std::atomic<bool> captureMouse{true};  // written by the JavaScript thread
  PointerInfo pointer;
  bool isSelected = false;
};

}  // namespace capture::video::screen::dxgi
