// COM basics: HRESULT, GUID, IUnknown, apartments, task memory, PROPVARIANT, FormatMessageA, and
// ComPtr, the one holder of interface references.
#pragma once

#ifdef _WIN32
#ifndef NOMINMAX
#define NOMINMAX
#endif
#include <windows.h>
#include <objbase.h>
#include <propidl.h>
#include <wrl/client.h>
using Microsoft::WRL::ComPtr;
#else
#include "platform/linux/comptr.h"
#endif

// A holder that takes over a reference already counted, as a creating call hands it out.
// mingw-w64's ComPtr::Attach counts such a reference once more, so the capture code, which
// builds for Windows with mingw-w64 as well as with the SDK, adopts instead of attaching.
template <class T>
ComPtr<T> adopt(T* counted) {
  ComPtr<T> held;
  *held.GetAddressOf() = counted;
  return held;
}

// Whether the holder's reference is the only one left, so that what it holds may be written into
// again (read from the count a balanced AddRef and Release report).
template <class T>
bool heldOnlyBy(const ComPtr<T>& holder) {
  holder->AddRef();
  return holder->Release() == 1;
}
