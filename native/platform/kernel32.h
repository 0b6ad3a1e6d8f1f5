// Kernel32 events, waits and power requests, debugger output; PathFindExtensionW (shlwapi).
#pragma once

#include "platform/com.h"

#ifdef _WIN32
#include <shlwapi.h>
#else
#include "platform/linux/kernel32.h"
#endif
