// The DXGI device manager of the capture engine: it only lends the device it was given.
#include "platform/linux/mfcapture.h"

namespace platform {

namespace {

class DXGIDeviceManager : public ComObject<IMFDXGIDeviceManager, IID_IMFDXGIDeviceManager> {
 public:
  // Any token works as long as ResetDevice gets the same one back.
  DXGIDeviceManager() : token_(static_cast<UINT>(reinterpret_cast<uintptr_t>(this) >> 4)) {}
  UINT token() const { return token_; }

  HRESULT ResetDevice(IUnknown* device, UINT token) override {
    if (!device) return E_INVALIDARG;
    if (token != token_) return E_INVALIDARG;
    device_ = device;
    return S_OK;
  }

 private:
  UINT token_;
  ComPtr<IUnknown> device_;
};

}  // namespace

}  // namespace platform

HRESULT MFCreateDXGIDeviceManager(UINT* resetToken, IMFDXGIDeviceManager** manager) {
  if (!resetToken || !manager) return E_POINTER;
  auto* made = new platform::DXGIDeviceManager;
  *resetToken = made->token();
  *manager = made;
  return S_OK;
}
