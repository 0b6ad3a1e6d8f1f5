#include "capture/video/screen/dxgi/capturemethod.h"

#include "capture/video/screen/dxgi/factory.h"
#include "capture/video/screen/dxgi/source.h"
#include "capture/video/screen/dxgi/texture.h"

namespace capture::video::screen::dxgi {

bool CaptureMethod::available() { return true; }

std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() {
  const std::vector<ComPtr<IDXGIAdapter1>> adapters = enumerateAdapters(createFactory().Get());
  int created = 0;
  std::vector<std::shared_ptr<capture::Source>> result;
  for (const ComPtr<IDXGIAdapter1>& adapter : adapters) {
    const std::vector<ComPtr<IDXGIOutput1>> outputs = enumerateOutputs(adapter.Get());
    const Device device = createDevice(adapter.Get());  // each source takes the immediate context itself
    for (const ComPtr<IDXGIOutput1>& output : outputs) {
      result.push_back(std::make_shared<Source>(output.Get(), device.device.Get(), created == 0));
      ++created;
    }
  }
  return result;
}

}  // namespace capture::video::screen::dxgi
