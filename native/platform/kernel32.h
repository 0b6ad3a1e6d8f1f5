// Kernel32 events, waits and power requests, debugger output; PathFindExtensionW (shlwapi).
#pragma once

#ifdef _WIN32
#include "platform/com.h"
#include <shlwapi.h>
#else
#include "platform/linux/kernel32.h"
#endif
