// User32: monitor descriptions and messages to windows.
#pragma once

#ifdef _WIN32
#include "platform/com.h"
#else
#include "platform/linux/user32.h"
#endif
