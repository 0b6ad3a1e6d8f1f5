// The Direct3D 11 device of an adapter and the CPU-readable staging texture frames go through.
#pragma once

#include "platform/dxgi.h"

namespace capture::video::screen::dxgi {

struct Device {
  ComPtr<ID3D11Device> device;
  D3D_FEATURE_LEVEL featureLevel{};
  ComPtr<ID3D11DeviceContext> context;
};

Device createDevice(IDXGIAdapter* adapter);
D3D11_TEXTURE2D_DESC stagingTextureDesc(UINT width, UINT height);
ID3D11Texture2D* createStagingTexture(ID3D11Device* device, UINT width, UINT height);

}  // namespace capture::video::screen::dxgi
