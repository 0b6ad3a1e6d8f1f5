#include "capture/audio/wasapi/capturemethod.h"

#include "capture/audio/wasapi/source.h"
#include "capture/check.h"
#include "platform/wasapi.h"

namespace capture::audio::wasapi {

namespace {
constexpr const char* kFile = "native/capture/audio/wasapi/capturemethod";
}

bool CaptureMethod::available() { return true; }

// The default endpoint first, then every other active one in the platform's order. On a failure
// the references held so far are left as they are.
std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() {
  IMMDeviceEnumerator* enumerator = nullptr;
  capture::checkResult(kFile, 26,
                       CoCreateInstance(CLSID_MMDeviceEnumerator, nullptr, CLSCTX_ALL, IID_IMMDeviceEnumerator,
                                        reinterpret_cast<void**>(&enumerator)),
                       "Could not initialize IMMDeviceEnumerator.");
  IMMDevice* defaultEndpoint = nullptr;
  capture::checkResult(kFile, 30, enumerator->GetDefaultAudioEndpoint(eRender, eConsole, &defaultEndpoint),
                       "Could not get the default device.");
  LPWSTR defaultId = nullptr;
  capture::checkResult(kFile, 34, defaultEndpoint->GetId(&defaultId), "Unable to get the default device id.");

  std::vector<std::shared_ptr<capture::Source>> result;
  result.push_back(std::make_shared<Source>(defaultEndpoint, true));

  IMMDeviceCollection* collection = nullptr;
  capture::checkResult(kFile, 45, enumerator->EnumAudioEndpoints(eRender, DEVICE_STATE_ACTIVE, &collection),
                       "Could not enumerate aaudio endpoints.");
  enumerator->Release();
  UINT count = 0;
  capture::checkResult(kFile, 50, collection->GetCount(&count), "Could not get the device collection count.");
  for (UINT i = 0; i < count; ++i) {
    IMMDevice* endpoint = nullptr;
    capture::checkResult(kFile, 57, collection->Item(i, &endpoint), "Could not get IMMDevice");
    LPWSTR id = nullptr;
    capture::checkResult(kFile, 61, endpoint->GetId(&id), "Unable to get current device's id.");
    if (std::wstring(id) != std::wstring(defaultId)) {
      result.push_back(std::make_shared<Source>(endpoint, false));
    } else {
      endpoint->Release();
    }
    CoTaskMemFree(id);
  }
  CoTaskMemFree(defaultId);
  collection->Release();
  return result;
}

}  // namespace capture::audio::wasapi
