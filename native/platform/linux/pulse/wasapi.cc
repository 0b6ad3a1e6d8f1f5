// Endpoint enumeration over PulseAudio: every sink is an active playback endpoint, identified by
// the sink's name, called by its description.
#include "platform/linux/wasapi.h"

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/linux/pulse/audioclient.h"
#include "platform/linux/pulse/pulse.h"

namespace platform::wasapi {

namespace {

using pulse::Connection;
using pulse::Sink;

class PropertyStore : public ComObject<IPropertyStore, IID_IPropertyStore> {
 public:
  explicit PropertyStore(std::wstring friendlyName) : friendlyName_(std::move(friendlyName)) {}

  HRESULT GetCount(DWORD* count) override {
    if (!count) return E_POINTER;
    *count = 1;
    return S_OK;
  }
  HRESULT GetValue(REFPROPERTYKEY key, PROPVARIANT* value) override {
    if (!value) return E_POINTER;
    PropVariantInit(value);
    // A key the store does not hold reads as an empty value, not as a failure.
    if (key.pid == PKEY_Device_FriendlyName.pid && key.fmtid == PKEY_Device_FriendlyName.fmtid) {
      value->vt = VT_LPWSTR;
      value->pwszVal = taskString(friendlyName_);
    }
    return S_OK;
  }

 private:
  std::wstring friendlyName_;
};

class Device : public ComObject<IMMDevice, IID_IMMDevice> {
 public:
  Device(std::shared_ptr<Connection> connection, const Sink& sink)
      : connection_(std::move(connection)), name_(sink.name), description_(sink.description) {}

  HRESULT Activate(REFIID iid, DWORD, PROPVARIANT*, void** object) override {
    if (!object) return E_POINTER;
    *object = nullptr;
    if (!(iid == IID_IAudioClient)) return E_NOINTERFACE;
    return createAudioClient(liveConnection(), name_, iid, object);
  }
  HRESULT OpenPropertyStore(DWORD, IPropertyStore** properties) override {
    if (!properties) return E_POINTER;
    *properties = new PropertyStore(widen(description_));
    return S_OK;
  }
  HRESULT GetId(LPWSTR* id) override {
    if (!id) return E_POINTER;
    *id = taskString(widen(name_));
    return S_OK;
  }

 private:
  // A sound server that went away and came back is a new server: the endpoint connects to it
  // anew, as a Windows endpoint works again once its audio service runs again. Clients made
  // earlier keep the connection they were made on.
  std::shared_ptr<Connection> liveConnection() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!connection_->ready()) {
      auto fresh = std::make_shared<Connection>();
      if (fresh->connected()) connection_ = std::move(fresh);
    }
    return connection_;
  }

  std::mutex mutex_;  // the capture and silence threads activate clients at the same time
  std::shared_ptr<Connection> connection_;
  std::string name_;
  std::string description_;
};

class Collection : public ComObject<IMMDeviceCollection, IID_IMMDeviceCollection> {
 public:
  explicit Collection(std::vector<ComPtr<IMMDevice>> devices) : devices_(std::move(devices)) {}

  HRESULT GetCount(UINT* count) override {
    if (!count) return E_POINTER;
    *count = static_cast<UINT>(devices_.size());
    return S_OK;
  }
  HRESULT Item(UINT index, IMMDevice** device) override {
    if (!device) return E_POINTER;
    *device = nullptr;
    if (index >= devices_.size()) return E_INVALIDARG;
    return devices_[index].CopyTo(device);
  }

 private:
  std::vector<ComPtr<IMMDevice>> devices_;
};

// Endpoints of the capture direction (microphones) are not offered: the add-on reaches those
// through the capture engine.
class Enumerator : public ComObject<IMMDeviceEnumerator, IID_IMMDeviceEnumerator> {
 public:
  Enumerator() : connection_(std::make_shared<Connection>()) {}

  HRESULT EnumAudioEndpoints(EDataFlow dataFlow, DWORD stateMask, IMMDeviceCollection** devices) override {
    if (!devices) return E_POINTER;
    *devices = nullptr;
    if (dataFlow != eRender) return dataFlow == eCapture || dataFlow == eAll ? E_NOTIMPL : E_INVALIDARG;
    if (stateMask == 0 || (stateMask & ~DEVICE_STATEMASK_ALL)) return E_INVALIDARG;
    std::vector<ComPtr<IMMDevice>> found;
    if (stateMask & DEVICE_STATE_ACTIVE)
      for (const Sink& sink : connection_->sinks()) found.emplace_back().Attach(new Device(connection_, sink));
    *devices = new Collection(std::move(found));
    return S_OK;
  }
  HRESULT GetDefaultAudioEndpoint(EDataFlow dataFlow, ERole role, IMMDevice** endpoint) override {
    if (!endpoint) return E_POINTER;
    *endpoint = nullptr;
    if (dataFlow != eRender) return dataFlow == eCapture ? E_NOTIMPL : E_INVALIDARG;
    if (role < eConsole || role >= ERole_enum_count) return E_INVALIDARG;
    // No server, or a server without a default sink: a machine without a playback endpoint.
    Sink sink;
    if (!connection_->defaultSink(sink)) return HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
    *endpoint = new Device(connection_, sink);
    return S_OK;
  }

 private:
  std::shared_ptr<Connection> connection_;
};

}  // namespace

HRESULT createDeviceEnumerator(REFIID riid, void** object) { return createInstance<Enumerator>(riid, object); }

}  // namespace platform::wasapi
