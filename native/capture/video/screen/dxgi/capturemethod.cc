#include "capture/video/screen/dxgi/capturemethod.h"

#include "capture/video/screen/dxgi/factory.h"
#include "capture/held.h"
#include "capture/video/screen/dxgi/source.h"
#include "capture/video/screen/dxgi/texture.h"

namespace capture::video::screen::dxgi {

namespace {

// Releases what an enumeration still holds when a step throws.
template <class T>
struct HeldList {
  std::vector<T*> items;
  ~HeldList() {
    for (T*& item : items) release(item);
  }
};

}  // namespace

bool CaptureMethod::available() { return true; }

std::vector<std::shared_ptr<capture::Source>> CaptureMethod::sources() {
  HeldList<IDXGIAdapter1> adapters;
  {
    IDXGIFactory1* factory = createFactory();
    adapters.items = enumerateAdapters(factory);
    factory->Release();
  }
  int created = 0;
  std::vector<std::shared_ptr<capture::Source>> result;
  for (IDXGIAdapter1*& adapter : adapters.items) {
    HeldList<IDXGIOutput1> outputs;
    outputs.items = enumerateOutputs(adapter);
    Device device = createDevice(adapter);
    release(device.context);  // each source takes the immediate context itself
    HeldList<ID3D11Device> held;
    held.items.push_back(device.device);
    release(adapter);
    for (IDXGIOutput1* output : outputs.items) {
      result.push_back(std::make_shared<Source>(output, device.device, created == 0));
      ++created;
    }
  }
  return result;
}

}  // namespace capture::video::screen::dxgi
