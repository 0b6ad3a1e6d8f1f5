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
    ComPtr<IMFAttributes> attributes;
    checkResult(file, category.createLine, MFCreateAttributes(attributes.GetAddressOf(), 1), category.createMessage);
    checkResult(file, category.setLine, attributes->SetGUID(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE, category.guid),
                category.setMessage);

    IMFActivate** devices = nullptr;
    UINT32 count = 0;
    checkResult(file, category.enumerateLine, MFEnumDeviceSources(attributes.Get(), &devices, &count),
                category.enumerateMessage);
    // The list's references, let go whatever happens; each source takes one of its own.
    std::vector<ComPtr<IMFActivate>> listed(count);
    for (UINT32 i = 0; i < count; ++i) listed[i] = adopt(devices[i]);
    CoTaskMemFree(devices);

    for (UINT32 i = 0; i < count; ++i) {
      auto* source = audioDevices ? new MFCESource(listed[i].Get(), nullptr, i == 0)
                                  : new MFCESource(nullptr, listed[i].Get(), i == 0);
      result.push_back(std::shared_ptr<Element>(source));
    }
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
