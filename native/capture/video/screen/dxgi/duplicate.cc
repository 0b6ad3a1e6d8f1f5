#include "capture/video/screen/dxgi/duplicate.h"

#include "capture/check.h"

namespace capture::video::screen::dxgi {

IDXGIOutputDuplication* duplicateOutput(IDXGIOutput1* output, ID3D11Device* device) {
  IDXGIOutputDuplication* duplication = nullptr;
  HRESULT hr = output->DuplicateOutput(device, &duplication);
  capture::checkResult("native/capture/video/screen/dxgi/duplicate", 10, hr,
                       "Could not get output duplicator from device.");
  return duplication;
}

}  // namespace capture::video::screen::dxgi
