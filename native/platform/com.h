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
