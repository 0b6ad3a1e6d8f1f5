// The attribute store behind every Linux object that is an IMFAttributes (media types, samples,
// attribute stores, and whatever else derives from the interface: activation objects, events).
// A class gets the whole interface by deriving from platform::Attributes<I, IIDs...>.
#pragma once

#include <mutex>
#include <utility>
#include <vector>

#include "platform/linux/mf.h"

namespace platform {

// Items keyed by GUID in insertion order, each holding its own copy of the value. Safe to use from
// several threads, as Media Foundation's stores are.
class AttributeStore {
 public:
  AttributeStore() = default;
  AttributeStore(const AttributeStore&) = delete;
  AttributeStore& operator=(const AttributeStore&) = delete;
  ~AttributeStore();

  HRESULT getUINT32(REFGUID key, UINT32* value);
  HRESULT getUINT64(REFGUID key, UINT64* value);
  HRESULT getGUID(REFGUID key, GUID* value);
  HRESULT getAllocatedString(REFGUID key, LPWSTR* value, UINT32* length);
  HRESULT getBlobSize(REFGUID key, UINT32* size);
  HRESULT getBlob(REFGUID key, UINT8* buffer, UINT32 bufferSize, UINT32* size);
  HRESULT setItem(REFGUID key, REFPROPVARIANT value);
  HRESULT deleteItem(REFGUID key);
  HRESULT deleteAllItems();
  HRESULT setUINT32(REFGUID key, UINT32 value);
  HRESULT setUINT64(REFGUID key, UINT64 value);
  HRESULT setGUID(REFGUID key, REFGUID value);
  HRESULT setString(REFGUID key, LPCWSTR value);
  HRESULT setBlob(REFGUID key, const UINT8* buffer, UINT32 size);
  HRESULT setUnknown(REFGUID key, IUnknown* value);
  HRESULT getCount(UINT32* count);
  HRESULT copyAllItems(IMFAttributes* destination);

 private:
  // The value of key, or null; call with the lock held.
  const PROPVARIANT* find(REFGUID key) const;
  // Stores a copy of value under key (replacing an earlier value).
  HRESULT store(REFGUID key, const PROPVARIANT& value);
  // The item of key if its type is vt: S_OK, MF_E_ATTRIBUTENOTFOUND or MF_E_INVALIDTYPE.
  HRESULT typed(REFGUID key, VARTYPE vt, const PROPVARIANT** value) const;
  // Reads one value of kind vt under the lock; take(value) gives what goes to the caller.
  template <class Out, class Take>
  HRESULT read(REFGUID key, VARTYPE vt, Out* out, Take take) {
    if (!out) return E_POINTER;
    std::lock_guard<std::recursive_mutex> lock(mutex_);
    const PROPVARIANT* found;
    HRESULT hr = typed(key, vt, &found);
    if (SUCCEEDED(hr)) *out = take(*found);
    return hr;
  }

  std::recursive_mutex mutex_;
  std::vector<std::pair<GUID, PROPVARIANT>> items_;
};

// IMFAttributes for the interface I (IMFAttributes itself or an interface derived from it).
template <class I, const GUID&... Iids>
class Attributes : public ComObject<I, IID_IMFAttributes, Iids...> {
 public:
  HRESULT GetUINT32(REFGUID key, UINT32* value) override { return attributes_.getUINT32(key, value); }
  HRESULT GetUINT64(REFGUID key, UINT64* value) override { return attributes_.getUINT64(key, value); }
  HRESULT GetGUID(REFGUID key, GUID* value) override { return attributes_.getGUID(key, value); }
  HRESULT GetAllocatedString(REFGUID key, LPWSTR* value, UINT32* length) override {
    return attributes_.getAllocatedString(key, value, length);
  }
  HRESULT GetBlobSize(REFGUID key, UINT32* size) override { return attributes_.getBlobSize(key, size); }
  HRESULT GetBlob(REFGUID key, UINT8* buffer, UINT32 bufferSize, UINT32* size) override {
    return attributes_.getBlob(key, buffer, bufferSize, size);
  }
  HRESULT SetItem(REFGUID key, REFPROPVARIANT value) override { return attributes_.setItem(key, value); }
  HRESULT DeleteItem(REFGUID key) override { return attributes_.deleteItem(key); }
  HRESULT DeleteAllItems() override { return attributes_.deleteAllItems(); }
  HRESULT SetUINT32(REFGUID key, UINT32 value) override { return attributes_.setUINT32(key, value); }
  HRESULT SetUINT64(REFGUID key, UINT64 value) override { return attributes_.setUINT64(key, value); }
  HRESULT SetGUID(REFGUID key, REFGUID value) override { return attributes_.setGUID(key, value); }
  HRESULT SetString(REFGUID key, LPCWSTR value) override { return attributes_.setString(key, value); }
  HRESULT SetBlob(REFGUID key, const UINT8* buffer, UINT32 size) override {
    return attributes_.setBlob(key, buffer, size);
  }
  HRESULT SetUnknown(REFGUID key, IUnknown* value) override { return attributes_.setUnknown(key, value); }
  HRESULT GetCount(UINT32* count) override { return attributes_.getCount(count); }
  HRESULT CopyAllItems(IMFAttributes* destination) override { return attributes_.copyAllItems(destination); }

 protected:
  AttributeStore attributes_;
};

}  // namespace platform
