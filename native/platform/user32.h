// User32: monitor descriptions and messages to windows.
#pragma once

#include "platform/com.h"

#ifdef _WIN32
#else
#include "platform/linux/user32.h"
#endif
