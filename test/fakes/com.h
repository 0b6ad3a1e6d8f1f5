// What every fake COM object needs on both platforms: a reference count, QueryInterface over the
// IIDs it answers, and, on Windows, E_NOTIMPL for the SDK methods the capture code never calls.
#pragma once

#include <atomic>
#include <cstring>
#include <string>

#include "platform/com.h"

#ifdef _WIN32
#include "fakes/windows/stubs.h"
#endif

namespace fakes {

#ifndef _WIN32
// Our own declarations hold only what the capture code calls; the fakes implement all of it.
template <class I>
struct Stub : I {};
#endif

// `I` is the most derived interface the fake implements; `Iids` are every IID it answers besides
// IUnknown. The object deletes itself with its last reference.
template <class I, const GUID&... Iids>
class ComObject : public Stub<I> {
 public:
  virtual ~ComObject() = default;
  HRESULT STDMETHODCALLTYPE QueryInterface(REFIID riid, void** object) override {
    if (!object) return E_POINTER;
    if (riid == IID_IUnknown || ((riid == Iids) || ...)) {
      *object = static_cast<I*>(this);
      AddRef();
      return S_OK;
    }
    *object = nullptr;
    return E_NOINTERFACE;
  }
  ULONG STDMETHODCALLTYPE AddRef() override { return ++references_; }
  ULONG STDMETHODCALLTYPE Release() override {
    ULONG left = --references_;
    if (left == 0) delete this;
    return left;
  }

 private:
  std::atomic<ULONG> references_{1};
};

// A CoTaskMemAlloc'ed copy of a UTF-16 string, as GetId hands one out.
inline wchar_t* taskString(const std::wstring& text) {
  auto* copy = static_cast<wchar_t*>(CoTaskMemAlloc((text.size() + 1) * sizeof(wchar_t)));
  std::memcpy(copy, text.c_str(), (text.size() + 1) * sizeof(wchar_t));
  return copy;
}

}  // namespace fakes
