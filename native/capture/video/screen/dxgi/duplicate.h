// Starting desktop duplication of an output.
#pragma once

#include "platform/dxgi.h"

namespace capture::video::screen::dxgi {

IDXGIOutputDuplication* duplicateOutput(IDXGIOutput1* output, ID3D11Device* device);

}  // namespace capture::video::screen::dxgi
