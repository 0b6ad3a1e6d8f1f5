#include "discovery.h"

#include <stdexcept>

#include "capture/audio/wasapi/capturemethod.h"
#include "capture/check.h"
#include "capture/log.h"
#include "capture/video/camera/mfce/mfcecapturemethod.h"
#include "capture/video/screen/dxgi/capturemethod.h"
#include "platform/com.h"

namespace capture {

namespace {

void append(SourceList& sources, SourceList found) {
  for (auto& source : found) sources.push_back(std::move(source));
}

// A step that fails is a warning line and costs only what it would have done.
template <class Step>
void orWarn(Step step) {
  try {
    step();
  } catch (const std::runtime_error& e) {
    logWarning(e.what());
  }
}

}  // namespace

void discoverSources(SourceList& sources) {
  const size_t firstNew = sources.size();
  {
    video::camera::mfce::MFCECaptureMethod cameras;
    append(sources, cameras.sources());
    for (auto& microphone : cameras.audioSources()) sources.push_back(microphone);
  }

  try {
    checkResult("native/interface", 47, CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED | COINIT_SPEED_OVER_MEMORY),
                "Failed to initialize the COM library.");
  } catch (const std::runtime_error&) {
    CoUninitialize();
  }

  // A machine without a playback endpoint (no sound server, or one without sinks) costs the
  // endpoints only: the cameras found above and the displays below are started and announced.
  orWarn([&] { append(sources, audio::wasapi::CaptureMethod().sources()); });

  // Sources of an earlier initialize already run; starting them again from here would race
  // the screen pump on displays, so only this call's sources are started.
  for (size_t i = firstNew; i < sources.size(); ++i) {
    std::shared_ptr<Source> source = sources[i];
    orWarn([&] { source->capture(); });
    orWarn([&] { source->startPreview(); });
  }

  // A display the grab cannot handle costs the displays, not the cameras and endpoints found
  // above: they are announced all the same.
  orWarn([&] { append(sources, video::screen::dxgi::CaptureMethod().sources()); });
}

}  // namespace capture
