#include "capture/video/screen/dxgi/factory.h"

#include "capture/check.h"

namespace capture::video::screen::dxgi {

ComPtr<IDXGIFactory1> createFactory() {
  ComPtr<IDXGIFactory1> factory;
  HRESULT hr = CreateDXGIFactory1(IID_IDXGIFactory1, reinterpret_cast<void**>(factory.GetAddressOf()));
  capture::checkResult("native/capture/video/screen/dxgi/factory", 8, hr, "Could not create DXGI factory.");
  return factory;
}

std::vector<ComPtr<IDXGIAdapter1>> enumerateAdapters(IDXGIFactory1* factory) {
  std::vector<ComPtr<IDXGIAdapter1>> adapters;
  for (UINT i = 0;; ++i) {
    ComPtr<IDXGIAdapter1> adapter;
    if (factory->EnumAdapters1(i, adapter.GetAddressOf()) != S_OK) return adapters;
    adapters.push_back(std::move(adapter));
  }
}

std::vector<ComPtr<IDXGIOutput1>> enumerateOutputs(IDXGIAdapter1* adapter) {
  std::vector<ComPtr<IDXGIOutput1>> outputs;
  ComPtr<IDXGIOutput> output;
  for (UINT i = 0; SUCCEEDED(adapter->EnumOutputs(i, output.ReleaseAndGetAddressOf())); ++i) {
    ComPtr<IDXGIOutput1> output1;
    output->QueryInterface(IID_IDXGIOutput1, reinterpret_cast<void**>(output1.GetAddressOf()));
    outputs.push_back(std::move(output1));
  }
  return outputs;
}

}  // namespace capture::video::screen::dxgi
