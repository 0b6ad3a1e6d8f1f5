// Capture-device enumeration: V4L2 video capture devices by card name, then the lavfi test
// cameras of TAVIO_TEST_CAMERAS; PulseAudio sources that are not monitors by description.
#include <dirent.h>
#include <fcntl.h>
#include <linux/videodev2.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <stdexcept>
#include <string>
#include <vector>

#include "capture/check.h"
#include "capture/log.h"
#include "platform/linux/mf/mfattributes.h"
#include "platform/linux/mfcapture.h"
#include "platform/linux/capture/testcameragraph.h"
#include "platform/linux/pulse/blockingconnection.h"

namespace platform {

namespace {

class DeviceActivate : public Attributes<IMFActivate, IID_IMFActivate> {
 public:
};

struct Device {
  std::wstring name;
  std::wstring link;
  UINT32 rate = 0;
  UINT32 channels = 0;
};

std::vector<Device> videoDevices() {
  std::vector<Device> devices;
  std::vector<int> numbers;
  if (DIR* dir = opendir("/dev")) {
    while (dirent* entry = readdir(dir)) {
      if (std::strncmp(entry->d_name, "video", 5) == 0 && entry->d_name[5] >= '0' && entry->d_name[5] <= '9')
        numbers.push_back(std::atoi(entry->d_name + 5));
    }
    closedir(dir);
  }
  std::sort(numbers.begin(), numbers.end());
  for (int number : numbers) {
    const std::string path = "/dev/video" + std::to_string(number);
    int fd = open(path.c_str(), O_RDWR | O_NONBLOCK);
    if (fd < 0) continue;
    v4l2_capability caps{};
    if (ioctl(fd, VIDIOC_QUERYCAP, &caps) == 0) {
      // A camera often has a second node for metadata; only capture nodes are cameras.
      const uint32_t nodeCaps = (caps.capabilities & V4L2_CAP_DEVICE_CAPS) ? caps.device_caps : caps.capabilities;
      if (nodeCaps & V4L2_CAP_VIDEO_CAPTURE)
        devices.push_back({widen(reinterpret_cast<const char*>(caps.card)), widen("v4l2:" + path)});
    }
    close(fd);
  }
  // Test cameras: "Name=lavfi graph" entries separated by ';'; a graph written "h264:<graph>"
  // makes a camera that sends H.264 (the engine reads the link "lavfi:h264:<graph>"). Graphs that
  // could touch files are refused (testcameragraph.h).
  if (const char* list = std::getenv("TAVIO_TEST_CAMERAS")) {
    std::string text = list;
    size_t start = 0;
    while (start <= text.size()) {
      size_t end = text.find(';', start);
      if (end == std::string::npos) end = text.size();
      const std::string entry = text.substr(start, end - start);
      const size_t equals = entry.find('=');
      if (equals != std::string::npos && equals > 0 && equals + 1 < entry.size()) {
        const std::string graph = entry.substr(equals + 1);
        static const char h264[] = "h264:";
        const bool encodes = graph.compare(0, sizeof h264 - 1, h264) == 0;
        const std::string refused = testcamera::refusedFilter(encodes ? graph.substr(sizeof h264 - 1) : graph);
        if (refused.empty()) {
          devices.push_back({widen(entry.substr(0, equals)), widen("lavfi:" + graph)});
        } else {
          // The camera is left out and the host is told why.
          const std::string message = "Test camera " + entry.substr(0, equals) + " refused: \"" + refused +
                                      "\" is not a picture generator or a drawing filter";
          try {  // the warning names the file's first path, which hosts may match on
            capture::checkResult("native/platform/linux/mfdevices", 92, E_ACCESSDENIED, message.c_str());
          } catch (const std::runtime_error& error) {
            capture::logWarning(error.what());
          }
        }
      }
      start = end + 1;
    }
  }
  return devices;
}

void onSource(pa_context*, const pa_source_info* info, int eol, void* devices) {
  if (eol != 0 || !info) return;
  if (info->monitor_of_sink != PA_INVALID_INDEX) return;  // what a sink plays is no microphone
  static_cast<std::vector<Device>*>(devices)->push_back({widen(info->description ? info->description : info->name),
                                                         widen(info->name), info->sample_spec.rate,
                                                         info->sample_spec.channels});
}

// Sources of the PulseAudio server; none when no server answers (no autospawn).
std::vector<Device> audioDevices() {
  std::vector<Device> devices;
  pulse::BlockingConnection connection("tavio_capture devices");
  if (connection.connected()) connection.run(pa_context_get_source_info_list(connection.context(), onSource, &devices));
  return devices;
}

}  // namespace

HRESULT createDeviceActivate(REFGUID category, const std::wstring& friendlyName, const std::wstring& link,
                             IMFActivate** activate) {
  if (!activate) return E_POINTER;
  *activate = nullptr;
  ComPtr<DeviceActivate> device;
  device.Attach(new DeviceActivate);
  HRESULT hr = device->SetGUID(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE, category);
  if (SUCCEEDED(hr)) hr = device->SetString(MF_DEVSOURCE_ATTRIBUTE_FRIENDLY_NAME, friendlyName.c_str());
  if (SUCCEEDED(hr))
    hr = device->SetString(category == MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_GUID
                               ? MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_ENDPOINT_ID
                               : MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_SYMBOLIC_LINK,
                           link.c_str());
  if (FAILED(hr)) return hr;
  *activate = device.Detach();
  return S_OK;
}

}  // namespace platform

HRESULT MFEnumDeviceSources(IMFAttributes* attributes, IMFActivate*** devices, UINT32* count) {
  if (!attributes || !devices || !count) return E_POINTER;
  *devices = nullptr;
  *count = 0;
  GUID category = GUID_NULL;
  if (FAILED(attributes->GetGUID(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE, &category))) return E_INVALIDARG;
  std::vector<platform::Device> found;
  if (category == MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID)
    found = platform::videoDevices();
  else if (category == MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_GUID)
    found = platform::audioDevices();
  else
    return E_INVALIDARG;

  std::vector<ComPtr<IMFActivate>> made;
  for (const platform::Device& device : found) {
    ComPtr<IMFActivate> activate;
    HRESULT hr = platform::createDeviceActivate(category, device.name, device.link, activate.GetAddressOf());
    if (SUCCEEDED(hr) && device.rate) hr = activate->SetUINT32(platform::deviceAudioRate, device.rate);
    if (SUCCEEDED(hr) && device.channels) hr = activate->SetUINT32(platform::deviceAudioChannels, device.channels);
    if (FAILED(hr)) return hr;
    made.push_back(std::move(activate));
  }
  // NOLINTNEXTLINE(bugprone-sizeof-expression): an array of interface pointers
  auto** array = static_cast<IMFActivate**>(CoTaskMemAlloc(sizeof(IMFActivate*) * (made.empty() ? 1 : made.size())));
  if (!array) return E_OUTOFMEMORY;
  for (size_t i = 0; i < made.size(); ++i) array[i] = made[i].Detach();
  *devices = array;
  *count = static_cast<UINT32>(made.size());
  return S_OK;
}
