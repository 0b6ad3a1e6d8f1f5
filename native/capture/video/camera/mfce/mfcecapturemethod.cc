#include "capture/video/camera/mfce/mfcecapturemethod.h"

#include <iostream>
#include <stdexcept>

#include "capture/check.h"
#include "capture/video/camera/mfce/mfcesource.h"
#include "platform/mfcapture.h"

namespace capture::video::camera::mfce {

namespace {

const char* const file = "native/capture/video/camera/mfce/mfcecapturemethod";

struct Category {
  const GUID& guid;
  int32_t createLine;
  const char* createMessage;
  int32_t setLine;
  const char* setMessage;
  int32_t enumerateLine;
  const char* enumerateMessage;
  const char* label;
};

const Category video{MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID,
                     74,
                     "Could not create video device source attribute",
                     71,
                     "Could not set video device source attribute GUID",
                     68,
                     "Could enumerate video device sources",
                     "MFCE video device sources"};

const Category audio{MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_GUID,
                     127,
                     "Could not create audio device source attribute",
                     124,
                     "Could not set audio device source attribute GUID",
                     121,
                     "Could enumerate audio device sources",
                     "MFCE audio device sources"};

// One source per device of the category, in the order the platform lists them; the first one is
// the selected one. A failure ends the list where it happened.
template <class Element>
std::vector<std::shared_ptr<Element>> enumerate(const Category& category, bool audioDevices) {
  std::vector<std::shared_ptr<Element>> result;
  try {
    IMFAttributes* attributes = nullptr;
    checkResult(file, category.createLine, MFCreateAttributes(&attributes, 1), category.createMessage);
    HRESULT hr = attributes->SetGUID(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE, category.guid);
    if (FAILED(hr)) attributes->Release();
    checkResult(file, category.setLine, hr, category.setMessage);

    IMFActivate** devices = nullptr;
    UINT32 count = 0;
    hr = MFEnumDeviceSources(attributes, &devices, &count);
    attributes->Release();
    checkResult(file, category.enumerateLine, hr, category.enumerateMessage);

    for (UINT32 i = 0; i < count; ++i) {
      auto* source = audioDevices ? new MFCESource(devices[i], nullptr, i == 0)
                                  : new MFCESource(nullptr, devices[i], i == 0);
      result.push_back(std::shared_ptr<Element>(source));
    }
    for (UINT32 i = 0; i < count; ++i) {
      if (devices[i]) {
        devices[i]->Release();
        devices[i] = nullptr;
      }
    }
    CoTaskMemFree(devices);
  } catch (const std::runtime_error& error) {
    const char* text = error.what();
    std::cout << "Failed to initialize: " << (text && *text ? text : "unknown exception") << std::endl
              << '\t' << category.label << std::endl;
  }
  return result;
}

}  // namespace

bool MFCECaptureMethod::available() { return true; }

std::vector<std::shared_ptr<capture::Source>> MFCECaptureMethod::sources() {
  return enumerate<capture::Source>(video, false);
}

std::vector<std::shared_ptr<capture::audio::Source>> MFCECaptureMethod::audioSources() {
  return enumerate<capture::audio::Source>(audio, true);
}

}  // namespace capture::video::camera::mfce
