// Attribute stores and media types on Linux, answering with Media Foundation's codes: a missing
// key is MF_E_ATTRIBUTENOTFOUND, a key of another type MF_E_INVALIDTYPE.
#include "platform/linux/mf/mfattributes.h"

#include <algorithm>
#include <cstddef>
#include <cstring>

namespace platform {

namespace {

constexpr HRESULT insufficientBuffer = HRESULT_FROM_WIN32(122);  // ERROR_INSUFFICIENT_BUFFER

bool storable(VARTYPE vt) {
  return vt == VT_UI4 || vt == VT_UI8 || vt == VT_CLSID || vt == VT_LPWSTR || vt == (VT_VECTOR | VT_UI1) ||
         vt == VT_UNKNOWN;
}

size_t units(const wchar_t* text) {
  size_t n = 0;
  while (text[n]) ++n;
  return n;
}

}  // namespace

AttributeStore::~AttributeStore() { deleteAllItems(); }

const PROPVARIANT* AttributeStore::find(REFGUID key) const {
  for (const auto& item : items_)
    if (item.first == key) return &item.second;
  return nullptr;
}

HRESULT AttributeStore::typed(REFGUID key, VARTYPE vt, const PROPVARIANT** value) const {
  const PROPVARIANT* found = find(key);
  if (!found) return MF_E_ATTRIBUTENOTFOUND;
  if (found->vt != vt) return MF_E_INVALIDTYPE;
  *value = found;
  return S_OK;
}

HRESULT AttributeStore::store(REFGUID key, const PROPVARIANT& value) {
  if (!storable(value.vt)) return MF_E_INVALIDTYPE;
  PROPVARIANT copy;
  PropVariantInit(&copy);
  HRESULT hr = PropVariantCopy(&copy, &value);
  if (FAILED(hr)) return hr;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  for (auto& item : items_) {
    if (item.first == key) {
      PropVariantClear(&item.second);
      item.second = copy;
      return S_OK;
    }
  }
  items_.emplace_back(key, copy);
  return S_OK;
}

HRESULT AttributeStore::getUINT32(REFGUID key, UINT32* value) {
  return read(key, VT_UI4, value, [](const PROPVARIANT& v) { return v.ulVal; });
}

HRESULT AttributeStore::getUINT64(REFGUID key, UINT64* value) {
  return read(key, VT_UI8, value, [](const PROPVARIANT& v) { return v.uhVal; });
}

HRESULT AttributeStore::getGUID(REFGUID key, GUID* value) {
  return read(key, VT_CLSID, value, [](const PROPVARIANT& v) { return *v.puuid; });
}

HRESULT AttributeStore::getAllocatedString(REFGUID key, LPWSTR* value, UINT32* length) {
  if (!value || !length) return E_POINTER;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  const PROPVARIANT* found;
  HRESULT hr = typed(key, VT_LPWSTR, &found);
  if (FAILED(hr)) return hr;
  const size_t n = units(found->pwszVal);
  *value = taskString(std::wstring(found->pwszVal, n));
  *length = static_cast<UINT32>(n);
  return S_OK;
}

HRESULT AttributeStore::getBlobSize(REFGUID key, UINT32* size) {
  if (!size) return E_POINTER;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  const PROPVARIANT* found;
  HRESULT hr = typed(key, VT_VECTOR | VT_UI1, &found);
  if (SUCCEEDED(hr)) *size = found->caub.cElems;
  return hr;
}

HRESULT AttributeStore::getBlob(REFGUID key, UINT8* buffer, UINT32 bufferSize, UINT32* size) {
  if (!buffer) return E_POINTER;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  const PROPVARIANT* found;
  HRESULT hr = typed(key, VT_VECTOR | VT_UI1, &found);
  if (FAILED(hr)) return hr;
  if (found->caub.cElems > bufferSize) return insufficientBuffer;
  if (found->caub.cElems) std::memcpy(buffer, found->caub.pElems, found->caub.cElems);
  if (size) *size = found->caub.cElems;
  return S_OK;
}

HRESULT AttributeStore::setItem(REFGUID key, REFPROPVARIANT value) { return store(key, value); }

HRESULT AttributeStore::deleteItem(REFGUID key) {
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  auto it = std::find_if(items_.begin(), items_.end(), [&](const auto& item) { return item.first == key; });
  if (it != items_.end()) {
    PropVariantClear(&it->second);
    items_.erase(it);
  }
  return S_OK;  // deleting a missing key is no failure
}

HRESULT AttributeStore::deleteAllItems() {
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  for (auto& item : items_) PropVariantClear(&item.second);
  items_.clear();
  return S_OK;
}

HRESULT AttributeStore::setUINT32(REFGUID key, UINT32 value) {
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_UI4;
  v.ulVal = value;
  return store(key, v);
}

HRESULT AttributeStore::setUINT64(REFGUID key, UINT64 value) {
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_UI8;
  v.uhVal = value;
  return store(key, v);
}

HRESULT AttributeStore::setGUID(REFGUID key, REFGUID value) {
  GUID copy = value;
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_CLSID;
  v.puuid = &copy;
  return store(key, v);
}

HRESULT AttributeStore::setString(REFGUID key, LPCWSTR value) {
  if (!value) return E_INVALIDARG;
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_LPWSTR;
  v.pwszVal = const_cast<LPWSTR>(value);
  return store(key, v);
}

HRESULT AttributeStore::setBlob(REFGUID key, const UINT8* buffer, UINT32 size) {
  if (!buffer && size) return E_INVALIDARG;
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_VECTOR | VT_UI1;
  v.caub.cElems = size;
  v.caub.pElems = const_cast<UINT8*>(buffer);
  return store(key, v);
}

HRESULT AttributeStore::setUnknown(REFGUID key, IUnknown* value) {
  PROPVARIANT v;
  PropVariantInit(&v);
  v.vt = VT_UNKNOWN;
  v.punkVal = value;
  return store(key, v);
}

HRESULT AttributeStore::getCount(UINT32* count) {
  if (!count) return E_POINTER;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  *count = static_cast<UINT32>(items_.size());
  return S_OK;
}

HRESULT AttributeStore::copyAllItems(IMFAttributes* destination) {
  if (!destination) return E_POINTER;
  std::lock_guard<std::recursive_mutex> lock(mutex_);
  HRESULT hr = destination->DeleteAllItems();
  for (size_t i = 0; SUCCEEDED(hr) && i < items_.size(); ++i)
    hr = destination->SetItem(items_[i].first, items_[i].second);
  return hr;
}

namespace {

class AttributeObject : public Attributes<IMFAttributes> {};

class MediaType : public Attributes<IMFMediaType, IID_IMFMediaType> {
 public:
  HRESULT GetMajorType(GUID* majorType) override {
    if (!majorType) return E_POINTER;
    return GetGUID(MF_MT_MAJOR_TYPE, majorType);
  }
};

}  // namespace

}  // namespace platform

HRESULT MFCreateAttributes(IMFAttributes** attributes, UINT32) {
  if (!attributes) return E_POINTER;
  *attributes = new platform::AttributeObject();
  return S_OK;
}

HRESULT MFCreateMediaType(IMFMediaType** mediaType) {
  if (!mediaType) return E_POINTER;
  *mediaType = new platform::MediaType();
  return S_OK;
}

// Sets what Media Foundation derives from a wave format: major type, subtype (from the tag, or
// from SubFormat for the extensible layout), the five numbers, independence of samples, and for
// the extensible layout the channel mask and valid bits.
HRESULT MFInitMediaTypeFromWaveFormatEx(IMFMediaType* mediaType, const WAVEFORMATEX* format, UINT32 size) {
  if (!mediaType || !format) return E_POINTER;
  if (size < sizeof(WAVEFORMATEX)) return E_INVALIDARG;
  const bool extensible = format->wFormatTag == WAVE_FORMAT_EXTENSIBLE;
  if (extensible && (size < sizeof(WAVEFORMATEXTENSIBLE) || format->cbSize < 22)) return E_INVALIDARG;
  const auto* bytes = reinterpret_cast<const uint8_t*>(format);  // fields read by offset: the layout is packed
  HRESULT hr = mediaType->DeleteAllItems();
  auto set32 = [&](REFGUID key, UINT32 value) {
    if (SUCCEEDED(hr)) hr = mediaType->SetUINT32(key, value);
  };
  if (SUCCEEDED(hr)) hr = mediaType->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  if (SUCCEEDED(hr)) {
    GUID subtype = platform::mediaSubtype(format->wFormatTag);
    if (extensible) std::memcpy(&subtype, bytes + offsetof(WAVEFORMATEXTENSIBLE, SubFormat), sizeof subtype);
    hr = mediaType->SetGUID(MF_MT_SUBTYPE, subtype);
  }
  set32(MF_MT_AUDIO_NUM_CHANNELS, format->nChannels);
  set32(MF_MT_AUDIO_SAMPLES_PER_SECOND, format->nSamplesPerSec);
  set32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, format->nAvgBytesPerSec);
  set32(MF_MT_AUDIO_BLOCK_ALIGNMENT, format->nBlockAlign);
  if (format->wBitsPerSample) set32(MF_MT_AUDIO_BITS_PER_SAMPLE, format->wBitsPerSample);
  set32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
  if (extensible) {
    DWORD mask;
    WORD validBits;
    std::memcpy(&mask, bytes + offsetof(WAVEFORMATEXTENSIBLE, dwChannelMask), sizeof mask);
    std::memcpy(&validBits, bytes + offsetof(WAVEFORMATEXTENSIBLE, Samples), sizeof validBits);
    set32(MF_MT_AUDIO_CHANNEL_MASK, mask);
    if (validBits) set32(MF_MT_AUDIO_VALID_BITS_PER_SAMPLE, validBits);
  } else {
    set32(MF_MT_AUDIO_PREFER_WAVEFORMATEX, TRUE);
  }
  return hr;
}
