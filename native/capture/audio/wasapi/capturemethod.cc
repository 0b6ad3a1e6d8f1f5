#include "capture/audio/wasapi/capturemethod.h"

#include "capture/audio/wasapi/source.h"
#include "capture/check.h"
#include "platform/com.h"
#include "platform/wasapi.h"

namespace capture::audio::wasapi {

namespace {
constexpr const char* kFile = "native/capture/audio/wasapi/capturemethod";
}

bool CaptureMethod::available() { return true; }

// The default endpoint first, then every other active one in the platform's order; each source
// takes a reference of its own.
std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() {
  ComPtr<IMMDeviceEnumerator> enumerator;
  capture::checkResult(kFile, 26,
                       CoCreateInstance(CLSID_MMDeviceEnumerator, nullptr, CLSCTX_ALL, IID_IMMDeviceEnumerator,
                                        reinterpret_cast<void**>(enumerator.GetAddressOf())),
                       "Could not initialize IMMDeviceEnumerator.");
  ComPtr<IMMDevice> defaultEndpoint;
  capture::checkResult(kFile, 30,
                       enumerator->GetDefaultAudioEndpoint(eRender, eConsole, defaultEndpoint.GetAddressOf()),
                       "Could not get the default device.");
  LPWSTR defaultId = nullptr;
  capture::checkResult(kFile, 34, defaultEndpoint->GetId(&defaultId), "Unable to get the default device id.");
  const std::wstring defaultName(defaultId);
  CoTaskMemFree(defaultId);

  std::vector<std::shared_ptr<capture::Source>> result;
  result.push_back(std::make_shared<Source>(defaultEndpoint.Get(), true));

  ComPtr<IMMDeviceCollection> collection;
  capture::checkResult(kFile, 45,
                       enumerator->EnumAudioEndpoints(eRender, DEVICE_STATE_ACTIVE, collection.GetAddressOf()),
                       "Could not enumerate aaudio endpoints.");
  UINT count = 0;
  capture::checkResult(kFile, 50, collection->GetCount(&count), "Could not get the device collection count.");
  for (UINT i = 0; i < count; ++i) {
    ComPtr<IMMDevice> endpoint;
    capture::checkResult(kFile, 57, collection->Item(i, endpoint.GetAddressOf()), "Could not get IMMDevice");
    LPWSTR id = nullptr;
    capture::checkResult(kFile, 61, endpoint->GetId(&id), "Unable to get current device's id.");
    const bool isDefault = std::wstring(id) == defaultName;
    CoTaskMemFree(id);
    if (!isDefault) result.push_back(std::make_shared<Source>(endpoint.Get(), false));
  }
  return result;
}

}  // namespace capture::audio::wasapi
