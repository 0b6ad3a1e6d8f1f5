// DXGI factory, adapters and outputs: an adapter is an X screen of $DISPLAY, an output one of
// its RandR monitors, in the server's order.
#include <algorithm>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/linux/x11/display.h"
#include "platform/linux/x11/duplication.h"
#include "platform/linux/dxgi.h"

namespace platform::dxgi {

namespace {

class Output : public platform::ComObject<IDXGIOutput1, IID_IDXGIObject, IID_IDXGIOutput, IID_IDXGIOutput1> {
 public:
  Output(std::string display, int screen, const DXGI_OUTPUT_DESC& desc, xcb_atom_t name, std::string nameText)
      : display_(std::move(display)), screen_(screen), desc_(desc), name_(name), nameText_(std::move(nameText)) {}

  HRESULT GetDesc(DXGI_OUTPUT_DESC* desc) override {
    if (!desc) return E_INVALIDARG;
    *desc = desc_;
    return S_OK;
  }

  HRESULT DuplicateOutput(IUnknown* device, IDXGIOutputDuplication** duplication) override {
    if (!device || !duplication) return E_INVALIDARG;
    ComPtr<ID3D11Device> d3d;  // only a Direct3D 11 device can duplicate
    if (FAILED(device->QueryInterface(IID_ID3D11Device, reinterpret_cast<void**>(d3d.GetAddressOf()))))
      return E_INVALIDARG;
    return Duplication::open(display_, screen_, name_, nameText_, duplication);
  }

 private:
  std::string display_;
  int screen_;
  DXGI_OUTPUT_DESC desc_;
  xcb_atom_t name_;
  std::string nameText_;
};

std::string atomName(xcb_connection_t* connection, xcb_atom_t atom) {
  std::string text;
  if (xcb_get_atom_name_reply_t* reply =
          xcb_get_atom_name_reply(connection, xcb_get_atom_name(connection, atom), nullptr)) {
    text.assign(xcb_get_atom_name_name(reply), static_cast<size_t>(xcb_get_atom_name_name_length(reply)));
    free(reply);
  }
  return text;
}

class Adapter : public platform::ComObject<IDXGIAdapter1, IID_IDXGIObject, IID_IDXGIAdapter, IID_IDXGIAdapter1> {
 public:
  Adapter(std::string display, x11::Connection connection, int screen)
      : display_(std::move(display)), connection_(std::move(connection)), screen_(screen) {}

  HRESULT EnumOutputs(UINT index, IDXGIOutput** output) override {
    if (!output) return E_INVALIDARG;
    *output = nullptr;
    std::vector<x11::Monitor> monitors = x11::monitors(connection_.get(), screen_);
    if (index >= monitors.size()) return DXGI_ERROR_NOT_FOUND;
    const x11::Monitor& m = monitors[index];
    DXGI_OUTPUT_DESC desc{};
    std::string device = x11::displayDeviceName(x11::displayNumber(connection_.get(), screen_, m.name));
    std::copy(device.begin(), device.end(), desc.DeviceName);
    desc.DesktopCoordinates = {m.x, m.y, m.x + m.width, m.y + m.height};
    desc.AttachedToDesktop = TRUE;
    desc.Rotation = DXGI_MODE_ROTATION_IDENTITY;
    desc.Monitor = x11::monitorHandle(screen_, m.name);
    *output = new Output(display_, screen_, desc, m.name, atomName(connection_.get(), m.name));
    return S_OK;
  }

 private:
  std::string display_;
  x11::Connection connection_;
  int screen_;
};

class Factory : public platform::ComObject<IDXGIFactory1, IID_IDXGIObject, IID_IDXGIFactory, IID_IDXGIFactory1> {
 public:
  // No X server means a machine without adapters, not a failure.
  Factory() : display_(x11::displayName()), connection_(x11::connect(display_)) {}

  HRESULT EnumAdapters1(UINT index, IDXGIAdapter1** adapter) override {
    if (!adapter) return E_INVALIDARG;
    *adapter = nullptr;
    if (!connection_ || index >= static_cast<UINT>(x11::screenCount(connection_.get()))) return DXGI_ERROR_NOT_FOUND;
    *adapter = new Adapter(display_, connection_, static_cast<int>(index));
    return S_OK;
  }

 private:
  std::string display_;
  x11::Connection connection_;
};

}  // namespace

}  // namespace platform::dxgi

HRESULT CreateDXGIFactory1(REFIID riid, void** factory) {
  if (!factory) return E_INVALIDARG;
  *factory = nullptr;
  return platform::createInstance<platform::dxgi::Factory>(riid, factory);
}
