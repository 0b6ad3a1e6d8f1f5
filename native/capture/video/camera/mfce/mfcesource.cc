#include "capture/video/camera/mfce/mfcesource.h"

#include <new>
#include <vector>

#include "capture/check.h"
#include "capture/text.h"
#include "capture/video/scale.h"

namespace capture::video::camera::mfce {

namespace {

const char* const file = "native/capture/video/camera/mfce/mfcesource";

// The friendly name of a device, through the placeholder that only lasts while it is read.
std::string friendlyName(IMFActivate* device, const char* placeholder, int32_t line, const char* message) {
  std::string name = placeholder;
  wchar_t* text = nullptr;
  UINT32 length = 0;
  checkResult(file, line, device->GetAllocatedString(MF_DEVSOURCE_ATTRIBUTE_FRIENDLY_NAME, &text, &length), message);
  name = toUtf8(text ? std::wstring(text) : std::wstring());
  CoTaskMemFree(text);
  return name;
}

}  // namespace

MFCESource::MFCESource(IMFActivate* audioDevice, IMFActivate* videoDevice, bool selected) : isSelected(selected) {
  checkResult(file, 97, MFStartup(MF_VERSION, MFSTARTUP_FULL), "Could not start MFCE's Media Foundation");

  captureManager = new (std::nothrow) CaptureManager;
  if (!captureManager) checkResult(file, 94, E_OUTOFMEMORY, "Could not create MFCE's CaptureManager");

  checkResult(file, 91, captureManager->Initialize(audioDevice, videoDevice), "Could not initialize CaptureManager");
  // From here on every engine event is handled on the engine's thread and signals the manager.
  captureManager->eventCallback->direct = true;

  if (audioDevice) {
    this->audioDevice = audioDevice;
    audioName =
        friendlyName(audioDevice, "Webcam Audio Name Placeholder", 62, "Could not retrieve device audio friendly name");
  }
  if (videoDevice) {
    this->videoDevice = videoDevice;
    videoName =
        friendlyName(videoDevice, "Webcam Video Name Placeholder", 81, "Could not retrieve device video friendly name");
  }
  frameQueue = nullptr;
  capturing = false;
  log("MFCESource::MFCESource() exit...");
}

MFCESource::~MFCESource() {
  log("MFCESource::~MFCESource() enter...");
  if (captureManager) captureManager->StopPreview();
  // The wait in StopPreview can end early on a stale signal, so the engine may still deliver
  // pictures: the frame queue goes only after the engine.
  if (captureManager) {
    captureManager->DestroyEngine();
    delete captureManager;
    captureManager = nullptr;
  }
  if (frameQueue) {
    delete frameQueue;
    frameQueue = nullptr;
  }
  audioDevice.Reset();  // before Media Foundation shuts down
  videoDevice.Reset();
  checkResult(file, 133, MFShutdown(), "Could not shut down MFT.");
  log("MFCESource::~MFCESource() exit...");
}

int32_t MFCESource::type() { return audioDevice ? CameraMicrophone : CameraVideo; }

std::string MFCESource::name() {
  if (audioDevice) return audioName;
  if (videoDevice) return videoName;
  return "No audio or video device specified";
}

void MFCESource::startPreview() {
  log("MFCESource::startPreview() starting preview");
  if (!captureManager)
    checkResult(file, 236, E_POINTER,
                "MFCESource::startPreview() could not start preview: bad pCaptureManager pointer");
  if (!frameQueue) {
    UINT32 width = 640;
    UINT32 height = 480;
    checkResult(file, 218, captureManager->ConfigurePreview(width, height),
                "MFCESource::startPreview() could not start preview: ConfigurePreview() failed");
    previewWidth = width;
    previewHeight = height;
    frameQueue = new capture::video::FrameQueue(std::wstring(), width, height, static_cast<uint32_t>(channelOrder()));
  }
  if (!captureManager->HasEngine())
    checkResult(file, 230, MF_E_NOT_INITIALIZED,
                "MFCESource::startPreview() could not start preview: StartPreview() failed");
  if (!captureManager->IsPreviewing())
    checkResult(file, 230, captureManager->StartPreview(frameQueue),
                "MFCESource::startPreview() could not start preview: StartPreview() failed");
  log("MFCESource::startPreview() preview started");
}

void MFCESource::stopPreview() {
  log("MFCESource::stopPreview() stopping preview");
  if (!captureManager)
    checkResult(file, 259, E_POINTER, "MFCESource::stopPreview() could not stop preview: bad pointer");
  checkResult(file, 254, captureManager->StopPreview(),
              "MFCESource::stopPreview() could not stop preview: CaptureManager failed");
  log("MFCESource::stopPreview() preview stopped");
}

// A device that failed (a microphone whose sound server went away) ends the engine; the next
// clip makes it again, so the source records once the device is back. A device still gone
// fails the clip's start as before, with its warning line.
void MFCESource::reopen() {
  if (captureManager->HasEngine()) return;
  capturing = false;
  if (FAILED(captureManager->Initialize(audioDevice.Get(), videoDevice.Get()))) return;
  captureManager->eventCallback->direct = true;
  if (frameQueue && SUCCEEDED(captureManager->StartPreview(frameQueue))) log("MFCESource::reopen() preview started");
}

void MFCESource::startEncode(std::string filename) {
  if (!captureManager)
    checkResult(file, 295, E_POINTER, "MFCESource::startEncode() could not start preview: bad pointer");
  // A clip the engine ended by itself (a write that failed) leaves nothing to stop: a new one may start.
  if (capturing && !captureManager->IsRecording()) capturing = false;
  // A new clip while one records ends that one here, as on the other sources, so that every
  // started clip is a file of its own; only a clip that cannot be stopped keeps recording.
  if (capturing) stopEncode();
  if (capturing) {
    checkResult(file, 289, 1, "MFCESource::startEncode() could not start capture: already capturing");
    return;
  }
  reopen();
  log("MFCESource::startEncode() calling StartRecord");
  const std::wstring path = toWide(filename);
  const HRESULT hr = captureManager->StartRecord(path.c_str());
  if (SUCCEEDED(hr)) {
    capturing = true;
    log("MFCESource::startEncode() capture started");
  } else {
    log("MFCESource::startEncode() failed to start capture");
    // A refused name, a file that cannot be made, a size the encoder takes not: the host hears why.
    const std::string message = "MFCESource::startEncode() could not start capture of " + filename;
    checkResult(file, 312, hr, message.c_str());
  }
}

void MFCESource::stopEncode() {
  if (!captureManager)
    checkResult(file, 331, E_POINTER, "MFCESource::stopEncode() could not stop preview: bad pointer");
  if (!capturing) {
    checkResult(file, 325, 1, "MFCESource::stopEncode() could not stop capture: already stopped");
    return;
  }
  log("MFCESource::stopEncode() calling StopRecord");
  HRESULT hr = captureManager->StopRecord();
  log("MFCESource::stopEncode() post calling StopRecord");
  if (SUCCEEDED(hr)) {
    capturing = false;
    log("MFCESource::stopEncode() capture stopped");
  } else {
    log("MFCESource::stopEncode() failed to stop capture");
    checkResult(file, 343, hr, "MFCESource::stopEncode() could not stop capture");
  }
}

// The engine ends the clip now; finishClips (the rest of the stop) returns once the file is written.
void MFCESource::endClip() {
  if (capturing && captureManager) captureManager->BeginStopRecord();
}

void MFCESource::finishClips(std::chrono::steady_clock::time_point) {
  if (capturing) stopEncode();
}

bool MFCESource::preview(uint8_t* dst, uint32_t swapRedBlue, int32_t dstWidth, int32_t dstHeight) {
  if (!frameQueue) return false;
  std::lock_guard<std::mutex> lock(frameQueue->mutex);
  if (frameQueue->frames.empty()) return false;
  const Frame& newest = *frameQueue->frames.back();
  scaleFrame(newest.data.get(), previewWidth, previewHeight, dst, static_cast<uint64_t>(dstWidth),
             static_cast<uint64_t>(dstHeight), swapRedBlue);
  return true;
}

double MFCESource::peak(int32_t channel) {
  if (!captureManager) return 0.0;
  if (channel == 0) return captureManager->leftPeak.load();
  if (channel == 1) return captureManager->rightPeak.load();
  return 0.0;
}

std::string MFCESource::log(const std::string& text) {
  std::string line;
  if (audioDevice) line += audioName + ": ";
  if (videoDevice) line += videoName + ": ";
  line += text;
  return line;  // composed and dropped: nothing reads these lines
}

}  // namespace capture::video::camera::mfce
