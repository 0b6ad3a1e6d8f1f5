// A camera or the microphone of a capture device, driven by its own capture-engine manager.
#pragma once

#include <cstdint>
#include <string>

#include "capture/audio/source.h"
#include "capture/video/camera/mfce/capturemanager.h"
#include "capture/video/frame.h"
#include "capture/video/source.h"
#include "platform/mfcapture.h"

namespace capture::video::camera::mfce {

class MFCESource : public capture::video::Source, public capture::audio::Source {
 public:
  MFCESource(IMFActivate* audioDevice, IMFActivate* videoDevice, bool selected);
  ~MFCESource() override;
  MFCESource(const MFCESource&) = delete;
  MFCESource& operator=(const MFCESource&) = delete;

  int32_t type() override;
  std::string name() override;
  void startPreview() override;
  void stopPreview() override;
  void capture() override {}
  void stopCapturing() override {}
  void startEncode(std::string filename) override;
  void stopEncode() override;
  void endClip() override;
  void finishClips(std::chrono::steady_clock::time_point deadline) override;
  bool selected() override { return isSelected; }

  bool preview(uint8_t* dst, uint32_t swapRedBlue, int32_t dstWidth, int32_t dstHeight) override;
  uint32_t width() override { return previewWidth; }
  uint32_t height() override { return previewHeight; }
  int32_t size() override {
    return static_cast<int32_t>(static_cast<uint32_t>(pixelWidth()) * (previewWidth * previewHeight));
  }
  int32_t pixelWidth() override { return 4; }
  int32_t channelOrder() override { return 1; }

  uint16_t channels() override { return 2; }
  double peak(int32_t channel) override;

  // Composes a diagnostic line from the device names and the text; the line goes nowhere.
  std::string log(const std::string& text);

  // The manager this source drives (for tests that look at its state).
  CaptureManager* manager() { return captureManager; }

 private:
  // Makes the engine again after a device failure ended it, and restarts the preview.
  void reopen();

  capture::video::FrameQueue* frameQueue = nullptr;
  CaptureManager* captureManager = nullptr;
  bool capturing = false;
  uint32_t previewWidth = 0;  // zero until the first successful startPreview()
  uint32_t previewHeight = 0;
  ComPtr<IMFActivate> audioDevice;
  ComPtr<IMFActivate> videoDevice;
  std::string audioName;
  std::string videoName;
  bool isSelected = false;
};

}  // namespace capture::video::camera::mfce
