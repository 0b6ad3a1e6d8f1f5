// Opening the DXGI factory and walking its adapters and their outputs.
#pragma once

#include <vector>

#include "platform/dxgi.h"

namespace capture::video::screen::dxgi {

ComPtr<IDXGIFactory1> createFactory();
// Adapters until the first index the factory does not answer with S_OK.
std::vector<ComPtr<IDXGIAdapter1>> enumerateAdapters(IDXGIFactory1* factory);
// The IDXGIOutput1 of each output until EnumOutputs fails.
std::vector<ComPtr<IDXGIOutput1>> enumerateOutputs(IDXGIAdapter1* adapter);

}  // namespace capture::video::screen::dxgi
