// COM basics on Linux: per-thread apartments, class creation from our own table, task memory,
// property values and the UTF-16 conversions of the layer.
#include "platform/linux/com.h"

#include <codecvt>
#include <cstdlib>
#include <locale>

#include "platform/linux/com/classes.h"

namespace {

// The apartment of the calling thread: how often it was entered and in which mode.
struct Apartment {
  unsigned entries = 0;
  bool singleThreaded = false;
};
thread_local Apartment apartment;
thread_local DWORD lastError = 0;

using Utf16Converter = std::wstring_convert<std::codecvt_utf8_utf16<wchar_t>, wchar_t>;

}  // namespace

HRESULT CoInitializeEx(LPVOID, DWORD coinit) {
  const bool singleThreaded = (coinit & COINIT_APARTMENTTHREADED) != 0;
  if (apartment.entries > 0) {
    if (apartment.singleThreaded != singleThreaded) return RPC_E_CHANGED_MODE;
    ++apartment.entries;
    return S_FALSE;
  }
  apartment.entries = 1;
  apartment.singleThreaded = singleThreaded;
  return S_OK;
}

void CoUninitialize() {
  if (apartment.entries > 0) --apartment.entries;
}

// Windows lets threads without an apartment of their own use the process's implicit
// multithreaded apartment, and the capture threads rely on that; so creation does not
// demand CoInitializeEx on the calling thread.
HRESULT CoCreateInstance(REFCLSID clsid, IUnknown* outer, DWORD, REFIID riid, void** object) {
  if (!object) return E_POINTER;
  *object = nullptr;
  if (outer) return CLASS_E_NOAGGREGATION;
  const platform::ClassEntry* entry = platform::findClass(clsid);
  if (!entry) return REGDB_E_CLASSNOTREG;
  return entry->create(riid, object);
}

LPVOID CoTaskMemAlloc(SIZE_T size) { return std::malloc(size ? size : 1); }
void CoTaskMemFree(LPVOID memory) { std::free(memory); }

HRESULT PropVariantClear(PROPVARIANT* value) {
  if (!value) return E_INVALIDARG;
  if (value->vt == VT_LPWSTR) CoTaskMemFree(value->pwszVal);
  if (value->vt == VT_CLSID) CoTaskMemFree(value->puuid);
  if (value->vt == VT_UNKNOWN && value->punkVal) value->punkVal->Release();
  if (value->vt == (VT_VECTOR | VT_UI1)) CoTaskMemFree(value->caub.pElems);
  PropVariantInit(value);
  return S_OK;
}

HRESULT PropVariantCopy(PROPVARIANT* destination, const PROPVARIANT* source) {
  if (!destination || !source) return E_INVALIDARG;
  PROPVARIANT copy = *source;
  switch (source->vt) {
    case VT_EMPTY:
    case VT_I4:
    case VT_R8:
    case VT_UI4:
    case VT_UI8: break;
    case VT_LPWSTR:
      if (source->pwszVal) {
        size_t units = 0;
        while (source->pwszVal[units]) ++units;
        copy.pwszVal = platform::taskString(std::wstring(source->pwszVal, units));
      }
      break;
    case VT_CLSID:
      if (source->puuid) {
        copy.puuid = static_cast<GUID*>(CoTaskMemAlloc(sizeof(GUID)));
        *copy.puuid = *source->puuid;
      }
      break;
    case VT_UNKNOWN:
      if (source->punkVal) source->punkVal->AddRef();
      break;
    case VT_VECTOR | VT_UI1:
      copy.caub.pElems = static_cast<BYTE*>(CoTaskMemAlloc(source->caub.cElems));
      if (source->caub.cElems) std::memcpy(copy.caub.pElems, source->caub.pElems, source->caub.cElems);
      break;
    default: return hresult(0x80030001);  // STG_E_INVALIDFUNCTION: a type this layer does not hand out
  }
  *destination = copy;
  return S_OK;
}

HLOCAL LocalAlloc(UINT flags, SIZE_T bytes) {
  return (flags & LMEM_ZEROINIT) ? std::calloc(bytes ? bytes : 1, 1) : std::malloc(bytes ? bytes : 1);
}
HLOCAL LocalFree(HLOCAL memory) {
  std::free(memory);
  return nullptr;
}

DWORD GetLastError() { return lastError; }
void SetLastError(DWORD error) { lastError = error; }

namespace platform {

std::string narrow(const wchar_t* utf16) {
  if (!utf16) return {};
  std::wstring units(utf16);
  return Utf16Converter().to_bytes(units);
}

std::wstring widen(const std::string& utf8) { return Utf16Converter().from_bytes(utf8); }

wchar_t* taskString(const std::wstring& utf16) {
  auto* copy = static_cast<wchar_t*>(CoTaskMemAlloc((utf16.size() + 1) * sizeof(wchar_t)));
  std::memcpy(copy, utf16.c_str(), (utf16.size() + 1) * sizeof(wchar_t));
  return copy;
}

}  // namespace platform
