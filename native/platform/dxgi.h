// DXGI and Direct3D 11: factory, adapters, outputs, desktop duplication, devices, staging
// textures, and ID3D10Multithread.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
#include <d3d10.h>
#include <d3d11.h>
#include <dxgi1_2.h>
#else
#include "platform/linux/dxgi.h"
#endif
