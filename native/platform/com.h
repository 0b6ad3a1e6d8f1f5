// COM basics: HRESULT, GUID, IUnknown, apartments, task memory, PROPVARIANT, FormatMessageA.
#pragma once

#ifdef _WIN32
#ifndef NOMINMAX
#define NOMINMAX
#endif
#include <windows.h>
#include <objbase.h>
#include <propidl.h>
#else
#include "platform/linux/com.h"
#endif
