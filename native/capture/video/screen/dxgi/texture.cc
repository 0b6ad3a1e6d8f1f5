#include "capture/video/screen/dxgi/texture.h"

#include "capture/check.h"

namespace capture::video::screen::dxgi {

Device createDevice(IDXGIAdapter* adapter) {
  Device result;
  HRESULT hr = D3D11CreateDevice(adapter, D3D_DRIVER_TYPE_UNKNOWN, nullptr, D3D11_CREATE_DEVICE_BGRA_SUPPORT, nullptr,
                                 0, D3D11_SDK_VERSION, result.device.GetAddressOf(), &result.featureLevel,
                                 result.context.GetAddressOf());
  capture::checkResult("native/capture/video/screen/dxgi/texture", 30, hr, "Could not create DirectX 11 device.");
  return result;
}

D3D11_TEXTURE2D_DESC stagingTextureDesc(UINT width, UINT height) {
  D3D11_TEXTURE2D_DESC desc{};
  desc.Width = width;
  desc.Height = height;
  desc.MipLevels = 1;
  desc.ArraySize = 1;
  desc.Format = DXGI_FORMAT_B8G8R8A8_UNORM;
  desc.SampleDesc.Count = 1;
  desc.SampleDesc.Quality = 0;
  desc.Usage = D3D11_USAGE_STAGING;
  desc.BindFlags = 0;
  desc.CPUAccessFlags = D3D11_CPU_ACCESS_READ;
  desc.MiscFlags = 0;
  return desc;
}

ID3D11Texture2D* createStagingTexture(ID3D11Device* device, UINT width, UINT height) {
  D3D11_TEXTURE2D_DESC desc = stagingTextureDesc(width, height);
  ID3D11Texture2D* texture = nullptr;
  HRESULT hr = device->CreateTexture2D(&desc, nullptr, &texture);
  capture::checkResult("native/capture/video/screen/dxgi/texture", 40, hr, "Could not create Texture2D.");
  return texture;
}

}  // namespace capture::video::screen::dxgi
