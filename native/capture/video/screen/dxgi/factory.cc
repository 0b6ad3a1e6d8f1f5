#include "capture/video/screen/dxgi/factory.h"

#include "capture/check.h"

namespace capture::video::screen::dxgi {

IDXGIFactory1* createFactory() {
  IDXGIFactory1* factory = nullptr;
  HRESULT hr = CreateDXGIFactory1(IID_IDXGIFactory1, reinterpret_cast<void**>(&factory));
  capture::checkResult("native/capture/video/screen/dxgi/factory", 8, hr, "Could not create DXGI factory.");
  return factory;
}

std::vector<IDXGIAdapter1*> enumerateAdapters(IDXGIFactory1* factory) {
  std::vector<IDXGIAdapter1*> adapters;
  IDXGIAdapter1* adapter = nullptr;
  for (UINT i = 0; factory->EnumAdapters1(i, &adapter) == S_OK; ++i) adapters.push_back(adapter);
  return adapters;
}

std::vector<IDXGIOutput1*> enumerateOutputs(IDXGIAdapter1* adapter) {
  std::vector<IDXGIOutput1*> outputs;
  IDXGIOutput* output = nullptr;
  for (UINT i = 0; SUCCEEDED(adapter->EnumOutputs(i, &output)); ++i) {
    IDXGIOutput1* output1 = nullptr;
    output->QueryInterface(IID_IDXGIOutput1, reinterpret_cast<void**>(&output1));
    output->Release();
    outputs.push_back(output1);
  }
  return outputs;
}

}  // namespace capture::video::screen::dxgi
